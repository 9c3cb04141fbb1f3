/*
 * Memory references as a GP client may really send them: NULL buffers
 * with no size or with a size (a size query) and buffers too small, on
 * every command of the table. Nothing may crash, leak, or report more
 * output than the caller gave room for (outside TEE_ERROR_SHORT_BUFFER).
 */
#include <cstring>
#include <span>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "rsa_keys.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

constexpr uint32_t kTrustedTa = 0; // index into trusted_client_uuids

bool is_memref(uint32_t t) {
    return t == TEE_PARAM_TYPE_MEMREF_INPUT || t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT;
}

class CommandBuffers : public KeyTest {
  protected:
    void SetUp() override {
        KeyTest::SetUp();
        ParamSet rsa;
        rsa.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        rsa.add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN).add(KM_TAG_PADDING, KM_PAD_NONE).add(KM_TAG_DIGEST, KM_DIGEST_NONE);
        ASSERT_TRUE(import(rsa, rsa_material(kRsa1024Pem), &rsa_blob_).ok()) << dump_log();
        ASSERT_TRUE(generate(hmac_params(), &hmac_blob_).ok()) << dump_log();
        hmac_material_ = Bytes(32, 0x42);
    }

    // A well-formed request for each command, so that the handler reaches its output.
    Bytes request(uint32_t cmd, uint32_t *a) {
        *a = 0;
        Bytes in;
        switch (cmd) {
        case KM_CMD_GENERATE_KEY:
            return hmac_params().serialize();
        case KM_CMD_IMPORT_KEY:
            km::put_lv(in, hmac_params().serialize());
            in.insert(in.end(), hmac_material_.begin(), hmac_material_.end());
            return in;
        case KM_CMD_GET_KEY_CHARACTER_SIZE:
        case KM_CMD_GET_KEY_CHARACTER:
            return key_reference(hmac_blob_);
        case KM_CMD_EXPORT_KEY:
            return key_reference(rsa_blob_);
        case KM_CMD_DELETE_KEY:
            return hmac_blob_;
        case KM_CMD_BEGIN: {
            *a = KM_PURPOSE_SIGN;
            ParamSet p;
            p.add(KM_TAG_MAC_LENGTH, 256);
            km::put_lv(in, hmac_blob_);
            km::put_lv(in, p.serialize());
            return in;
        }
        case KM_CMD_UPDATE:
        case KM_CMD_FINISH: {
            ParamSet p;
            p.add(KM_TAG_MAC_LENGTH, 256);
            EXPECT_TRUE(begin(KM_PURPOSE_SIGN, hmac_blob_, p, a).ok());
            km::put_lv(in, Bytes{1, 2, 3});
            km::put_lv(in, ParamSet{}.serialize());
            return in;
        }
        case KM_CMD_GET_SUPPORT_BLK_MODE:
        case KM_CMD_GET_SUPPORT_PADDING_MODE:
        case KM_CMD_GET_SUPPORT_DIGEST:
        case KM_CMD_GET_SUPPORT_IMPORT_FORMAT:
        case KM_CMD_GET_SUPPORT_EXPORT_FORMAT:
            *a = KM_ALGORITHM_RSA;
            return in;
        default:
            return in;
        }
    }

    // One call of cmd with every output (or in/out) reference NULL and claiming `size`.
    void call_with_null_outputs(uint32_t session, uint32_t cmd, uint32_t types, uint32_t size) {
        uint32_t a = 0;
        Bytes in = request(cmd, &a);
        const uint32_t handle = (cmd == KM_CMD_UPDATE || cmd == KM_CMD_FINISH) ? a : 0;
        Params p;
        p.types = types;
        if (!is_memref(TEE_PARAM_TYPE_GET(types, 0))) {
            p.p[0].value.a = a;
            p.p[0].value.b = 0;
        }
        for (uint32_t i = 0; i < 4; ++i) {
            const uint32_t t = TEE_PARAM_TYPE_GET(types, i);
            if (t == TEE_PARAM_TYPE_MEMREF_INPUT) {
                p.p[i].memref.buffer = in.data();
                p.p[i].memref.size = static_cast<uint32_t>(in.size());
            } else if (t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT) {
                p.p[i].memref.buffer = nullptr;
                p.p[i].memref.size = size;
            }
        }
        const TEE_Result res = invoke_on(session, cmd, p);
        // A command this build lacks never reaches a handler and leaves everything as given.
        const uint32_t given = res == TEE_ERROR_NOT_IMPLEMENTED ? size : 0;
        for (uint32_t i = 0; i < 4; ++i) {
            const uint32_t t = TEE_PARAM_TYPE_GET(types, i);
            if (t != TEE_PARAM_TYPE_MEMREF_OUTPUT && t != TEE_PARAM_TYPE_MEMREF_INOUT)
                continue;
            EXPECT_EQ(p.p[i].memref.buffer, nullptr) << std::hex << cmd;
            if (res != TEE_ERROR_SHORT_BUFFER) {
                EXPECT_EQ(p.p[i].memref.size, given) << std::hex << "command 0x" << cmd << " size " << std::dec << size
                                                     << " result 0x" << std::hex << res;
            }
        }
        if (handle)
            abort(handle);
    }

    Bytes rsa_blob_;
    Bytes hmac_blob_;
    Bytes hmac_material_;
};

struct Shape {
    uint32_t id;
    uint32_t types;
};

const Shape kShapes[] = {
    {1, 0x0003},      {2, 0x0603},      {3, 0x0003},      {4, 0x0603},      {5, 0x0003},      {6, 0x0603},
    {7, 0x0003},      {8, 0x0603},      {9, 0x0003},      {10, 0x0603},     {11, 0x0003},     {12, 0x0603},
    {13, 0x0653},     {14, 0x0053},     {15, 0x0653},     {16, 0x0653},     {17, 0x0653},     {18, 0x0653},
    {19, 0x0653},     {20, 0x0653},     {21, 0x0053},     {22, 0x0003},     {23, 0x0003},     {27, 0x0007},
    {0xFF00, 0x0003}, {0xFF01, 0x0003}, {0xFF02, 0x0602}, {0xFF03, 0x0602}, {0xFF04, 0x0050},
};

// Every command, a thousand times with each of the three NULL shapes: no
// crash, no growth of the TA heap, no output size the caller has no room for.
TEST_F(CommandBuffers, NullOutputsOnEveryCommand) {
    const uint32_t trusted = open(&trusted_client_uuids[kTrustedTa]);
    const size_t base = tee_host::heap::stats().live_count;
    for (const Shape &shape : kShapes) {
        const uint32_t session = shape.id == KM_CMD_OPEN_KEY ? trusted : session_;
        for (uint32_t size : {0u, 1u, 4096u}) {
            for (int i = 0; i < 1000; ++i)
                call_with_null_outputs(session, shape.id, shape.types, size);
            tee_host::trace::clear();
            ASSERT_EQ(tee_host::heap::stats().live_count, base)
                << "command 0x" << std::hex << shape.id << " with NULL of size " << std::dec << size;
        }
    }
    tee_->close_session(trusted);
}

// The handlers that reported more than the room they were given.
TEST_F(CommandBuffers, ShortOutputsNeverReportMoreThanTheirRoom) {
    // An RSA-1024 public key takes 162 bytes.
    Bytes der;
    Outcome o = export_key(key_reference(rsa_blob_), &der, 16);
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_UNKNOWN_ERROR);
    EXPECT_LE(der.size(), 16u);
    EXPECT_TRUE(export_key(key_reference(rsa_blob_), &der, 162).ok());
    EXPECT_EQ(der.size(), 162u);

    // A generate that fails after sealing began wipes all the room the
    // caller gave: derivation bytes and nonce never stay behind.
    Bytes in = hmac_params().serialize();
    int points = sweep_allocations("generate", nullptr,
                                   [&] {
                                       Bytes out(4096, 0xEE);
                                       Params p = Params::io(0, 0, &in, &out);
                                       Outcome r{invoke(KM_CMD_GENERATE_KEY, p), static_cast<int32_t>(p.p[0].value.a)};
                                       if (!r.ok()) {
                                           EXPECT_EQ(p.p[2].memref.size, 0u);
                                           EXPECT_EQ(out, Bytes(4096, 0x00))
                                               << "left behind: " << to_hex(Bytes(out.begin(), out.begin() + 80));
                                       }
                                       return r;
                                   },
                                   {{TEE_ERROR_OUT_OF_MEMORY, 0}, {TEE_ERROR_BAD_PARAMETERS, 0}});
    EXPECT_GT(points, 5);
}

} // namespace
