/*
 * algorithm_provider.cpp - the provider table, its lookups, and the
 * parameter getters the providers share.
 */
#include "algorithm_provider.h"

#include "tee_guard.h"

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

const purpose_ops_t *find_purpose_ops(uint32_t algorithm, uint32_t purpose, const algorithm_provider_t **provider) {
    if (provider)
        *provider = nullptr;
    for (const algorithm_provider_t *p : algorithm_providers) {
        if (!p || p->algorithm != algorithm || !p->get_purpose_ops)
            continue;
        if (provider)
            *provider = p;
        return p->get_purpose_ops(purpose);
    }
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

uint32_t param_getter_none(keymaster_key_param_set_t *, uint32_t *) {
    return 1;
}

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

namespace {

constexpr uint32_t kMaxKeyAttributes = 8;

// provider_generated_pair's second half: the attributes of obj written out.
TEE_Result key_attributes(TEE_ObjectHandle obj, uint32_t key_size, const uint32_t *ids, uint32_t count,
                          uint32_t max_len, heap_buf *buf, int32_t *error, const char *func) {
    uint32_t lengths[kMaxKeyAttributes] = {};
    if (count > kMaxKeyAttributes)
        return TEE_ERROR_GENERIC;
    uint64_t total = 4;
    {
        heap_buf scratch(true);
        if (!scratch.alloc(max_len)) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        for (uint32_t i = 0; i < count; ++i) {
            lengths[i] = scratch.len();
            TEE_Result res = TEE_GetObjectBufferAttribute(obj, ids[i], scratch.get(), &lengths[i]);
            if (res != TEE_SUCCESS) {
                KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "GetObjectBufferAttribute failed with 0x%08x\n", res);
                return res;
            }
            total += 4 + uint64_t{lengths[i]};
        }
    }
    if (total > UINT32_MAX || !buf->alloc(static_cast<uint32_t>(total))) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    byte_writer w(buf->get(), buf->len());
    if (!w.write_u32(key_size, func))
        return TEE_ERROR_GENERIC;
    for (uint32_t i = 0; i < count; ++i) {
        uint8_t *at = nullptr;
        if (!w.write_u32(lengths[i], func) || !w.reserve(lengths[i], &at, func))
            return TEE_ERROR_GENERIC;
        uint32_t got = lengths[i];
        TEE_Result res = TEE_GetObjectBufferAttribute(obj, ids[i], at, &got);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "GetObjectBufferAttribute failed with 0x%08x\n", res);
            return res;
        }
        if (got != lengths[i]) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Buffer size modified, before %dB, after %dB",
                        static_cast<int>(lengths[i]), static_cast<int>(got));
            *error = KM_ERROR_UNKNOWN_ERROR;
            return TEE_SUCCESS;
        }
    }
    return TEE_SUCCESS;
}

} // namespace

TEE_Result provider_generated_pair(uint32_t type, uint32_t key_size, const TEE_Attribute &param, const uint32_t *ids,
                                   uint32_t count, uint32_t max_len, heap_buf *buf, int32_t *error, const char *func) {
    object_guard obj;
    TEE_Result res =
        key_object(type, key_size, &param, 1, obj.out(), key_fill::generate, tee_call_texts::standard, func, __LINE__);
    if (res != TEE_SUCCESS)
        return res;
    return key_attributes(obj.get(), key_size, ids, count, max_len, buf, error, func);
}

const key_param_t *provider_param(const keymaster_key_param_set_t *params, uint32_t tag, const char *what,
                                  int32_t *error, const char *func, int32_t missing_error, int line) {
    const key_param_t *p = key_param_set_find_unique(params, tag);
    if (!p) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "No or too many %s", what);
        *error = missing_error;
    }
    return p;
}

namespace {

// The rule's refusal of bits, logged in func's name; false when it takes them.
bool refused_size(const key_size_rule_t &rule, uint32_t bits, int32_t *error, const char *func) {
    if (rule.valid(bits))
        return false;
    KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid %s key size %d", rule.label, static_cast<int>(bits));
    *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
    return true;
}

} // namespace

bool provider_generation_size(const keymaster_key_param_set_t *params, const key_size_rule_t &rule, uint32_t *bits,
                              int32_t *error, const char *func) {
    const key_param_t *size = provider_param(params, KM_TAG_KEY_SIZE, "KM_TAG_KEY_SIZE or specified", error, func);
    if (!size || refused_size(rule, size->integer, error, func))
        return false;
    *bits = size->integer;
    return true;
}

namespace {

// The import's size against the caller's KM_TAG_KEY_SIZE, as provider_import_size says.
TEE_Result check_key_size(keymaster_key_param_set_t *params, uint32_t guessed, int32_t *error, const char *func) {
    const key_param_t *size = key_param_set_find_unique(params, KM_TAG_KEY_SIZE);
    if (size) {
        if (size->integer == guessed)
            return TEE_SUCCESS;
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Key size mismatch (given %d, guessed %d)",
                    static_cast<int>(size->integer), static_cast<int>(guessed));
        *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
        return TEE_SUCCESS;
    }
    TEE_Result res = key_param_set_add(params, key_param_enum(KM_TAG_KEY_SIZE, guessed));
    if (res != TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
    return res;
}

} // namespace

TEE_Result provider_import_size(keymaster_key_param_set_t *params, uint32_t bits, const key_size_rule_t &rule,
                                int32_t *error, const char *func) {
    TEE_Result res = check_key_size(params, bits, error, func);
    if (res == TEE_SUCCESS && *error == KM_ERROR_OK)
        refused_size(rule, bits, error, func);
    return res;
}

TEE_Result provider_key_data(heap_buf *buf, const uint32_t *words, uint32_t count, const uint8_t *body,
                             uint32_t body_len, int32_t oom_error, int32_t *error, const char *func) {
    const uint32_t header = 4 * count;
    if (body_len > UINT32_MAX - header || !buf->alloc(header + body_len)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        if (oom_error == KM_ERROR_OK)
            return TEE_ERROR_OUT_OF_MEMORY;
        *error = oom_error;
        return TEE_SUCCESS;
    }
    byte_writer w(buf->get(), buf->len());
    for (uint32_t i = 0; i < count; ++i)
        if (!w.write_u32(words[i], func))
            return TEE_ERROR_GENERIC;
    if (body && !w.write_bytes(body, body_len, func))
        return TEE_ERROR_GENERIC;
    return TEE_SUCCESS;
}

namespace {

// The u32 words ahead of a secret key's bytes: its size, and its TEE type
// when the family has none of its own.
constexpr uint32_t header_words(const secret_key_family_t &family) {
    return family.tee_type ? 1 : 2;
}

// A new key_size-bit secret of TEE object type `type`, written into dest
// (key_size / 8 bytes). The TEE's result, or TEE_SUCCESS with *error -1000
// when it hands back another length.
TEE_Result provider_secret_key(uint32_t type, uint32_t key_size, uint8_t *dest, int32_t *error, const char *func) {
    object_guard obj;
    TEE_Result res =
        key_object(type, key_size, nullptr, 0, obj.out(), key_fill::generate, tee_call_texts::standard, func, __LINE__);
    if (res != TEE_SUCCESS)
        return res;
    const uint32_t key_bytes = key_size / 8;
    uint32_t got = key_bytes;
    res = TEE_GetObjectBufferAttribute(obj.get(), TEE_ATTR_SECRET_VALUE, dest, &got);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "GetObjectBufferAttribute failed with 0x%08x\n", res);
        return res;
    }
    if (got != key_bytes) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Buffer size modified, before %dB, after %dB",
                    static_cast<int>(key_bytes), static_cast<int>(got));
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

// The size in bits of raw key material of material_len bytes, to be stored
// after `header` bytes: a length whose bits overflow is "Invalid <label>
// key size -1" with *error -6, else provider_import_size judges. True,
// with *bits, when usable.
bool provider_raw_key_size(keymaster_key_param_set_t *params, uint32_t material_len, uint32_t header,
                           const key_size_rule_t &rule, uint32_t *bits, TEE_Result *res, int32_t *error,
                           const char *func) {
    if (material_len > (UINT32_MAX - header) / 8) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid %s key size %d", rule.label, -1);
        *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
        return false;
    }
    *bits = material_len * 8;
    *res = provider_import_size(params, *bits, rule, error, func);
    return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
}

} // namespace

TEE_Result provider_generate_secret(const secret_key_family_t &family, keymaster_key_param_set_t *params,
                                    uint8_t **key_data, uint32_t *key_data_len, int32_t *error, const char *func) {
    return provider_key_slot(
        params, KM_ORIGIN_GENERATED, key_data, key_data_len, error,
        [&](heap_buf *buf, TEE_Result *res) {
            uint32_t bits = 0;
            if (!provider_generation_size(params, family.sizes, &bits, error, func))
                return false;
            uint32_t words[2] = {bits, family.tee_type};
            *res = family.vet(params, bits, true, &words[1], error, func);
            if (*res != TEE_SUCCESS || *error)
                return false;
            *res = provider_key_data(buf, words, header_words(family), nullptr, bits / 8, KM_ERROR_OK, error, func);
            if (*res != TEE_SUCCESS)
                return false;
            *res = provider_secret_key(words[1], bits, buf->get() + 4 * header_words(family), error, func);
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        },
        func);
}

TEE_Result provider_import_secret(const secret_key_family_t &family, keymaster_key_param_set_t *params,
                                  const uint8_t *material, uint32_t material_len, uint8_t **key_data,
                                  uint32_t *key_data_len, int32_t *error, const char *func) {
    return provider_key_slot(
        params, KM_ORIGIN_IMPORTED, key_data, key_data_len, error,
        [&](heap_buf *buf, TEE_Result *res) {
            uint32_t words[2] = {0, family.tee_type};
            if (!provider_raw_key_size(params, material_len, 4 * header_words(family), family.sizes, &words[0], res,
                                       error, func))
                return false;
            *res = family.vet(params, words[0], false, &words[1], error, func);
            if (*res != TEE_SUCCESS || *error)
                return false;
            *res = provider_key_data(buf, words, header_words(family), material, material_len,
                                     KM_ERROR_MEMORY_ALLOCATION_FAILED, error, func);
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        },
        func);
}

TEE_Result provider_resolve_secret(const secret_key_family_t &family, const uint8_t *key_data, uint32_t key_data_len,
                                   TEE_ObjectHandle *object, uint32_t *key_size, uint32_t *key_type, int32_t *error,
                                   const char *func) {
    *object = nullptr;
    if (key_size)
        *key_size = 0;
    byte_reader r(key_data, key_data_len);
    uint32_t words[2] = {0, family.tee_type};
    const uint8_t *key = nullptr;
    for (uint32_t i = 0; i < header_words(family); ++i)
        if (!r.read_u32(&words[i], func))
            return TEE_ERROR_GENERIC;
    if (!r.read_bytes(words[0] / 8, &key, func))
        return TEE_ERROR_GENERIC;
    TEE_Result res = secret_key_object(words[1], words[0], key, object, func);
    if (res != TEE_SUCCESS)
        return res;
    if (key_size)
        *key_size = words[0];
    if (key_type)
        *key_type = words[1];
    *error = KM_ERROR_OK;
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

bool operation_key_resolved(TEE_Result res, const int32_t *error, const TEE_ObjectHandle *key, const char *func,
                            int line) {
    if (res == TEE_SUCCESS && *error == KM_ERROR_OK && *key)
        return true;
    KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Resolve key data failed");
    return false;
}

operation_t *operation_record_alloc(const operation_fns_t *fns, const char *func) {
    auto *op = static_cast<operation_t *>(ta_malloc(fns->record_size));
    if (!op) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        return nullptr;
    }
    op->fns = fns;
    return op;
}

void operation_destroy(operation_t *op, record_state state) {
    if (!op) {
        KM_ERR("Try to free NULL operation_t");
        return;
    }
    key_param_set_release(&op->key_params);
    const operation_fns_t *fns = op->fns;
    fns->release(op, state == record_state::complete);
    ta_free_wiped(op, fns->record_size);
}

void record_release::missing(bool required) const {
    if (required && audit_)
        KM_TRACE_AT(TEE_TRACE_ERROR, func_, __LINE__, "Try to free invalid %s", op_->fns->record_name);
}

void record_release::object(TEE_ObjectHandle *h, bool required) {
    if (!*h)
        return missing(required);
    free_object(h);
}

void record_release::operation(TEE_OperationHandle *h, bool required) {
    if (!*h)
        return missing(required);
    free_operation(h);
}

void record_release::buffer(uint8_t **p, uint32_t len, bool required) {
    if (!*p)
        return missing(required);
    ta_free_wiped(*p, len);
    *p = nullptr;
}
