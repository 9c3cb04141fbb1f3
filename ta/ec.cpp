/*
 * ec.cpp - the EC provider: capability lists, purpose tables and
 * parameter getters.
 */
#include "algorithm_provider.h"

namespace {

constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_PKCS8};
constexpr uint32_t kExportFormats[] = {KM_KEY_FORMAT_X509};

// Keys and operations are not built into this TA yet: the tables answer
// capability queries and begin refuses with "purpose not implemented".
const purpose_ops_t ec_sign_ops = digest_signing_table(nullptr);
const purpose_ops_t ec_verify_ops = digest_signing_table(nullptr);

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t ec_provider = {.algorithm = KM_ALGORITHM_EC, .name = "EC",
    .get_purpose_ops = purposes_of<nullptr, nullptr, &ec_sign_ops, &ec_verify_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count<kExportFormats>, .get_export_formats = list_write<kExportFormats>,
    .generate_key = nullptr, .import_key = nullptr, .export_key = nullptr,
};
// clang-format on
