/*
 * aes.cpp - the AES provider: capability lists, purpose tables and
 * parameter getters.
 */
#include "algorithm_provider.h"

namespace {

constexpr uint32_t kBlockModes[] = {KM_MODE_CBC, KM_MODE_ECB, KM_MODE_CTR, KM_MODE_GCM};
constexpr uint32_t kPaddings[] = {KM_PAD_NONE, KM_PAD_PKCS7};
constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_RAW};

// A padding is authorized only for a known block mode; none given means NONE.
uint32_t aes_get_padding(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t mode = 0;
    if (param_getter_block_mode(in_params, &mode) != 0)
        return 1;
    if (mode != KM_MODE_ECB && mode != KM_MODE_CBC && mode != KM_MODE_CTR && mode != KM_MODE_GCM)
        return 1;
    if (param_getter_padding(in_params, value) != 0)
        *value = KM_PAD_NONE;
    return 0;
}

// Keys and operations are not built into this TA yet: the tables answer
// capability queries and begin refuses with "purpose not implemented".
constexpr purpose_ops_t cipher_table() {
    // clang-format off
    return purpose_ops_t{.block_mode_count = list_count<kBlockModes>, .get_block_modes = list_write<kBlockModes>,
        .padding_count = list_count<kPaddings>, .get_paddings = list_write<kPaddings>,
        .digest_count = list_count_none, .get_digests = list_write_none,
        .create_operation = nullptr,
        .get_padding = aes_get_padding, .get_block_mode = param_getter_block_mode, .get_digest = param_getter_none,
    };
    // clang-format on
}

const purpose_ops_t aes_encrypt_ops = cipher_table();
const purpose_ops_t aes_decrypt_ops = cipher_table();

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t aes_provider = {.algorithm = KM_ALGORITHM_AES, .name = "AES",
    .get_purpose_ops = purposes_of<&aes_encrypt_ops, &aes_decrypt_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count_none, .get_export_formats = list_write_none,
    .generate_key = nullptr, .import_key = nullptr, .export_key = export_key_unsupported,
};
// clang-format on
