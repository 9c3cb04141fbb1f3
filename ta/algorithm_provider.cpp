/*
 * algorithm_provider.cpp - the provider table, its lookups, and the
 * parameter getters the providers share.
 */
#include "algorithm_provider.h"

#include "ta_log.h"

const algorithm_provider_t *const algorithm_providers[kAlgorithmProviderCount] = {
    &rsa_provider,
    &aes_provider,
    &ec_provider,
    &hmac_provider,
};

const algorithm_provider_t *find_algorithm_provider(uint32_t algorithm) {
    for (const algorithm_provider_t *p : algorithm_providers)
        if (p && p->algorithm == algorithm)
            return p;
    return nullptr;
}

const purpose_ops_t *find_purpose_ops(uint32_t algorithm, uint32_t purpose) {
    for (const algorithm_provider_t *p : algorithm_providers)
        if (p && p->algorithm == algorithm && p->get_purpose_ops)
            return p->get_purpose_ops(purpose);
    return nullptr;
}

namespace {
uint32_t unique_value(keymaster_key_param_set_t *in_params, uint32_t tag, uint32_t *value) {
    const key_param_t *p = key_param_set_find_unique(in_params, tag);
    if (!p)
        return 1;
    *value = p->enumerated;
    return 0;
}
} // namespace

uint32_t param_getter_none(keymaster_key_param_set_t *, uint32_t *) { return 1; }

uint32_t param_getter_digest(keymaster_key_param_set_t *in_params, uint32_t *value) {
    return unique_value(in_params, KM_TAG_DIGEST, value);
}

uint32_t param_getter_padding(keymaster_key_param_set_t *in_params, uint32_t *value) {
    return unique_value(in_params, KM_TAG_PADDING, value);
}

uint32_t param_getter_block_mode(keymaster_key_param_set_t *in_params, uint32_t *value) {
    return unique_value(in_params, KM_TAG_BLOCK_MODE, value);
}

TEE_Result export_key_unsupported(const uint8_t *, uint32_t, uint8_t *, uint32_t *, int32_t *error) {
    *error = KM_ERROR_UNSUPPORTED_KEY_FORMAT;
    return TEE_SUCCESS;
}

TEE_Result provider_set_origin(keymaster_key_param_set_t *params, uint32_t origin, int32_t *error, const char *func) {
    if (key_param_set_has_tag(params, KM_TAG_ORIGIN)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Shouldn't specify KM_TAG_ORIGIN");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    TEE_Result res = key_param_set_add(params, key_param_enum(KM_TAG_ORIGIN, origin));
    if (res != TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
    return res;
}

operation_t *operation_record_alloc(uint32_t size, const operation_fns_t *fns) {
    auto *op = static_cast<operation_t *>(ta_malloc(size));
    if (!op)
        return nullptr;
    op->free = fns->free;
    op->update = fns->update;
    op->finish = fns->finish;
    return op;
}

TEE_Result provider_settle_key(TEE_Result res, bool done, int32_t *error, heap_buf *buf, uint8_t **key_data,
                               uint32_t *key_data_len) {
    if (done && res == TEE_SUCCESS && *error == KM_ERROR_OK) {
        *key_data_len = buf->len();
        *key_data = buf->release();
        return TEE_SUCCESS;
    }
    if (res == TEE_SUCCESS && *error == KM_ERROR_OK)
        *error = KM_ERROR_UNKNOWN_ERROR;
    return res;
}
