/*
 * operation_pool.cpp - the operation pool and the operation commands.
 */
#include "operation_pool.h"

#include "authorization.h"
#include "byte_io.h"
#include "key_store.h"
#include "marshal.h"
#include "ta_log.h"

namespace {

struct operation_slot_t {
    operation_t *operation;
    uint32_t handle;
    uint8_t free;
};

operation_slot_t operation_pool[kOperationSlots];

bool handle_taken(uint32_t handle) {
    for (const operation_slot_t &s : operation_pool)
        if (s.handle == handle)
            return true;
    return false;
}

// Ends an operation: its key parameters, its own resources, its slot.
void end_operation(operation_t *op, uint32_t handle) {
    key_param_set_release(&op->key_params);
    if (op->free)
        op->free(op);
    operation_pool_remove(handle);
}

void settle(TEE_Result res, bool done, int32_t *error) {
    if (!done && res == TEE_SUCCESS && *error == KM_ERROR_OK)
        *error = KM_ERROR_UNKNOWN_ERROR;
}

// Reads (u32 length, data, u32 length, serialized parameters) and parses the parameters.
bool read_request(const uint8_t *in, uint32_t in_len, const uint8_t **data, uint32_t *data_len,
                  const uint8_t **params, uint32_t *params_len, const char *func) {
    byte_reader r(in, in_len);
    return r.read_lv(data, data_len, func) && r.read_lv(params, params_len, func);
}

// The update and finish parameters: parsed, then the per-operation user
// authentication checked against them (the handle is the challenge).
TEE_Result parse_and_authorize(const uint8_t *ser, uint32_t ser_len, keymaster_key_param_set_t *in_params,
                               const operation_t *op, uint32_t handle, int32_t *error, const char *func) {
    if (unmarshal(ser, ser_len, in_params) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unmarshal failed");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    TEE_Result res = authorize_update_or_finish(in_params, op, handle, error);
    if (res != TEE_SUCCESS || *error)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Authorization failed");
    return res;
}

} // namespace

TEE_Result operation_pool_init() {
    for (operation_slot_t &s : operation_pool)
        s = operation_slot_t{nullptr, 0, 1};
    return TEE_SUCCESS;
}

TEE_Result operation_pool_add(operation_t *op, uint32_t *handle, int32_t *error) {
    *handle = 0;
    operation_slot_t *slot = nullptr;
    for (operation_slot_t &s : operation_pool) {
        if (s.free) {
            slot = &s;
            break;
        }
    }
    if (!slot) {
        KM_ERR("Too many operations");
        *error = KM_ERROR_TOO_MANY_OPERATIONS;
        return TEE_SUCCESS;
    }
    do {
        TEE_GenerateRandom(handle, sizeof *handle);
    } while (*handle == 0 || handle_taken(*handle));
    slot->operation = op;
    slot->handle = *handle;
    slot->free = 0;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

operation_t *operation_pool_get(uint32_t handle) {
    for (const operation_slot_t &s : operation_pool)
        if (!s.free && s.handle == handle)
            return s.operation;
    KM_ERR("Operation handle not found");
    return nullptr;
}

void operation_pool_remove(uint32_t handle) {
    for (operation_slot_t &s : operation_pool) {
        if (!s.free && s.handle == handle) {
            s.operation = nullptr;
            s.free = 1;
            return;
        }
    }
    KM_ERR("Try to free invalid operation handle");
}

void operation_pool_end_all() {
    for (operation_slot_t &s : operation_pool)
        if (!s.free && s.operation)
            end_operation(s.operation, s.handle);
}

TEE_Result begin(uint32_t purpose, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                 int32_t *error, uint32_t *handle) {
    keymaster_key_param_set_t in_params{};
    keymaster_key_param_set_t out_params{};
    keymaster_key_param_set_t key_params{};
    param_set_guard in_guard(&in_params);
    param_set_guard out_guard(&out_params);
    param_set_guard key_guard(&key_params);
    heap_buf key_data(true);
    operation_t *op = nullptr;
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    *handle = 0;
    *error = KM_ERROR_OK;

    do {
        const uint8_t *blob = nullptr;
        const uint8_t *ser = nullptr;
        uint32_t blob_len = 0;
        uint32_t ser_len = 0;
        if (!read_request(in, in_len, &blob, &blob_len, &ser, &ser_len, __func__)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        if (unmarshal(ser, ser_len, &in_params) != TEE_SUCCESS) {
            KM_ERR("Unmarshal failed");
            res = TEE_ERROR_BAD_PARAMETERS;
            break;
        }
        KM_DUMP_PARAM_SET(&in_params);
        uint8_t *data = nullptr;
        uint32_t data_len = 0;
        res = open_key(blob, blob_len, &data, &data_len, &key_params, error);
        if (res != TEE_SUCCESS || *error) {
            KM_ERR("Open key failed");
            break;
        }
        key_data.adopt(data, data_len);
        const key_param_t *app_id = key_param_set_find_unique(&in_params, KM_TAG_APPLICATION_ID);
        const key_param_t *app_data = key_param_set_find_unique(&in_params, KM_TAG_APPLICATION_DATA);
        if (check_app_id_and_app_data(&key_params, app_id ? app_id->blob.data : nullptr,
                                      app_id ? app_id->blob.data_length : 0, app_data ? app_data->blob.data : nullptr,
                                      app_data ? app_data->blob.data_length : 0) != 0) {
            KM_ERR("Wrong AppId or AppData");
            *error = KM_ERROR_INVALID_KEY_BLOB;
            break;
        }
        res = authorize_begin(blob, blob_len, purpose, &in_params, &key_params, error);
        if (res != TEE_SUCCESS || (*error != KM_ERROR_OK && *error != KM_OP_AUTH_NEEDED)) {
            KM_ERR("Authorization failed");
            break;
        }
        *error = KM_ERROR_OK;
        const key_param_t *alg = key_param_set_find_unique(&key_params, KM_TAG_ALGORITHM);
        if (!alg) {
            KM_ERR("No KM_TAG_ALGORITHM");
            *error = KM_ERROR_UNKNOWN_ERROR;
            break;
        }
        const algorithm_provider_t *provider = find_algorithm_provider(alg->enumerated);
        if (!provider || !provider->get_purpose_ops) {
            KM_ERR("Algorithm %d not implemented", static_cast<int>(alg->enumerated));
            *error = KM_ERROR_UNSUPPORTED_ALGORITHM;
            break;
        }
        const purpose_ops_t *ops = provider->get_purpose_ops(purpose);
        if (!ops || !ops->create_operation) {
            KM_ERR("Algorithm %s purpose %d not implemented", provider->name, static_cast<int>(purpose));
            *error = KM_ERROR_UNSUPPORTED_PURPOSE;
            break;
        }
        op = ops->create_operation(key_data.get(), key_data.len(), &key_params, &in_params, &out_params, error);
        if (!op) {
            KM_ERR("Create operation failed");
            break;
        }
        // The record owns the key's parameters from here on.
        op->key_params = key_params;
        key_params = keymaster_key_param_set_t{};
        res = operation_pool_add(op, handle, error);
        if (res != TEE_SUCCESS || *error) {
            KM_ERR("Allocate in operation pool failed");
            break;
        }
        res = marshal(&out_params, false, &out, out_len);
        if (res != TEE_SUCCESS) {
            KM_ERR("Marshal failed");
            break;
        }
        done = true;
    } while (false);
    if (!done && op) {
        if (*handle != 0)
            operation_pool_remove(*handle);
        key_param_set_release(&op->key_params);
        if (op->free)
            op->free(op);
    }
    settle(res, done, error);
    return res;
}

TEE_Result update(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                  int32_t *error, uint32_t *consumed) {
    keymaster_key_param_set_t in_params{};
    param_set_guard in_guard(&in_params);
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    *error = KM_ERROR_OK;
    operation_t *op = operation_pool_get(handle);
    if (!op) {
        *error = KM_ERROR_INVALID_OPERATION_HANDLE;
        return TEE_SUCCESS;
    }
    do {
        byte_reader r(in, in_len);
        const uint8_t *data = nullptr;
        const uint8_t *ser = nullptr;
        uint32_t data_len = 0;
        uint32_t ser_len = 0;
        if (!r.read_lv(&data, &data_len)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        *consumed = data_len;
        if (!r.read_lv(&ser, &ser_len)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        res = parse_and_authorize(ser, ser_len, &in_params, op, handle, error, __func__);
        if (res != TEE_SUCCESS || *error)
            break;
        if (!op->update) {
            KM_ERR("Update not implemented");
            *error = KM_ERROR_UNIMPLEMENTED;
            break;
        }
        res = op->update(op, &in_params, data, consumed, out, out_len, error);
        if (res != TEE_SUCCESS || *error) {
            KM_ERR("Update failed");
            break;
        }
        done = true;
    } while (false);
    if (!done)
        end_operation(op, handle);
    settle(res, done, error);
    return res;
}

TEE_Result finish(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                  int32_t *error) {
    keymaster_key_param_set_t in_params{};
    keymaster_key_param_set_t out_params{};
    param_set_guard in_guard(&in_params);
    param_set_guard out_guard(&out_params);
    heap_buf output(true);
    bool ended = false;
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    const uint32_t capacity = *out_len;
    *error = KM_ERROR_OK;
    operation_t *op = operation_pool_get(handle);
    if (!op) {
        *error = KM_ERROR_INVALID_OPERATION_HANDLE;
        return TEE_SUCCESS;
    }
    do {
        const uint8_t *signature = nullptr;
        const uint8_t *ser = nullptr;
        uint32_t signature_len = 0;
        uint32_t ser_len = 0;
        if (!read_request(in, in_len, &signature, &signature_len, &ser, &ser_len, __func__)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        res = parse_and_authorize(ser, ser_len, &in_params, op, handle, error, __func__);
        if (res != TEE_SUCCESS || *error)
            break;
        if (!op->finish) {
            KM_ERR("Finish not implemented");
            *error = KM_ERROR_UNIMPLEMENTED;
            break;
        }
        uint8_t *result = nullptr;
        uint32_t result_len = 0;
        res = op->finish(op, &in_params, signature, signature_len, &result, &result_len, &out_params, error);
        output.adopt(result, result_len);
        if (res != TEE_SUCCESS || *error) {
            KM_ERR("Finish failed");
            break;
        }
        end_operation(op, handle);
        ended = true;

        byte_writer w(out, capacity);
        uint8_t *params_len_at = nullptr;
        if (!w.write_u32(output.len()) || !w.write_bytes(output.get(), output.len()) || !w.reserve(4, &params_len_at)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        uint8_t *params_at = w.pos();
        uint32_t params_len = w.remaining();
        res = marshal(&out_params, false, &params_at, &params_len);
        if (res != TEE_SUCCESS) {
            KM_ERR("Marshal failed");
            break;
        }
        put_u32le(params_len_at, params_len);
        *out_len = 8 + output.len() + params_len;
        done = true;
    } while (false);
    if (!ended)
        end_operation(op, handle);
    settle(res, done, error);
    return res;
}

TEE_Result _abort(uint32_t handle, int32_t *error) {
    operation_t *op = operation_pool_get(handle);
    if (!op) {
        *error = KM_ERROR_INVALID_OPERATION_HANDLE;
        return TEE_SUCCESS;
    }
    end_operation(op, handle);
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}
