/*
 * The authorization policy through begin, update and finish: purposes and
 * digests, validity dates, use counts and the use log, rate limits,
 * bootloader-only keys, caller nonces, and user authentication with auth
 * tokens minted from the platform's boot seed.
 */
#include <algorithm>

#include "authorization.h"
#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

constexpr uint64_t kSid = 0x1122334455667788ull;
constexpr uint32_t kFingerprint = 2;

ParamSet sign_params() {
    ParamSet p;
    p.add(KM_TAG_MAC_LENGTH, 256);
    return p;
}

class Authorization : public KeyTest {
  protected:
    void SetUp() override {
        KeyTest::SetUp();
        // Freeze the clocks, then start the instance anew so that its time
        // anchors come from the frozen clocks: wall time is then REE time.
        tee_host::clock::freeze();
        tee_host::clock::set_ree_ms(1800000000000ull);
        restart_instance();
    }
    // An HMAC key with the default authorizations plus `extra`, without NO_AUTH_REQUIRED when asked.
    Bytes key(const ParamSet &extra, bool no_auth = true) {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
            .add(KM_TAG_KEY_SIZE, 256)
            .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
            .add(KM_TAG_MIN_MAC_LENGTH, 128)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        if (no_auth)
            p.add_bool(KM_TAG_NO_AUTH_REQUIRED);
        for (const auto &x : extra.params())
            km::tag_is_bytes(x.tag) ? p.add_bytes(x.tag, x.bytes) : p.add(x.tag, x.value);
        Bytes blob;
        EXPECT_TRUE(generate(p, &blob).ok()) << dump_log();
        return blob;
    }
    // begin then abort; the begin's outcome.
    Outcome try_begin(const Bytes &blob, const ParamSet &params = sign_params(), uint32_t purpose = KM_PURPOSE_SIGN) {
        uint32_t h = 0;
        Outcome o = begin(purpose, blob, params, &h);
        if (o.ok()) {
            EXPECT_TRUE(abort(h).ok());
        }
        return o;
    }
    ParamSet with_token(const Bytes &token, ParamSet p = sign_params()) {
        p.add_bytes(KM_TAG_AUTH_TOKEN, token);
        return p;
    }
    Bytes fresh_token(uint64_t challenge = 0, uint64_t user = kSid, uint32_t type = kFingerprint) {
        return mint_token(challenge, user, 0, type, tee_host::clock::system_ms());
    }
    ParamSet auth_key_params(bool with_timeout) {
        ParamSet p;
        p.add(KM_TAG_USER_SECURE_ID, kSid).add(KM_TAG_USER_AUTH_TYPE, kFingerprint);
        if (with_timeout)
            p.add(KM_TAG_AUTH_TIMEOUT, 60);
        return p;
    }
};

TEST_F(Authorization, PurposeAndDigestMustBeAllowed) {
    Bytes blob = key({});
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob, sign_params(), KM_PURPOSE_VERIFY).error, KM_ERROR_INCOMPATIBLE_PURPOSE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "authorize_begin", "No such purpose in key_params"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "begin", "Authorization failed"));

    ParamSet sha1 = sign_params();
    sha1.add(KM_TAG_DIGEST, KM_DIGEST_SHA1);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob, sha1).error, KM_ERROR_INCOMPATIBLE_DIGEST);
    EXPECT_TRUE(logged_message("No such digest in key_params"));
    ParamSet sha256 = sign_params();
    sha256.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    EXPECT_TRUE(try_begin(blob, sha256).ok());
    EXPECT_TRUE(try_begin(blob).ok()) << "no digest asked: nothing to match";
}

TEST_F(Authorization, ValidityDatesAgainstTheWallTime) {
    const uint64_t now = tee_host::clock::ree_ms();
    ParamSet active_now;
    active_now.add(KM_TAG_ACTIVE_DATETIME, now);
    EXPECT_TRUE(try_begin(key(active_now)).ok());
    ParamSet active_later;
    active_later.add(KM_TAG_ACTIVE_DATETIME, now + 1);
    Bytes later = key(active_later);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(later).error, KM_ERROR_KEY_NOT_YET_VALID);
    EXPECT_TRUE(logged_message("Key not yet valid"));
    tee_host::clock::advance_ms(1);
    EXPECT_TRUE(try_begin(later).ok());

    ParamSet expires;
    expires.add(KM_TAG_ORIGINATION_EXPIRE_DATETIME, tee_host::clock::ree_ms());
    Bytes expiring = key(expires);
    EXPECT_TRUE(try_begin(expiring).ok()) << "an expiry equal to now still passes";
    tee_host::clock::advance_ms(1);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(expiring).error, KM_ERROR_KEY_EXPIRED);
    EXPECT_TRUE(logged_message("Key expired"));

    // Usage expiry concerns verification, not signing.
    ParamSet usage;
    usage.add(KM_TAG_USAGE_EXPIRE_DATETIME, tee_host::clock::ree_ms() - 10).add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
    Bytes used = key(usage);
    EXPECT_TRUE(try_begin(used).ok());
    EXPECT_EQ(try_begin(used, sign_params(), KM_PURPOSE_VERIFY).error, KM_ERROR_KEY_EXPIRED);
}

TEST_F(Authorization, RateLimitCountsWholeSeconds) {
    ParamSet p;
    p.add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 5);
    Bytes blob = key(p);
    EXPECT_TRUE(try_begin(blob).ok());
    tee_host::clock::advance_ms(5000);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_RATE_LIMIT_EXCEEDED);
    EXPECT_TRUE(logged_message("key rate limit exceeded"));
    tee_host::clock::advance_ms(1000);
    EXPECT_TRUE(try_begin(blob).ok());
    EXPECT_NE(try_begin(blob).error, KM_ERROR_OK) << "the last authorized begin restarts the wait";
}

TEST_F(Authorization, MaxUsesPerBootAndTheUseLog) {
    ParamSet p;
    p.add(KM_TAG_MAX_USES_PER_BOOT, 2);
    Bytes blob = key(p);
    EXPECT_TRUE(try_begin(blob).ok());
    EXPECT_TRUE(try_begin(blob).ok());
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_MAX_OPS_EXCEEDED);
    EXPECT_TRUE(logged_message("Key max ops exceeded"));

    // Seven more keys fill the eight entries; the ninth key finds no room.
    for (int i = 0; i < 7; ++i)
        EXPECT_TRUE(try_begin(key(p)).ok()) << i;
    Bytes ninth = key(p);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(ninth).error, KM_ERROR_TOO_MANY_OPERATIONS);
    EXPECT_TRUE(logged_message("Too many use log"));

    // Counts last as long as the instance.
    restart_instance();
    EXPECT_TRUE(try_begin(blob).ok());
    EXPECT_TRUE(try_begin(ninth).ok());
}

TEST_F(Authorization, LongBlobsAreTrackedByTheirDigest) {
    // Through begin: a blob longer than an entry is counted like any other.
    ParamSet p;
    p.add(KM_TAG_MAX_USES_PER_BOOT, 1).add_bytes(KM_TAG_APPLICATION_DATA, Bytes(3000, 0x61));
    Bytes blob = key(p);
    ASSERT_GT(blob.size(), 2048u);
    ParamSet params = sign_params();
    params.add_bytes(KM_TAG_APPLICATION_DATA, Bytes(3000, 0x61));
    EXPECT_TRUE(try_begin(blob, params).ok());
    EXPECT_EQ(try_begin(blob, params).error, KM_ERROR_KEY_MAX_OPS_EXCEEDED);

    // Two valid blobs never share 2048 bytes, so the identifiers are fed to
    // the use log directly: long ones that share their first 2048 bytes, or
    // a long one and its own 2048-byte prefix, are different keys.
    Bytes first(3000, 0x33);
    Bytes second = first;
    second.back() ^= 1;
    Bytes prefix(first.begin(), first.begin() + 2048);
    int32_t error = 0;
    EXPECT_EQ(check_use_count_and_add(first.data(), 3000, 1, &error), 0u);
    EXPECT_EQ(check_use_count_and_add(first.data(), 3000, 1, &error), 1u);
    EXPECT_EQ(error, KM_ERROR_KEY_MAX_OPS_EXCEEDED);
    EXPECT_EQ(check_use_count_and_add(second.data(), 3000, 1, &error), 0u) << "a different tail is another key";
    EXPECT_EQ(check_use_count_and_add(prefix.data(), 2048, 1, &error), 0u) << "a prefix is another key";
    EXPECT_EQ(check_use_count_and_add(first.data(), 2999, 1, &error), 0u) << "a shorter blob is another key";
}

TEST_F(Authorization, BootloaderOnlyKeysAreRefused) {
    ParamSet bl;
    bl.add_bool(KM_TAG_BOOTLOADER_ONLY);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(key(bl)).error, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(logged_message("Bootloader only key"));
}

TEST_F(Authorization, MisconfiguredUserAuthentication) {
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(key(auth_key_params(false), true)).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged_message("Found KM_TAG_USER_SECURE_ID but also KM_TAG_NO_AUTH_REQUIRED"));
    ParamSet no_type;
    no_type.add(KM_TAG_USER_SECURE_ID, kSid);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(key(no_type, false)).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged_message("Found KM_TAG_USER_SECURE_ID but no KM_TAG_USER_AUTH_TYPE"));
}

TEST_F(Authorization, TokensAtBeginForKeysWithATimeout) {
    Bytes blob = key(auth_key_params(true), false);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
    EXPECT_TRUE(logged_message("Auth token check failed"));

    Bytes good = fresh_token();
    struct Case {
        const char *what;
        Bytes token;
        int32_t error;
        const char *log;
    };
    Bytes bad_mac = good;
    bad_mac[60] ^= 1;
    Bytes changed_field = good;
    changed_field[10] ^= 1;
    Bytes v1 = mint_token(0, kSid, 0, kFingerprint, tee_host::clock::system_ms(), 1);
    const Case cases[] = {
        {"bad MAC", bad_mac, KM_ERROR_INVALID_ARGUMENT, nullptr},
        {"field changed", changed_field, KM_ERROR_INVALID_ARGUMENT, nullptr},
        {"68 bytes", Bytes(good.begin(), good.end() - 1), KM_ERROR_INVALID_ARGUMENT,
         "Wrong auth token size, expected 69B, got 68B"},
        {"70 bytes",
         [&] {
             Bytes b = good;
             b.push_back(0);
             return b;
         }(),
         KM_ERROR_INVALID_ARGUMENT, "Wrong auth token size, expected 69B, got 70B"},
        {"version 1", v1, KM_ERROR_INVALID_ARGUMENT, "Wrong auth token version, expected 0, got 1"},
        {"other user", fresh_token(0, kSid + 1), KM_ERROR_KEY_USER_NOT_AUTHENTICATED, "User id mismatch"},
        {"other type", fresh_token(0, kSid, 1), KM_ERROR_KEY_USER_NOT_AUTHENTICATED, "Auth type mismatch"},
    };
    for (const Case &c : cases) {
        tee_host::trace::clear();
        EXPECT_EQ(try_begin(blob, with_token(c.token)).error, c.error) << c.what;
        if (c.log) {
            EXPECT_TRUE(logged_message(c.log)) << c.what << "\n" << dump_log();
        }
    }
    // A token shown once is remembered while it is fresh.
    EXPECT_TRUE(try_begin(blob, with_token(good)).ok());
    EXPECT_TRUE(try_begin(blob).ok());
    tee_host::clock::advance_ms(59999);
    EXPECT_TRUE(try_begin(blob).ok());
    tee_host::clock::advance_ms(1);
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
    // A token stamped in the future never counts as fresh.
    Bytes future = mint_token(0, kSid, 0, kFingerprint, tee_host::clock::system_ms() + 1000);
    EXPECT_TRUE(try_begin(blob, with_token(future)).ok()) << "given directly, the timestamp is not read";
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
}

TEST_F(Authorization, AuthenticatorIdCountsOnlyWhenGivenDirectly) {
    Bytes blob = key(auth_key_params(true), false);
    Bytes by_authenticator = mint_token(0, 99, kSid, kFingerprint, tee_host::clock::system_ms());
    EXPECT_TRUE(try_begin(blob, with_token(by_authenticator)).ok());
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
}

TEST_F(Authorization, TheTokenCacheHoldsSixteen) {
    Bytes blob = key(auth_key_params(true), false);
    // Sixteen distinct tokens of another user fill the cache.
    for (uint64_t i = 0; i < 16; ++i)
        EXPECT_EQ(try_begin(blob, with_token(fresh_token(i + 1, kSid + 100))).error,
                  KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
    Bytes good = fresh_token(77);
    EXPECT_TRUE(try_begin(blob, with_token(good)).ok()) << "still accepted when given directly";
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED) << "but not cached";
}

TEST_F(Authorization, PerOperationTokensAtUpdateAndFinish) {
    Bytes blob = key(auth_key_params(false), false);
    uint32_t h = 0;
    tee_host::trace::clear();
    Outcome o = begin(KM_PURPOSE_SIGN, blob, sign_params(), &h);
    EXPECT_TRUE(o.ok()) << "the deferred outcome reads as success";
    EXPECT_TRUE(logged_message("OP AUTH NEEDED"));

    tee_host::trace::clear();
    EXPECT_EQ(update(h, {1, 2}).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "authorize_update_or_finish", "Auth token check failed"));
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE) << "a refused update ends the operation";

    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, sign_params(), &h).ok());
    ParamSet ok_token;
    ok_token.add_bytes(KM_TAG_AUTH_TOKEN, fresh_token(h));
    EXPECT_TRUE(update(h, {1, 2}, ok_token).ok());
    ParamSet wrong_challenge;
    wrong_challenge.add_bytes(KM_TAG_AUTH_TOKEN, fresh_token(h + 1));
    tee_host::trace::clear();
    EXPECT_EQ(finish(h, {}, wrong_challenge).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED);
    EXPECT_TRUE(logged_message("Challenge mismatch"));
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);

    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, sign_params(), &h).ok());
    ParamSet tok;
    tok.add_bytes(KM_TAG_AUTH_TOKEN, fresh_token(h));
    EXPECT_TRUE(update(h, {1}, tok).ok());
    Bytes mac;
    EXPECT_TRUE(finish(h, {}, tok, &mac).ok());
    EXPECT_EQ(mac.size(), 32u);
    // A bad token at update is an invalid argument.
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, sign_params(), &h).ok());
    ParamSet broken;
    broken.add_bytes(KM_TAG_AUTH_TOKEN, Bytes(69, 0));
    EXPECT_EQ(update(h, {1}, broken).error, KM_ERROR_INVALID_ARGUMENT);
}

TEST_F(Authorization, ABadTokenFailsEvenForKeysWithoutAuthentication) {
    Bytes blob = key({});
    Bytes bad = fresh_token();
    bad[40] ^= 1;
    EXPECT_EQ(try_begin(blob, with_token(bad)).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(try_begin(blob, with_token(fresh_token())).ok());
}

// A token is only as good as the MAC it is checked against: when that MAC
// cannot be computed (no memory, a TEE failure), the token is refused and
// never cached, whatever its own MAC bytes say.
TEST_F(Authorization, ATokenIsRefusedWhenItsMacCannotBeComputed) {
    Bytes blob = key(auth_key_params(true), false); // with a timeout: cached tokens would count
    Bytes forged = mint_token(0, kSid, 0, kFingerprint, tee_host::clock::system_ms());
    std::fill(forged.begin() + 37, forged.end(), 0);
    EXPECT_EQ(try_begin(blob, with_token(forged)).error, KM_ERROR_INVALID_ARGUMENT);
    int points =
        sweep_allocations("begin with an all-zero MAC", nullptr, [&] { return try_begin(blob, with_token(forged)); },
                          {{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT},
                           {TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED},
                           {TEE_ERROR_OUT_OF_MEMORY, 0},
                           {TEE_ERROR_BAD_PARAMETERS, 0}});
    EXPECT_GT(points, 3);
    tee_host::trace::clear();
    EXPECT_EQ(try_begin(blob).error, KM_ERROR_KEY_USER_NOT_AUTHENTICATED) << "the forged token was cached";
}

// Rate limits and use counts need a use-log entry; a full log refuses the
// begin rather than letting the key run unlimited.
TEST_F(Authorization, AFullUseLogRefusesRateLimitedKeys) {
    ParamSet counted;
    counted.add(KM_TAG_MAX_USES_PER_BOOT, 5);
    for (int i = 0; i < 8; ++i)
        ASSERT_TRUE(try_begin(key(counted)).ok()) << i;
    ParamSet limited;
    limited.add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 100);
    Bytes ninth = key(limited);
    for (int i = 0; i < 3; ++i) {
        tee_host::trace::clear();
        EXPECT_EQ(try_begin(ninth).error, KM_ERROR_TOO_MANY_OPERATIONS) << i;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "authorize_begin", "Too many use log")) << dump_log();
    }

    // An entry whose window has passed and that counts no use is taken over.
    restart_instance();
    for (int i = 0; i < 7; ++i)
        ASSERT_TRUE(try_begin(key(counted)).ok()) << i;
    ParamSet short_limit;
    short_limit.add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 5);
    Bytes a = key(short_limit);
    Bytes b = key(short_limit);
    EXPECT_TRUE(try_begin(a).ok());
    EXPECT_EQ(try_begin(b).error, KM_ERROR_TOO_MANY_OPERATIONS) << "a's window is still open";
    tee_host::clock::advance_ms(6000);
    EXPECT_TRUE(try_begin(b).ok());
    EXPECT_EQ(try_begin(b).error, KM_ERROR_KEY_RATE_LIMIT_EXCEEDED) << "b is limited, not unlimited";
}

// A begin that needs per-operation tokens keeps the deferred outcome until
// the pool takes the operation: a later failure that names no error of its
// own reports it.
TEST_F(Authorization, TheDeferredOutcomeSurvivesALaterSilentFailure) {
    Bytes blob = key(auth_key_params(false), false);
    bool deferred_seen = false;
    int points = sweep_allocations("begin of a per-operation key", nullptr,
                                   [&] {
                                       uint32_t h = 0;
                                       Outcome o = begin(KM_PURPOSE_SIGN, blob, sign_params(), &h);
                                       if (o.ok())
                                           EXPECT_TRUE(abort(h).ok());
                                       else
                                           EXPECT_EQ(h, 0u);
                                       deferred_seen = deferred_seen || o.error == KM_OP_AUTH_NEEDED;
                                       return o;
                                   },
                                   {{TEE_SUCCESS, KM_OP_AUTH_NEEDED},
                                    // once the key object is made, the provider has reset the error
                                    {TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR},
                                    // the blob's own buffers and parameters
                                    {TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED},
                                    {TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT},
                                    {TEE_ERROR_OUT_OF_MEMORY, 0},
                                    {TEE_ERROR_BAD_PARAMETERS, 0}});
    EXPECT_GT(points, 3);
    EXPECT_TRUE(deferred_seen) << "the record's own allocation failure sets no error";
}

} // namespace
