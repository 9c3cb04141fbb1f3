/*
 * rsa.cpp - the RSA provider: capability lists, purpose tables and
 * parameter getters.
 */
#include "algorithm_provider.h"

namespace {

constexpr uint32_t kCipherPaddings[] = {KM_PAD_NONE, KM_PAD_RSA_PKCS1_1_5_ENCRYPT, KM_PAD_RSA_OAEP};
constexpr uint32_t kSignPaddings[] = {KM_PAD_NONE, KM_PAD_RSA_PSS, KM_PAD_RSA_PKCS1_1_5_SIGN};
constexpr uint32_t kDigests[] = {KM_DIGEST_NONE,      KM_DIGEST_MD5,       KM_DIGEST_SHA1,     KM_DIGEST_SHA_2_224,
                                 KM_DIGEST_SHA_2_256, KM_DIGEST_SHA_2_384, KM_DIGEST_SHA_2_512};
constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_PKCS8};
constexpr uint32_t kExportFormats[] = {KM_KEY_FORMAT_X509};

// A digest matters for encryption only with OAEP.
uint32_t cipher_get_digest(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t padding = 0;
    if (param_getter_padding(in_params, &padding) != 0 || padding != KM_PAD_RSA_OAEP)
        return 1;
    return param_getter_digest(in_params, value);
}

uint32_t sign_get_digest(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t padding = 0;
    if (param_getter_padding(in_params, &padding) != 0)
        return 1;
    if (padding != KM_PAD_NONE && padding != KM_PAD_RSA_PSS && padding != KM_PAD_RSA_PKCS1_1_5_SIGN)
        return 1;
    return param_getter_digest(in_params, value);
}

constexpr purpose_ops_t cipher_table() {
    return purpose_ops_t{list_count_none,           list_write_none,    list_count<kCipherPaddings>,
                         list_write<kCipherPaddings>, list_count<kDigests>, list_write<kDigests>,
                         nullptr,                   param_getter_padding, param_getter_none,
                         cipher_get_digest};
}

constexpr purpose_ops_t sign_table() {
    return purpose_ops_t{list_count_none,         list_write_none,    list_count<kSignPaddings>,
                         list_write<kSignPaddings>, list_count<kDigests>, list_write<kDigests>,
                         nullptr,                 param_getter_padding, param_getter_none,
                         sign_get_digest};
}

const purpose_ops_t rsa_encrypt_ops = cipher_table();
const purpose_ops_t rsa_decrypt_ops = cipher_table();
const purpose_ops_t rsa_sign_ops = sign_table();
const purpose_ops_t rsa_verify_ops = sign_table();

const purpose_ops_t *rsa_get_purpose_ops(uint32_t purpose) {
    switch (purpose) {
    case KM_PURPOSE_ENCRYPT:
        return &rsa_encrypt_ops;
    case KM_PURPOSE_DECRYPT:
        return &rsa_decrypt_ops;
    case KM_PURPOSE_SIGN:
        return &rsa_sign_ops;
    case KM_PURPOSE_VERIFY:
        return &rsa_verify_ops;
    default:
        return nullptr;
    }
}

} // namespace

const algorithm_provider_t rsa_provider = {
    KM_ALGORITHM_RSA,
    "RSA",
    rsa_get_purpose_ops,
    list_count<kImportFormats>,
    list_write<kImportFormats>,
    list_count<kExportFormats>,
    list_write<kExportFormats>,
    nullptr,
    nullptr,
    nullptr,
};
