/*
 * kmd_frame_fuzz.cpp - the daemon's invoke frames, both ways. An invoke
 * body that decode_invoke accepts is what encode_invoke writes for the
 * call it decoded; the reply kmd builds for that call, whatever sizes the
 * TA left, reads back on the client side into buffers of the capacities
 * sent; and any reply bytes read into those buffers stay inside them.
 */
#include <algorithm>
#include <cstring>
#include <memory>

#include "fuzz_support.h"
#include "km/kmd_protocol.h"

namespace kmd = km::kmd;

namespace {

// The caller's side of a call: its own buffers of the capacities it sent.
struct ClientCall {
    TEE_Param params[4] = {};
    uint32_t capacity[4] = {};
    std::unique_ptr<uint8_t[]> buffers[4];

    explicit ClientCall(const kmd::InvokeCall &call) {
        for (int i = 0; i < 4; ++i) {
            const uint32_t t = kmd::param_type(call.types, i);
            if (!kmd::is_memref(t))
                continue;
            capacity[i] = call.capacity[i];
            params[i].memref.size = call.capacity[i];
            if (call.null[i])
                continue;
            // Exactly the capacity (a distinct non-null block even for 0):
            // reading a reply must never write past it.
            buffers[i] = std::make_unique<uint8_t[]>(call.capacity[i]);
            params[i].memref.buffer = buffers[i].get();
        }
    }
};

void check_reply(kmd::InvokeCall &call, FuzzInput &in) {
    // What a TA might leave: sizes within, at or beyond each capacity.
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = kmd::param_type(call.types, i);
        if (kmd::is_value(t)) {
            call.params[i].value.a = in.u32();
            call.params[i].value.b = in.u32();
        } else if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT) {
            const uint32_t cap = call.capacity[i];
            const uint32_t choice = in.below(3);
            call.params[i].memref.size = choice == 0 ? cap : choice == 1 ? in.u32() % (cap + 1) : cap + 1 + in.u8();
            if (!call.null[i])
                std::memset(call.buffers[i].data(), 0x3C, std::min<size_t>(cap, call.buffers[i].size()));
        }
    }
    const TEE_Result result = in.u32();
    const Bytes reply = kmd::encode_invoke_reply(result, TEE_ORIGIN_TRUSTED_APP, call);
    FUZZ_CHECK(reply.size() >= 13 && kmd::frame_length(reply.data()) == reply.size() - 4 &&
                   reply[4] == (kmd::kInvoke | kmd::kReply),
               "reply framing wrong");
    ClientCall client(call);
    kmd::FrameReader body(reply.data() + 13, reply.size() - 13);
    FUZZ_CHECK(kmd::decode_invoke_reply(body, call.types, client.params, client.capacity),
               "the client refuses kmd's own reply");
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = kmd::param_type(call.types, i);
        if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT)
            FUZZ_CHECK(client.params[i].memref.size == call.params[i].memref.size, "parameter %d: size %u, sent %u", i,
                       client.params[i].memref.size, call.params[i].memref.size);
    }
    // Any bytes as a reply: accepted or not, nothing lands outside the buffers.
    const Bytes junk = in.rest();
    ClientCall other(call);
    kmd::FrameReader any(junk.data(), junk.size());
    (void)kmd::decode_invoke_reply(any, call.types, other.params, other.capacity);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzInput in(data, size);
    const Bytes body = in.lv(4096);
    kmd::InvokeCall call;
    kmd::FrameReader reader(body.data(), body.size());
    const TEE_Result res = kmd::decode_invoke(reader, &call);
    if (res != TEE_SUCCESS) {
        FUZZ_CHECK(res == TEE_ERROR_BAD_FORMAT || res == TEE_ERROR_BAD_PARAMETERS || res == TEE_ERROR_EXCESS_DATA,
                   "decode_invoke failed with 0x%08x", res);
        return 0;
    }
    std::vector<uint8_t> frame;
    FUZZ_CHECK(kmd::encode_invoke(call.session, call.command, call.types, call.params, &frame) == TEE_SUCCESS,
               "encode_invoke refuses a decoded call");
    Bytes expected(4, 0);
    expected.push_back(kmd::kInvoke);
    expected.insert(expected.end(), body.begin(), body.end());
    const uint32_t n = static_cast<uint32_t>(expected.size() - 4);
    for (int i = 0; i < 4; ++i)
        expected[i] = static_cast<uint8_t>(n >> (8 * i));
    FUZZ_CHECK(frame == expected, "a decoded call encodes as %s, not %s", to_hex(frame).c_str(),
               to_hex(expected).c_str());
    check_reply(call, in);
    return 0;
}
