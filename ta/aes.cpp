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

constexpr purpose_ops_t cipher_table() {
    return purpose_ops_t{list_count<kBlockModes>, list_write<kBlockModes>, list_count<kPaddings>,
                         list_write<kPaddings>,   list_count_none,         list_write_none,
                         nullptr,                 aes_get_padding,         param_getter_block_mode,
                         param_getter_none};
}

const purpose_ops_t aes_encrypt_ops = cipher_table();
const purpose_ops_t aes_decrypt_ops = cipher_table();

const purpose_ops_t *aes_get_purpose_ops(uint32_t purpose) {
    switch (purpose) {
    case KM_PURPOSE_ENCRYPT:
        return &aes_encrypt_ops;
    case KM_PURPOSE_DECRYPT:
        return &aes_decrypt_ops;
    default:
        return nullptr;
    }
}

} // namespace

const algorithm_provider_t aes_provider = {
    KM_ALGORITHM_AES,
    "AES",
    aes_get_purpose_ops,
    list_count<kImportFormats>,
    list_write<kImportFormats>,
    list_count_none,
    list_write_none,
    nullptr,
    nullptr,
    export_key_unsupported,
};
