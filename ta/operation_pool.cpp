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

// Ends an operation: the record with everything it holds, then its slot.
void end_operation(operation_t *op, uint32_t handle) {
    operation_destroy(op);
    operation_pool_remove(handle);
}

// Reads (u32 length, data, u32 length, serialized parameters) and parses the parameters.
bool read_request(const uint8_t *in, uint32_t in_len, const uint8_t **data, uint32_t *data_len, const uint8_t **params,
                  uint32_t *params_len, const char *func) {
    byte_reader r(in, in_len);
    return r.read_lv(data, data_len, func) && r.read_lv(params, params_len, func);
}

// Steps 3 to 5 of update and finish: the parameters parsed, the
// per-operation user authentication checked against them (the handle is
// the challenge), and the record's function for the step present. False,
// with *res or *error set, when the step stops here.
bool step_ready(const uint8_t *ser, uint32_t ser_len, keymaster_key_param_set_t *in_params, const operation_t *op,
                uint32_t handle, bool has_step, const char *missing, TEE_Result *res, int32_t *error,
                const char *func) {
    if (unmarshal(ser, ser_len, in_params) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unmarshal failed");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return false;
    }
    *res = authorize_update_or_finish(in_params, op, handle, error);
    if (*res != TEE_SUCCESS || *error) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Authorization failed");
        return false;
    }
    if (!has_step) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "%s", missing);
        *error = KM_ERROR_UNIMPLEMENTED;
        return false;
    }
    return true;
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

namespace {

// The begin request opened: its parameters, the key's data and its characteristics.
struct begin_request_t {
    const uint8_t *blob = nullptr;
    uint32_t blob_len = 0;
    keymaster_key_param_set_t in_params{};
    keymaster_key_param_set_t key_params{};
    param_set_guard in_guard{&in_params};
    param_set_guard key_guard{&key_params};
    heap_buf key_data{true};
};

// Steps 2 to 5: read and parse the request, open the blob, check the application binding.
TEE_Result begin_open(const uint8_t *in, uint32_t in_len, begin_request_t *r, int32_t *error) {
    const uint8_t *ser = nullptr;
    uint32_t ser_len = 0;
    if (!read_request(in, in_len, &r->blob, &r->blob_len, &ser, &ser_len, "begin"))
        return TEE_ERROR_GENERIC;
    if (unmarshal(ser, ser_len, &r->in_params) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Unmarshal failed");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    KM_DUMP_PARAM_SET(&r->in_params);
    uint8_t *data = nullptr;
    uint32_t data_len = 0;
    TEE_Result res = open_key(r->blob, r->blob_len, &data, &data_len, &r->key_params, error);
    if (res != TEE_SUCCESS || *error) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Open key failed");
        return res;
    }
    r->key_data.adopt(data, data_len);
    const key_param_t *app_id = key_param_set_find_unique(&r->in_params, KM_TAG_APPLICATION_ID);
    const key_param_t *app_data = key_param_set_find_unique(&r->in_params, KM_TAG_APPLICATION_DATA);
    if (check_app_id_and_app_data(&r->key_params, app_id ? app_id->blob.data : nullptr,
                                  app_id ? app_id->blob.data_length : 0, app_data ? app_data->blob.data : nullptr,
                                  app_data ? app_data->blob.data_length : 0) != 0) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Wrong AppId or AppData");
        *error = KM_ERROR_INVALID_KEY_BLOB;
    }
    return TEE_SUCCESS;
}

// Steps 7 to 10: the provider's purpose table, then its record. Null when
// refused; *error keeps what the provider set (or the deferred outcome).
operation_t *begin_create(uint32_t purpose, begin_request_t *r, keymaster_key_param_set_t *out_params, int32_t *error) {
    const key_param_t *alg = key_param_set_find_unique(&r->key_params, KM_TAG_ALGORITHM);
    if (!alg) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "No KM_TAG_ALGORITHM");
        *error = KM_ERROR_UNKNOWN_ERROR;
        return nullptr;
    }
    const algorithm_provider_t *provider = nullptr;
    const purpose_ops_t *ops = find_purpose_ops(alg->enumerated, purpose, &provider);
    if (!provider) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Algorithm %d not implemented",
                    static_cast<int>(alg->enumerated));
        *error = KM_ERROR_UNSUPPORTED_ALGORITHM;
        return nullptr;
    }
    if (!ops || !ops->create_operation) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Algorithm %s purpose %d not implemented", provider->name,
                    static_cast<int>(purpose));
        *error = KM_ERROR_UNSUPPORTED_PURPOSE;
        return nullptr;
    }
    operation_t *op =
        ops->create_operation(r->key_data.get(), r->key_data.len(), &r->key_params, &r->in_params, out_params, error);
    if (!op) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "begin", __LINE__, "Create operation failed");
        return nullptr;
    }
    // The record owns the key's parameters from here on.
    op->key_params = r->key_params;
    r->key_params = keymaster_key_param_set_t{};
    return op;
}

// The frame of update and finish: the record of handle (none: -28), then
// steps(op, in_params, &res, &ended), which returns true when done. A
// failure after the record was found ends the operation unless the steps
// ended it already; a failure that set nothing becomes -1000.
template <typename Steps> TEE_Result continue_operation(uint32_t handle, int32_t *error, Steps steps) {
    keymaster_key_param_set_t in_params{};
    param_set_guard in_guard(&in_params);
    TEE_Result res = TEE_SUCCESS;
    bool ended = false;
    *error = KM_ERROR_OK;
    operation_t *op = operation_pool_get(handle);
    if (!op) {
        *error = KM_ERROR_INVALID_OPERATION_HANDLE;
        return TEE_SUCCESS;
    }
    const bool done = steps(op, &in_params, &res, &ended);
    if (!done && !ended)
        end_operation(op, handle);
    settle_error(res, done, error);
    return res;
}

} // namespace

TEE_Result begin(uint32_t purpose, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error,
                 uint32_t *handle) {
    begin_request_t request;
    keymaster_key_param_set_t out_params{};
    param_set_guard out_guard(&out_params);
    operation_t *op = nullptr;
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    *handle = 0;
    *error = KM_ERROR_OK;

    do {
        res = begin_open(in, in_len, &request, error);
        if (res != TEE_SUCCESS || *error)
            break;
        res = authorize_begin(request.blob, request.blob_len, purpose, &request.in_params, &request.key_params, error);
        // The deferred-authentication outcome goes ahead and stays in *error
        // until the pool takes the operation.
        if (res != TEE_SUCCESS || (*error != KM_ERROR_OK && *error != KM_OP_AUTH_NEEDED)) {
            KM_ERR("Authorization failed");
            break;
        }
        op = begin_create(purpose, &request, &out_params, error);
        if (!op)
            break;
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
        operation_destroy(op);
    }
    if (done)
        *error = KM_ERROR_OK;
    settle_error(res, done, error);
    return res;
}

TEE_Result update(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error,
                  uint32_t *consumed) {
    return continue_operation(handle, error,
                              [&](operation_t *op, keymaster_key_param_set_t *in_params, TEE_Result *res, bool *) {
                                  byte_reader r(in, in_len);
                                  const uint8_t *data = nullptr;
                                  const uint8_t *ser = nullptr;
                                  uint32_t data_len = 0;
                                  uint32_t ser_len = 0;
                                  if (!r.read_lv(&data, &data_len, "update")) {
                                      *res = TEE_ERROR_GENERIC;
                                      return false;
                                  }
                                  *consumed = data_len;
                                  if (!r.read_lv(&ser, &ser_len, "update")) {
                                      *res = TEE_ERROR_GENERIC;
                                      return false;
                                  }
                                  if (!step_ready(ser, ser_len, in_params, op, handle, op->fns->update,
                                                  "Update not implemented", res, error, "update"))
                                      return false;
                                  *res = op->fns->update(op, in_params, data, consumed, out, out_len, error);
                                  if (*res != TEE_SUCCESS || *error) {
                                      KM_TRACE_AT(TEE_TRACE_ERROR, "update", __LINE__, "Update failed");
                                      return false;
                                  }
                                  return true;
                              });
}

TEE_Result finish(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                  int32_t *error) {
    const uint32_t capacity = *out_len;
    return continue_operation(
        handle, error, [&](operation_t *op, keymaster_key_param_set_t *in_params, TEE_Result *res, bool *ended) {
            keymaster_key_param_set_t out_params{};
            param_set_guard out_guard(&out_params);
            heap_buf output(true);
            const uint8_t *signature = nullptr;
            const uint8_t *ser = nullptr;
            uint32_t signature_len = 0;
            uint32_t ser_len = 0;
            if (!read_request(in, in_len, &signature, &signature_len, &ser, &ser_len, "finish")) {
                *res = TEE_ERROR_GENERIC;
                return false;
            }
            if (!step_ready(ser, ser_len, in_params, op, handle, op->fns->finish, "Finish not implemented", res, error,
                            "finish"))
                return false;
            uint8_t *result = nullptr;
            uint32_t result_len = 0;
            *res = op->fns->finish(op, in_params, signature, signature_len, &result, &result_len, &out_params, error);
            output.adopt(result, result_len);
            if (*res != TEE_SUCCESS || *error) {
                KM_TRACE_AT(TEE_TRACE_ERROR, "finish", __LINE__, "Finish failed");
                return false;
            }
            end_operation(op, handle);
            *ended = true;

            // The response: u32 output length, the output, u32 parameters length, the parameters.
            byte_writer w(out, capacity);
            uint32_t params_len = 0;
            if (!w.write_u32(output.len(), "finish") || !w.write_bytes(output.get(), output.len(), "finish")) {
                *res = TEE_ERROR_GENERIC;
                return false;
            }
            *res = marshal_lv(&w, &out_params, &params_len);
            if (*res != TEE_SUCCESS)
                return false;
            *out_len = 8 + output.len() + params_len;
            return true;
        });
}

TEE_Result abort_operation(uint32_t handle, int32_t *error) {
    operation_t *op = operation_pool_get(handle);
    if (!op) {
        *error = KM_ERROR_INVALID_OPERATION_HANDLE;
        return TEE_SUCCESS;
    }
    end_operation(op, handle);
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}
