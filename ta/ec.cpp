/*
 * ec.cpp - the EC provider: capability lists, purpose tables and
 * parameter getters.
 */
#include "algorithm_provider.h"

namespace {

constexpr uint32_t kDigests[] = {KM_DIGEST_MD5,       KM_DIGEST_SHA1,      KM_DIGEST_SHA_2_224,
                                 KM_DIGEST_SHA_2_256, KM_DIGEST_SHA_2_384, KM_DIGEST_SHA_2_512};
constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_PKCS8};
constexpr uint32_t kExportFormats[] = {KM_KEY_FORMAT_X509};

constexpr purpose_ops_t sign_table() {
    return purpose_ops_t{list_count_none,   list_write_none,      list_count_none,  list_write_none,
                         list_count<kDigests>, list_write<kDigests>, nullptr,          param_getter_none,
                         param_getter_none, param_getter_digest};
}

const purpose_ops_t ec_sign_ops = sign_table();
const purpose_ops_t ec_verify_ops = sign_table();

const purpose_ops_t *ec_get_purpose_ops(uint32_t purpose) {
    switch (purpose) {
    case KM_PURPOSE_SIGN:
        return &ec_sign_ops;
    case KM_PURPOSE_VERIFY:
        return &ec_verify_ops;
    default:
        return nullptr;
    }
}

} // namespace

const algorithm_provider_t ec_provider = {
    KM_ALGORITHM_EC,
    "EC",
    ec_get_purpose_ops,
    list_count<kImportFormats>,
    list_write<kImportFormats>,
    list_count<kExportFormats>,
    list_write<kExportFormats>,
    nullptr,
    nullptr,
    nullptr,
};
