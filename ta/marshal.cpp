/*
 * marshal.cpp - writing and reading serialized parameter sets.
 */
#include "marshal.h"

#include "byte_io.h"
#include "ta_log.h"

namespace {
constexpr uint32_t kRecordSize = sizeof(key_param_t);
// Bytes of a record that hold a data pointer in memory.
constexpr size_t kPointerSlot = sizeof(void *);
// The largest count whose record array fits in 32 bits.
constexpr uint32_t kMaxRecords = UINT32_MAX / kRecordSize;
} // namespace

bool is_hidden_param(uint32_t tag) {
    return tag == KM_TAG_APPLICATION_ID || tag == KM_TAG_APPLICATION_DATA || tag == KM_TAG_ROOT_OF_TRUST;
}

uint32_t marshal_size(const keymaster_key_param_set_t *set, bool include_hidden) {
    uint64_t size = 4;
    if (set && set->params) {
        for (uint32_t i = 0; i < set->length; ++i) {
            const key_param_t &p = set->params[i];
            if (!include_hidden && is_hidden_param(p.tag))
                continue;
            size += kRecordSize;
            if (key_tag_is_blob(p.tag))
                size += p.blob.data_length;
        }
    }
    return size > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(size);
}

TEE_Result marshal(const keymaster_key_param_set_t *set, bool include_hidden, uint8_t **buf, uint32_t *len) {
    TEE_Result res = TEE_ERROR_GENERIC;
    bool allocated = false;
    uint32_t size = marshal_size(set, include_hidden);
    uint32_t count = 0;

    if (!*buf) {
        *buf = static_cast<uint8_t *>(ta_malloc_logged(size));
        if (!*buf) {
            res = TEE_ERROR_OUT_OF_MEMORY;
            goto fail;
        }
        allocated = true;
    } else if (*len < size) {
        KM_ERR("Too short marshalling buffer");
        res = TEE_ERROR_SHORT_BUFFER;
        goto fail;
    }
    *len = size;

    {
        byte_writer out(*buf, size);
        const uint32_t n = set && set->params ? set->length : 0;
        for (uint32_t i = 0; i < n; ++i)
            if (include_hidden || !is_hidden_param(set->params[i].tag))
                ++count;
        if (!out.write_u32(count))
            goto fail;
        for (uint32_t i = 0; i < n; ++i) {
            const key_param_t &p = set->params[i];
            uint8_t *rec = nullptr;
            if (!include_hidden && is_hidden_param(p.tag))
                continue;
            if (!out.reserve(kRecordSize, &rec))
                goto fail;
            std::memcpy(rec, &p, kRecordSize);
            if (!key_tag_is_blob(p.tag))
                continue;
            // The pointer slot goes out as zero: heap addresses never leave the TA.
            std::memset(rec + offsetof(key_param_t, blob.data), 0, kPointerSlot);
            if (!p.blob.data) {
                KM_ERR("Invalid keymaster_key_param_set_t");
                res = TEE_ERROR_BAD_PARAMETERS;
                goto fail;
            }
            if (!out.write_bytes(p.blob.data, p.blob.data_length))
                goto fail;
        }
    }
    return TEE_SUCCESS;

fail:
    if (allocated)
        ta_free(*buf);
    *buf = nullptr;
    *len = 0;
    return res == TEE_SUCCESS ? TEE_ERROR_GENERIC : res;
}

TEE_Result marshal_lv(byte_writer *w, const keymaster_key_param_set_t *set, uint32_t *written, const char *func) {
    uint8_t *len_at = nullptr;
    if (!w->reserve(4, &len_at, func))
        return TEE_ERROR_GENERIC;
    uint8_t *at = w->pos();
    uint32_t len = w->remaining();
    TEE_Result res = marshal(set, false, &at, &len);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Marshal failed");
        return res;
    }
    put_u32le(len_at, len);
    uint8_t *skipped = nullptr;
    w->reserve(len, &skipped, func);
    if (written)
        *written = len;
    return TEE_SUCCESS;
}

TEE_Result unmarshal(const uint8_t *in, uint32_t in_len, keymaster_key_param_set_t *set) {
    TEE_Result res = TEE_ERROR_GENERIC;
    byte_reader r(in, in_len);
    uint32_t count = 0;
    key_param_t *params = nullptr;
    uint32_t done = 0;

    if (!set)
        return TEE_ERROR_SHORT_BUFFER;
    if (!r.read_u32(&count))
        return TEE_ERROR_GENERIC;
    if (count > kMaxRecords) {
        // The array size would not fit in 32 bits; no input that long can exist.
        KM_ERR("Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    params = static_cast<key_param_t *>(ta_malloc(count * kRecordSize));
    if (!params) {
        KM_ERR("Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }

    for (; done < count; ++done) {
        key_param_t &p = params[done];
        if (!r.copy(&p, kRecordSize))
            goto fail;
        if (!key_tag_is_blob(p.tag))
            continue;
        p.blob.data = nullptr;
        uint32_t n = p.blob.data_length;
        uint8_t *data = static_cast<uint8_t *>(ta_malloc(n));
        if (!data) {
            KM_ERR("Out of memory, require %dB", static_cast<int>(n));
            res = TEE_ERROR_OUT_OF_MEMORY;
            goto fail;
        }
        if (!r.copy(data, n)) {
            ta_free(data);
            goto fail;
        }
        p.blob.data = data;
    }
    set->params = params;
    set->length = count;
    return TEE_SUCCESS;

fail:
    // Records before `done` are complete; the one being read holds no data.
    key_param_values_release(params, done);
    ta_free(params);
    set->params = nullptr;
    set->length = 0;
    return res;
}
