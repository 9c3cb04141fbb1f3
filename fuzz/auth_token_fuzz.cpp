/*
 * auth_token_fuzz.cpp - the auth-token check and check_auth against a
 * model. A token is valid exactly when it is 69 bytes of version 0 whose
 * MAC verifies under the boot seed; check_auth, given a valid token or
 * none, authenticates exactly as the model of the token cache says (user
 * or authenticator id, a shared type bit, the challenge; from the cache by
 * user id, type and age below the timeout), whatever the clock does.
 */
#include <cstring>

#include "auth_token.h"
#include "fuzz_support.h"

namespace {

struct Fields {
    uint64_t challenge, user_id, authenticator_id, timestamp;
    uint32_t auth_type;
};

Fields fields_of(const Bytes &t) {
    Fields f{};
    for (int i = 0; i < 8; ++i) {
        f.challenge |= uint64_t{t[1 + i]} << (8 * i);
        f.user_id |= uint64_t{t[9 + i]} << (8 * i);
        f.authenticator_id |= uint64_t{t[17 + i]} << (8 * i);
        f.timestamp = f.timestamp << 8 | t[29 + i];
    }
    for (int i = 0; i < 4; ++i)
        f.auth_type = f.auth_type << 8 | t[25 + i];
    return f;
}

// Values from a small pool, so that ids and challenges match often.
uint64_t pick(FuzzInput &in) {
    static const uint64_t pool[] = {0, 1, 42, 43, 0xFFFFFFFFFFFFFFFFull, 0x100000000ull};
    const uint8_t c = in.u8();
    return c < 0xC0 ? pool[c % 6] : in.u64();
}

struct Model {
    std::vector<Bytes> cache; // at most 16, in slot order

    void add(const Bytes &t) {
        for (const Bytes &c : cache)
            if (c == t)
                return;
        if (cache.size() < kAuthTokenCacheSlots)
            cache.push_back(t);
    }
    uint32_t check(uint64_t secure_id, uint64_t challenge, const Bytes *token, const uint32_t *timeout,
                   uint32_t auth_type, uint64_t now_ms) {
        if (token) {
            add(*token);
            const Fields f = fields_of(*token);
            if (f.user_id != secure_id && f.authenticator_id != secure_id)
                return 1;
            if ((f.auth_type & auth_type) == 0)
                return 1;
            return challenge == 0 || f.challenge == challenge ? 0 : 1;
        }
        if (!timeout)
            return 1;
        for (const Bytes &c : cache) {
            const Fields f = fields_of(c);
            if (f.user_id == secure_id && (f.auth_type & auth_type) && now_ms - f.timestamp < uint64_t{*timeout} * 1000)
                return 0;
        }
        return 1;
    }
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee &tee = FuzzTee::instance();
    tee.reset();
    const Bytes seed = tee.tee().boot_seed();
    FuzzInput in(data, size);
    Model model;
    for (int step = 0; step < 48 && !in.empty(); ++step) {
        const uint8_t op = in.u8();
        if (op % 4 == 0) {
            // Raw bytes: valid only when they happen to be a minted token.
            const Bytes raw = in.lv(80);
            bool expected = false;
            if (raw.size() == kAuthTokenSize && raw[0] == 0) {
                AuthTokenFields f{};
                const Fields g = fields_of(raw);
                f = {g.challenge, g.user_id, g.authenticator_id, g.auth_type, g.timestamp, 0};
                expected = mint_auth_token(seed, f) == raw;
            }
            const uint32_t got = check_auth_token_valid(raw.data(), static_cast<uint32_t>(raw.size()));
            FUZZ_CHECK((got == 0) == expected, "token %s judged %u", to_hex(raw).c_str(), got);
            continue;
        }
        if (op % 4 == 1) {
            tee_host::clock::advance_system_ms(in.u32() % 200000);
            continue;
        }
        const uint64_t now = tee_host::clock::system_ms();
        AuthTokenFields f{};
        f.challenge = pick(in);
        f.user_id = pick(in);
        f.authenticator_id = pick(in);
        f.auth_type = in.u8() < 0xC0 ? in.u8() % 4 : in.u32();
        f.timestamp_ms = now - (in.u32() % 120000) + (in.u8() == 0xFF ? 240000 : 0);
        Bytes token = mint_auth_token(seed, f);
        FUZZ_CHECK(token.size() == kAuthTokenSize, "no token minted");
        // One byte changed, or none.
        const uint8_t flip = in.u8();
        if (flip < kAuthTokenSize) {
            token[flip] ^= static_cast<uint8_t>(1 + in.below(255));
            FUZZ_CHECK(check_auth_token_valid(token.data(), kAuthTokenSize) != 0, "token with byte %u changed accepted",
                       flip);
            continue;
        }
        FUZZ_CHECK(check_auth_token_valid(token.data(), kAuthTokenSize) == 0, "a minted token refused");

        const uint64_t secure_id = pick(in);
        const uint64_t challenge = pick(in);
        key_param_t type_param{};
        type_param.tag = KM_TAG_USER_AUTH_TYPE;
        type_param.enumerated = in.u8() < 0xC0 ? 1u + in.u8() % 3 : in.u32();
        key_param_t timeout_param{};
        timeout_param.tag = KM_TAG_AUTH_TIMEOUT;
        timeout_param.integer = in.u8() < 0xC0 ? in.u8() % 130 : in.u32();
        const bool with_token = op & 4;
        const bool with_timeout = op & 8;
        const uint32_t got = check_auth(secure_id, challenge, with_token ? token.data() : nullptr,
                                        with_timeout ? &timeout_param : nullptr, &type_param);
        const uint32_t want = model.check(secure_id, challenge, with_token ? &token : nullptr,
                                          with_timeout ? &timeout_param.integer : nullptr, type_param.enumerated, now);
        FUZZ_CHECK(got == want, "check_auth gave %u, the model %u", got, want);
    }
    return 0;
}
