/*
 * Operations through the command interface: HMAC MACs checked against
 * OpenSSL, the 16-slot pool and its handles, the release rules of update,
 * finish and abort, and allocation failures in every command.
 */
#include <cstring>

#include <openssl/evp.h>
#include <openssl/hmac.h>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

Bytes openssl_hmac(uint32_t digest, const Bytes &key, const Bytes &msg) {
    Bytes out(EVP_MAX_MD_SIZE);
    unsigned int len = 0;
    HMAC(md_for(digest), key.data(), static_cast<int>(key.size()), msg.data(), msg.size(), out.data(), &len);
    out.resize(len);
    return out;
}

ParamSet mac_params(uint32_t mac_bits) {
    ParamSet p;
    p.add(KM_TAG_MAC_LENGTH, mac_bits);
    return p;
}

class Operation : public KeyTest {
  protected:
    Bytes import_hmac(uint32_t digest, const Bytes &key, uint32_t min_mac = 64) {
        ParamSet params;
        params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
            .add(KM_TAG_DIGEST, digest)
            .add(KM_TAG_MIN_MAC_LENGTH, min_mac)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
            .add_bool(KM_TAG_NO_AUTH_REQUIRED);
        Bytes blob;
        EXPECT_TRUE(import(params, key, &blob).ok()) << dump_log();
        return blob;
    }
    Bytes sample(size_t n, uint8_t seed) {
        Bytes b(n);
        for (size_t i = 0; i < n; ++i)
            b[i] = static_cast<uint8_t>(seed + i * 31);
        return b;
    }
};

TEST_F(Operation, HmacMatchesOpenSslForEveryDigestAndChunking) {
    const struct {
        uint32_t digest, key_bytes, mac_bits;
    } rows[] = {{1, 16, 128}, {2, 20, 160}, {3, 28, 224}, {4, 32, 256}, {5, 48, 384}, {6, 64, 512}};
    const Bytes message = sample(300, 7);
    for (const auto &r : rows) {
        SCOPED_TRACE(testing::Message() << "digest " << r.digest);
        Bytes key = sample(r.key_bytes, static_cast<uint8_t>(r.digest));
        Bytes blob = import_hmac(r.digest, key);
        Bytes full = openssl_hmac(r.digest, key, message);
        ASSERT_EQ(full.size() * 8, r.mac_bits);
        for (size_t chunk : {message.size(), size_t{1}, size_t{7}, size_t{129}}) {
            for (uint32_t bits : {r.mac_bits, 64u, 96u}) {
                Bytes mac;
                ASSERT_TRUE(run(KM_PURPOSE_SIGN, blob, mac_params(bits), message, chunk, {}, &mac).ok()) << dump_log();
                EXPECT_EQ(to_hex(mac), to_hex(Bytes(full.begin(), full.begin() + bits / 8))) << chunk << " " << bits;

                Bytes none;
                EXPECT_TRUE(run(KM_PURPOSE_VERIFY, blob, mac_params(bits), message, chunk, mac, &none).ok());
                EXPECT_TRUE(none.empty());
                Bytes bad = mac;
                bad[bad.size() / 2] ^= 0x40;
                tee_host::trace::clear();
                Outcome o = run(KM_PURPOSE_VERIFY, blob, mac_params(bits), message, chunk, bad, &none);
                EXPECT_EQ(o.res, TEE_SUCCESS);
                EXPECT_EQ(o.error, KM_ERROR_VERIFICATION_FAILED);
                EXPECT_TRUE(logged_message("Signature mismatch"));
            }
        }
    }
}

TEST_F(Operation, MacLengthRules) {
    Bytes key = sample(32, 1);
    Bytes blob = import_hmac(KM_DIGEST_SHA_2_256, key, 128);
    Bytes msg = sample(50, 2);
    Bytes mac;
    // 160 bits: the leftmost 20 bytes.
    ASSERT_TRUE(run(KM_PURPOSE_SIGN, blob, mac_params(160), msg, 50, {}, &mac).ok());
    const Bytes full = openssl_hmac(4, key, msg);
    EXPECT_EQ(mac, Bytes(full.begin(), full.begin() + 20));
    // Longer than the digest: refused at finish.
    tee_host::trace::clear();
    Outcome o = run(KM_PURPOSE_SIGN, blob, mac_params(520), msg, 50, {}, &mac);
    EXPECT_EQ(o.error, KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged_message("Too short output of HMAC operation, expect at least 65B, got 32B")) << dump_log();
    // Below the key's minimum: refused at begin.
    uint32_t handle = 0;
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, mac_params(96), &handle).error, KM_ERROR_INVALID_MAC_LENGTH);
    EXPECT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(128), &handle).ok());
    EXPECT_TRUE(abort(handle).ok());
    // No MAC length at all.
    for (uint32_t purpose : {KM_PURPOSE_SIGN, KM_PURPOSE_VERIFY}) {
        tee_host::trace::clear();
        EXPECT_EQ(begin(purpose, blob, {}, &handle).error, KM_ERROR_INVALID_ARGUMENT);
        EXPECT_TRUE(logged_message("No or too many KM_TAG_MAC_LENGTH"));
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Create operation failed"));
    }
    // A signature of another length than the MAC length never verifies.
    Bytes longer = mac;
    ASSERT_TRUE(run(KM_PURPOSE_SIGN, blob, mac_params(160), msg, 50, {}, &mac).ok());
    longer = mac;
    longer.push_back(0);
    Bytes out;
    EXPECT_EQ(run(KM_PURPOSE_VERIFY, blob, mac_params(160), msg, 50, longer, &out).error, KM_ERROR_VERIFICATION_FAILED);
    EXPECT_EQ(run(KM_PURPOSE_VERIFY, blob, mac_params(160), msg, 50, Bytes(mac.begin(), mac.end() - 1), &out).error,
              KM_ERROR_VERIFICATION_FAILED);
}

TEST_F(Operation, PoolHoldsSixteenAndRefusesTheSeventeenth) {
    Bytes blob = import_hmac(4, sample(32, 3));
    std::vector<uint32_t> handles;
    for (int i = 0; i < 16; ++i) {
        uint32_t h = 0;
        ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok()) << i;
        EXPECT_NE(h, 0u);
        for (uint32_t other : handles)
            EXPECT_NE(other, h);
        handles.push_back(h);
    }
    const size_t live = extra_allocations();
    uint32_t h = 0xFFFF;
    tee_host::trace::clear();
    Outcome o = begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h);
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_TOO_MANY_OPERATIONS);
    EXPECT_EQ(h, 0u);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "operation_pool_add", "Too many operations"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Allocate in operation pool failed"));
    EXPECT_EQ(extra_allocations(), live) << "the refused operation is freed";

    // An abort frees a slot for the next begin.
    EXPECT_TRUE(abort(handles[5]).ok());
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    handles[5] = h;
    for (uint32_t x : handles)
        EXPECT_TRUE(abort(x).ok());
}

TEST_F(Operation, HandlesAreGoneAfterFinishAndAbort) {
    Bytes blob = import_hmac(4, sample(32, 4));
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    Bytes mac;
    ASSERT_TRUE(finish(h, {}, {}, &mac).ok());
    EXPECT_EQ(update(h, {1}).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    EXPECT_EQ(finish(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "operation_pool_get", "Operation handle not found"));

    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    EXPECT_TRUE(abort(h).ok());
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    // An unknown handle leaves params[2] alone.
    Bytes in;
    km::put_lv(in, {1, 2});
    km::put_lv(in, ParamSet{}.serialize());
    Bytes out(16, 0xEE);
    Params p = Params::io(h, 0, &in, &out);
    ASSERT_EQ(invoke(KM_CMD_UPDATE, p), TEE_SUCCESS);
    EXPECT_EQ(static_cast<int32_t>(p.p[0].value.a), KM_ERROR_INVALID_OPERATION_HANDLE);
    EXPECT_EQ(p.p[2].memref.size, 16u);
    EXPECT_EQ(out, Bytes(16, 0xEE));
}

TEST_F(Operation, HandlesAreRedrawnWhenZeroOrTaken) {
    Bytes blob = import_hmac(4, sample(32, 5));
    // First begin draws 0 (refused), then 0x11223344.
    tee_host::rng::script({0, 0, 0, 0, 0x44, 0x33, 0x22, 0x11});
    uint32_t a = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &a).ok());
    EXPECT_EQ(a, 0x11223344u);
    // Second begin draws the live handle again, then a fresh one.
    tee_host::rng::script({0x44, 0x33, 0x22, 0x11, 0x88, 0x77, 0x66, 0x55});
    uint32_t b = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &b).ok());
    EXPECT_EQ(b, 0x55667788u);
    EXPECT_EQ(tee_host::rng::scripted_left(), 0u);
    // A stale handle in a freed slot is not drawn again either.
    EXPECT_TRUE(abort(a).ok());
    tee_host::rng::script({0x44, 0x33, 0x22, 0x11, 0x01, 0x00, 0x00, 0x00});
    uint32_t c = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &c).ok());
    EXPECT_EQ(c, 1u);
    EXPECT_TRUE(abort(b).ok());
    EXPECT_TRUE(abort(c).ok());
}

TEST_F(Operation, FailedUpdatesEndTheOperation) {
    Bytes blob = import_hmac(4, sample(32, 6));
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    // Parameters that do not unmarshal.
    Bytes in;
    km::put_lv(in, {1, 2, 3});
    km::put_lv(in, {9, 0, 0, 0});
    Bytes out(64);
    Params p = Params::io(h, 0, &in, &out);
    tee_host::trace::clear();
    ASSERT_EQ(invoke(KM_CMD_UPDATE, p), TEE_SUCCESS);
    EXPECT_EQ(static_cast<int32_t>(p.p[0].value.a), KM_ERROR_INVALID_ARGUMENT);
    EXPECT_EQ(p.p[0].value.b, 3u) << "b holds the input length even on failure";
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "update", "Unmarshal failed"));
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);

    // A request cut short is a malformed request, and also ends it.
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    Bytes cut = {5, 0, 0, 0, 1};
    Params q = Params::io(h, 0, &cut, &out);
    EXPECT_EQ(invoke(KM_CMD_UPDATE, q), TEE_ERROR_GENERIC);
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
}

TEST_F(Operation, FinishTooSmallForItsOutputStillEndsTheOperation) {
    Bytes blob = import_hmac(4, sample(32, 7));
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    tee_host::trace::clear();
    Outcome o = finish(h, {}, {}, nullptr, 20); // 4 + 32 bytes do not fit
    EXPECT_EQ(o.res, TEE_ERROR_GENERIC);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "finish", "Too short input"));
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
}

TEST_F(Operation, BeginRefusals) {
    Bytes blob = import_hmac(4, sample(32, 8));
    uint32_t h = 0;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, blob, mac_params(256), &h).error, KM_ERROR_UNSUPPORTED_PURPOSE);
    Bytes bad = blob;
    bad[50] ^= 1;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, bad, mac_params(256), &h).res, TEE_ERROR_MAC_INVALID);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Open key failed"));
    Bytes in = {1, 2};
    Bytes out(16);
    Params p = Params::io(KM_PURPOSE_SIGN, 0, &in, &out);
    EXPECT_EQ(invoke(KM_CMD_BEGIN, p), TEE_ERROR_GENERIC);
    Bytes garbage;
    km::put_lv(garbage, blob);
    km::put_lv(garbage, {3, 0, 0, 0});
    Params q = Params::io(KM_PURPOSE_SIGN, 0, &garbage, &out);
    tee_host::trace::clear();
    EXPECT_EQ(invoke(KM_CMD_BEGIN, q), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Unmarshal failed"));
}

TEST_F(Operation, ApplicationDataWithoutIdIsCheckedOnItsOwn) {
    ParamSet params = hmac_params();
    params.add_bytes(KM_TAG_APPLICATION_DATA, "secret");
    Bytes blob;
    ASSERT_TRUE(generate(params, &blob).ok());
    uint32_t h = 0;
    ParamSet with = mac_params(256);
    with.add_bytes(KM_TAG_APPLICATION_DATA, "secret");
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, with, &h).ok());
    EXPECT_TRUE(abort(h).ok());
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).error, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Wrong AppId or AppData"));
}

TEST_F(Operation, OperationsOutliveTheirSessionAndEndWithTheInstance) {
    Bytes blob = import_hmac(4, sample(32, 9));
    uint32_t other = open();
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok());
    tee_->close_session(other);
    EXPECT_TRUE(update(h, {1, 2, 3}).ok());
    uint32_t h2 = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h2).ok());
    // The instance ends with a live operation: it is released, not leaked.
    restart_instance();
    EXPECT_TRUE(tee_host::heap::leaks_at_last_destroy().empty());
    EXPECT_EQ(tee_host::handles::leaked_at_last_destroy(), 0u);
    EXPECT_EQ(update(h2, {1}).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    (void)h;
}

// Every allocation of begin, update and finish fails in turn: each run
// ends in the shortage's own report, with the operation either fully alive
// or gone, and nothing held.
TEST_F(Operation, AllocationFailuresInEveryCommand) {
    Bytes blob = import_hmac(4, sample(32, 10));
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    // A record that cannot be allocated sets no error of its own.
    const Outcome no_record{TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR};
    int points = sweep_allocations("begin", nullptr,
                                   [&] {
                                       uint32_t h = 0;
                                       Outcome o = begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h);
                                       if (o.ok())
                                           abort(h);
                                       return o;
                                   },
                                   {oom,
                                    {TEE_ERROR_BAD_PARAMETERS, 0},
                                    no_record,
                                    {TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED},
                                    {TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}});
    EXPECT_GT(points, 3);

    for (uint32_t cmd : {KM_CMD_UPDATE, KM_CMD_FINISH}) {
        uint32_t h = 0;
        const bool updating = cmd == KM_CMD_UPDATE;
        int n = sweep_allocations(
            updating ? "update" : "finish",
            [&] { ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, mac_params(256), &h).ok()); },
            [&] {
                Outcome o = updating ? update(h, {1, 2, 3}) : finish(h);
                const bool fired = tee_host::heap::injected_failure_fired();
                // Gone after any failure of update and after every finish; alive otherwise.
                Outcome gone = abort(h);
                if (fired || !updating) {
                    EXPECT_EQ(gone.error, KM_ERROR_INVALID_OPERATION_HANDLE);
                } else {
                    EXPECT_TRUE(gone.ok());
                }
                return o;
            },
            {{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}, {TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED}, oom});
        EXPECT_GT(n, 0) << cmd;
    }
}

} // namespace
