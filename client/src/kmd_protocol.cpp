/*
 * kmd_protocol.cpp - the invoke request and reply, both ways: the client
 * library writes requests and reads replies, kmd the other two.
 */
#include "km/kmd_protocol.h"

#include <cstring>

#include "tee_api_defines.h"

namespace km::kmd {

TEE_Result encode_invoke(uint32_t session, uint32_t command, uint32_t types, const TEE_Param params[4],
                         std::vector<uint8_t> *frame) {
    if (!valid_types(types))
        return TEE_ERROR_BAD_PARAMETERS;
    FrameWriter w(kInvoke);
    w.u32(session).u32(command).u32(types);
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = param_type(types, i);
        if (is_value(t)) {
            w.u32(params[i].value.a).u32(params[i].value.b);
            continue;
        }
        if (!is_memref(t))
            continue;
        const TEE_Param &p = params[i];
        if (p.memref.size > kMaxMemref)
            return TEE_ERROR_EXCESS_DATA;
        const bool null = p.memref.buffer == nullptr;
        w.u8(null ? kMemrefNull : 0).u32(p.memref.size);
        if (t != TEE_PARAM_TYPE_MEMREF_OUTPUT && !null)
            w.raw(p.memref.buffer, p.memref.size);
    }
    *frame = w.done();
    return TEE_SUCCESS;
}

TEE_Result decode_invoke(FrameReader &body, InvokeCall *call) {
    call->session = body.u32();
    call->command = body.u32();
    call->types = body.u32();
    if (!body.ok())
        return TEE_ERROR_BAD_FORMAT;
    if (!valid_types(call->types))
        return TEE_ERROR_BAD_PARAMETERS;
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = param_type(call->types, i);
        TEE_Param &p = call->params[i];
        if (is_value(t)) {
            p.value.a = body.u32();
            p.value.b = body.u32();
            continue;
        }
        if (!is_memref(t))
            continue;
        const uint8_t flags = body.u8();
        const uint32_t size = body.u32();
        if (!body.ok() || (flags & ~kMemrefNull) != 0)
            return TEE_ERROR_BAD_FORMAT;
        if (size > kMaxMemref)
            return TEE_ERROR_EXCESS_DATA;
        call->capacity[i] = size;
        call->null[i] = flags & kMemrefNull;
        p.memref.size = size;
        if (call->null[i])
            continue;
        // Never an empty vector's null data(): a NULL buffer means something else to the TA.
        call->buffers[i].assign(size == 0 ? 1 : size, 0);
        p.memref.buffer = call->buffers[i].data();
        if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT)
            continue;
        const uint8_t *data = body.raw(size);
        if (!data)
            return TEE_ERROR_BAD_FORMAT;
        std::memcpy(call->buffers[i].data(), data, size);
    }
    return body.finished() ? TEE_SUCCESS : TEE_ERROR_BAD_FORMAT;
}

std::vector<uint8_t> encode_invoke_reply(TEE_Result result, uint32_t origin, const InvokeCall &call) {
    FrameWriter w(kInvoke | kReply);
    w.u32(result).u32(origin);
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = param_type(call.types, i);
        const TEE_Param &p = call.params[i];
        if (t == TEE_PARAM_TYPE_VALUE_OUTPUT || t == TEE_PARAM_TYPE_VALUE_INOUT) {
            w.u32(p.value.a).u32(p.value.b);
        } else if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT) {
            const uint32_t size = p.memref.size;
            const uint32_t n = !call.null[i] && size <= call.capacity[i] ? size : 0;
            w.u32(size).u32(n).raw(call.buffers[i].data(), n);
        }
    }
    return w.done();
}

bool decode_invoke_reply(FrameReader &body, uint32_t types, TEE_Param params[4], const uint32_t capacity[4]) {
    // Checked whole before anything reaches the caller's parameters.
    struct Out {
        uint32_t a = 0, b = 0, size = 0, n = 0;
        const uint8_t *data = nullptr;
    } out[4];
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = param_type(types, i);
        if (t == TEE_PARAM_TYPE_VALUE_OUTPUT || t == TEE_PARAM_TYPE_VALUE_INOUT) {
            out[i].a = body.u32();
            out[i].b = body.u32();
        } else if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT) {
            out[i].size = body.u32();
            out[i].n = body.u32();
            const bool fits = out[i].n <= capacity[i] && (out[i].n == 0 || out[i].n == out[i].size) &&
                              (out[i].n == 0 || params[i].memref.buffer != nullptr);
            if (!body.ok() || !fits)
                return false;
            out[i].data = body.raw(out[i].n);
        }
    }
    if (!body.finished())
        return false;
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = param_type(types, i);
        if (t == TEE_PARAM_TYPE_VALUE_OUTPUT || t == TEE_PARAM_TYPE_VALUE_INOUT) {
            params[i].value.a = out[i].a;
            params[i].value.b = out[i].b;
        } else if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT) {
            if (out[i].n)
                std::memcpy(params[i].memref.buffer, out[i].data, out[i].n);
            params[i].memref.size = out[i].size;
        }
    }
    return true;
}

} // namespace km::kmd
