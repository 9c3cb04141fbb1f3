/*
 * key_management.cpp - generating, importing, describing, exporting and
 * deleting keys. Keys live only in the blobs handed to the caller.
 */
#include "key_management.h"

#include "algorithm_provider.h"
#include "authorization.h"
#include "byte_io.h"
#include "key_store.h"
#include "marshal.h"
#include "soter.h"
#include "ta_log.h"

namespace {

bool blob_usage_repeated(const keymaster_key_param_set_t *params, const char *func = __builtin_FUNCTION()) {
    if (key_param_set_at_most_one(params, KM_TAG_BLOB_USAGE_REQUIREMENTS))
        return false;
    KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Too many KM_TAG_BLOB_USAGE_REQUIREMENTS specified");
    return true;
}

// An opened key: its data and full parameter set, released together.
struct opened_key {
    heap_buf data{true};
    keymaster_key_param_set_t params{};
    param_set_guard params_guard{&params};
};

// Reads a key reference, opens the blob and checks the application binding.
TEE_Result open_key_reference(const uint8_t *in, uint32_t in_len, bool check_blob_size, opened_key *key, int32_t *error,
                              const char *func) {
    byte_reader r(in, in_len);
    const uint8_t *blob = nullptr;
    const uint8_t *app_id = nullptr;
    const uint8_t *app_data = nullptr;
    uint32_t blob_len = 0;
    uint32_t app_id_len = 0;
    uint32_t app_data_len = 0;
    if (!r.read_lv(&blob, &blob_len, func) || !r.read_lv(&app_id, &app_id_len, func) ||
        !r.read_lv(&app_data, &app_data_len, func))
        return TEE_ERROR_GENERIC;
    if (check_blob_size && blob_len <= 1) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Wrong key_blob_size %d", static_cast<int>(blob_len));
        *error = KM_ERROR_INVALID_KEY_BLOB;
        return TEE_SUCCESS;
    }
    uint8_t *data = nullptr;
    uint32_t data_len = 0;
    TEE_Result res = open_key(blob, blob_len, &data, &data_len, &key->params, error);
    if (res != TEE_SUCCESS || *error != KM_ERROR_OK) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Open key failed");
        return res;
    }
    key->data.adopt(data, data_len);
    if (check_app_id_and_app_data(&key->params, app_id, app_id_len, app_data, app_data_len) != 0) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Wrong AppId or AppData");
        *error = KM_ERROR_INVALID_KEY_BLOB;
    }
    return TEE_SUCCESS;
}

// A generate or import request: its parameters and the key data made for them.
struct key_request_t {
    keymaster_key_param_set_t params{};
    param_set_guard params_guard{&params};
    heap_buf key_data{true};
};

// The request's provider makes the key data (importing: from material),
// then the completed set is checked for a repeated blob-usage tag.
TEE_Result make_key_data(keymaster_key_param_set_t *params, bool importing, const uint8_t *material,
                         uint32_t material_len, heap_buf *key_data, int32_t *error, const char *func) {
    const key_param_t *alg = key_param_set_find_unique(params, KM_TAG_ALGORITHM);
    if (!alg) {
        if (importing)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "No or too many KM_TAG_ALGORITHM");
        else
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "No KM_TAG_ALGORITHM or many KM_TAG_ALGORITHM");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    const algorithm_provider_t *provider = find_algorithm_provider(alg->enumerated);
    if (!provider || !(importing ? provider->import_key != nullptr : provider->generate_key != nullptr)) {
        if (importing)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unsupport import_key for algorithm %s (%d)",
                        provider ? provider->name : "", static_cast<int>(alg->enumerated));
        *error = KM_ERROR_UNSUPPORTED_ALGORITHM;
        return TEE_SUCCESS;
    }
    uint8_t *data = nullptr;
    uint32_t data_len = 0;
    TEE_Result res = importing ? provider->import_key(params, material, material_len, &data, &data_len, error)
                               : provider->generate_key(params, &data, &data_len, error);
    key_data->adopt(data, data_len);
    if (res == TEE_SUCCESS && *error == KM_ERROR_OK && blob_usage_repeated(params, func))
        *error = KM_ERROR_INVALID_TAG;
    return res;
}

// The request's parameters from their serialized bytes; "Unmarshal failed" and TEE_ERROR_BAD_PARAMETERS when they will
// not parse.
TEE_Result unmarshal_request(const uint8_t *ser, uint32_t ser_len, keymaster_key_param_set_t *params,
                             const char *func) {
    if (unmarshal(ser, ser_len, params) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unmarshal failed");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    KM_DUMP_PARAM_SET(params);
    return TEE_SUCCESS;
}

// save_key of the request's key data and parameters into blob (capacity *blob_len).
TEE_Result save_key_logged(key_request_t *req, uint8_t *blob, uint32_t *blob_len, const char *func) {
    TEE_Result res = save_key(req->key_data.get(), req->key_data.len(), &req->params, blob, blob_len);
    if (res != TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Can't save key to TEE storage");
    return res;
}

// The frame of generate_key and import_key: steps(request, capacity, &res)
// runs once with *error cleared; on failure the caller's buffer is wiped
// over the size it gave (save_key rewrites sizes on the way) and a failure
// that set neither a result nor an error becomes -1000.
template <typename Steps> TEE_Result key_command(uint8_t *out, uint32_t *out_len, int32_t *error, Steps steps) {
    key_request_t req;
    const uint32_t capacity = *out_len;
    TEE_Result res = TEE_SUCCESS;
    *error = KM_ERROR_OK;
    const bool done = steps(&req, capacity, &res);
    if (!done)
        TEE_MemFill(out, 0, capacity);
    settle_error(res, done, error);
    return res;
}

} // namespace

TEE_Result generate_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error) {
    return key_command(out, out_len, error, [&](key_request_t *req, uint32_t capacity, TEE_Result *res) {
        *out_len = 0; // until the blob is written
        *res = unmarshal_request(in, in_len, &req->params, "generate_key");
        if (*res != TEE_SUCCESS)
            return false;
        *res = make_key_data(&req->params, false, nullptr, 0, &req->key_data, error, "generate_key");
        if (*res != TEE_SUCCESS || *error)
            return false;
        uint32_t blob_len = capacity;
        *res = save_key_logged(req, out, &blob_len, "generate_key");
        if (*res != TEE_SUCCESS)
            return false;
        *out_len = blob_len;
        return true;
    });
}

TEE_Result import_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error) {
    return key_command(out, out_len, error, [&](key_request_t *req, uint32_t capacity, TEE_Result *res) {
        byte_reader r(in, in_len);
        const uint8_t *ser = nullptr;
        uint32_t ser_len = 0;
        if (!r.read_lv(&ser, &ser_len, "import_key")) {
            *res = TEE_ERROR_GENERIC;
            return false;
        }
        *res = unmarshal_request(ser, ser_len, &req->params, "import_key");
        if (*res != TEE_SUCCESS)
            return false;
        // The material is every byte after the parameters.
        *res = make_key_data(&req->params, true, r.pos(), r.remaining(), &req->key_data, error, "import_key");
        if (*res != TEE_SUCCESS || *error)
            return false;
        // The response: u32 blob length, the blob, u32 characteristics length, the characteristics.
        byte_writer w(out, capacity);
        uint8_t *blob_len_at = nullptr;
        uint8_t *blob_at = nullptr;
        uint32_t chars_len = 0;
        if (!w.reserve(4, &blob_len_at, "import_key")) {
            *res = TEE_ERROR_GENERIC;
            return false;
        }
        uint32_t blob_len = w.remaining();
        *res = save_key_logged(req, w.pos(), &blob_len, "import_key");
        if (*res != TEE_SUCCESS)
            return false;
        put_u32le(blob_len_at, blob_len);
        if (!w.reserve(blob_len, &blob_at, "import_key")) {
            *res = TEE_ERROR_GENERIC;
            return false;
        }
        *res = marshal_lv(&w, &req->params, &chars_len);
        if (*res != TEE_SUCCESS)
            return false;
        *out_len = 8 + blob_len + chars_len;
        return true;
    });
}

TEE_Result get_key_character_size(const uint8_t *in, uint32_t in_len, int32_t *error, uint32_t *size) {
    opened_key key;
    *size = 0;
    *error = KM_ERROR_OK;
    TEE_Result res = open_key_reference(in, in_len, true, &key, error, __func__);
    if (res == TEE_SUCCESS && *error == KM_ERROR_OK)
        *size = marshal_size(&key.params, false);
    return res;
}

TEE_Result get_key_character(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error) {
    opened_key key;
    *error = KM_ERROR_OK;
    TEE_Result res = open_key_reference(in, in_len, true, &key, error, __func__);
    if (res != TEE_SUCCESS || *error != KM_ERROR_OK)
        return res;
    res = marshal(&key.params, false, &out, out_len);
    if (res != TEE_SUCCESS)
        KM_ERR("Marshal failed");
    return res;
}

TEE_Result export_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error) {
    opened_key key;
    bool done = false;
    *error = KM_ERROR_OK;
    TEE_Result res = open_key_reference(in, in_len, false, &key, error, __func__);
    if (res != TEE_SUCCESS || *error != KM_ERROR_OK)
        return res;

    if (key_param_set_has_tag(&key.params, KM_TAG_SOTER_IS_FROM_SOTER)) {
        KM_DEBUG("soter export_key\n");
        return soter_enhance_export_key(&key.params, key.data.get(), key.data.len(), out, out_len);
    }
    KM_DEBUG("normal export_key\n");
    do {
        const key_param_t *alg = key_param_set_find_unique(&key.params, KM_TAG_ALGORITHM);
        if (!alg) {
            KM_ERR("No or too many KM_TAG_ALGORITHM");
            *error = KM_ERROR_INVALID_ARGUMENT;
            break;
        }
        const algorithm_provider_t *provider = find_algorithm_provider(alg->enumerated);
        if (!provider || !provider->export_key) {
            KM_ERR("Unsupported algorithm");
            *error = KM_ERROR_UNSUPPORTED_ALGORITHM;
            break;
        }
        res = provider->export_key(key.data.get(), key.data.len(), out, out_len, error);
        if (res != TEE_SUCCESS || *error) {
            KM_ERR("Export key failed");
            break;
        }
        done = true;
    } while (false);
    settle_error(res, done, error);
    return res;
}

TEE_Result delete_key(const uint8_t *in, uint32_t in_len, int32_t *error) {
    *error = KM_ERROR_OK;
    TEE_Result res = key_store_delete_key(in, in_len, error);
    if (res != TEE_SUCCESS || *error != KM_ERROR_OK)
        KM_ERR("Keystore delete key failed");
    return res;
}

TEE_Result delete_all_key(int32_t *error) {
    *error = KM_ERROR_OK;
    TEE_Result res = key_store_delete_all_keys();
    if (res != TEE_SUCCESS)
        KM_ERR("Keystore delete key failed");
    return res;
}
