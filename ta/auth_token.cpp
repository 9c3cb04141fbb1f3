/*
 * auth_token.cpp - the auth-token key, token verification, the token cache
 * and check_auth.
 */
#include "auth_token.h"

#include "authorization.h"
#include "byte_io.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

struct auth_token_slot_t {
    uint8_t free;
    uint8_t token[kAuthTokenSize];
};

TEE_ObjectHandle auth_token_key = nullptr;
auth_token_slot_t *auth_token_cache = nullptr;

constexpr uint32_t kChallengeOffset = 1;
constexpr uint32_t kUserIdOffset = 9;
constexpr uint32_t kAuthenticatorIdOffset = 17;
constexpr uint32_t kAuthTypeOffset = 25;
constexpr uint32_t kTimestampOffset = 29;

uint32_t get_u32be(const uint8_t *p) {
    return uint32_t{p[0]} << 24 | uint32_t{p[1]} << 16 | uint32_t{p[2]} << 8 | uint32_t{p[3]};
}
uint64_t get_u64be(const uint8_t *p) { return uint64_t{get_u32be(p)} << 32 | get_u32be(p + 4); }

void release_all() {
    ta_free(use_log);
    ta_free(auth_token_cache);
    if (auth_token_key)
        TEE_FreeTransientObject(auth_token_key);
    use_log = nullptr;
    auth_token_cache = nullptr;
    auth_token_key = nullptr;
}

} // namespace

TEE_Result authorizaiton_init() {
    uint8_t seed[32] = {};
    TEE_Attribute attr{};
    scope_exit wipe([&] { TEE_MemFill(seed, 0, sizeof seed); });
    release_all();

    TEE_Result res = TEE_AllocateTransientObject(TEE_TYPE_HMAC_SHA256, 256, &auth_token_key);
    if (res != TEE_SUCCESS) {
        KM_ERR("AllocateTransientObject failed with 0x%08x\n", res);
        auth_token_key = nullptr;
        return res;
    }
    res = TEE_GetBootSeed(seed, sizeof seed);
    if (res != TEE_SUCCESS) {
        KM_ERR("GetBootSeed failed with 0x%08x\n", res);
        release_all();
        return res;
    }
    TEE_InitRefAttribute(&attr, TEE_ATTR_SECRET_VALUE, seed, sizeof seed);
    res = TEE_PopulateTransientObject(auth_token_key, &attr, 1);
    if (res != TEE_SUCCESS) {
        KM_ERR("PopulateTransientObject failed with 0x%08x\n", res);
        release_all();
        return res;
    }
    use_log = static_cast<use_log_entry_t *>(ta_malloc(kUseLogEntries * sizeof(use_log_entry_t)));
    auth_token_cache = use_log ? static_cast<auth_token_slot_t *>(
                                     ta_malloc(kAuthTokenCacheSlots * sizeof(auth_token_slot_t)))
                               : nullptr;
    if (!use_log || !auth_token_cache) {
        KM_ERR("Out of memory");
        release_all();
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    for (uint32_t i = 0; i < kAuthTokenCacheSlots; ++i)
        auth_token_cache[i].free = 1;
    TEE_GetSystemTime(&system_time_at_init);
    TEE_GetREETime(&ree_time_at_init);
    return TEE_SUCCESS;
}

void authorization_deinit() {
    if (auth_token_cache)
        TEE_MemFill(auth_token_cache, 0, kAuthTokenCacheSlots * sizeof(auth_token_slot_t));
    release_all();
}

void ComputeSignature(uint8_t *out, uint32_t out_len, TEE_ObjectHandle key, const uint8_t *data, uint32_t data_len) {
    uint8_t mac[256] = {};
    uint32_t mac_len = sizeof mac;
    if (out_len != 32) {
        TEE_MemFill(out, 0, out_len);
        KM_ERR("Wrong signature size, expected %dB, got %dB\n", 32, static_cast<int>(out_len));
    }
    operation_guard op;
    TEE_Result res = TEE_AllocateOperation(op.out(), TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 256);
    if (res != TEE_SUCCESS) {
        KM_ERR("AllocateOperation failed with 0x%08x\n", res);
        TEE_MemFill(out, 0, out_len);
        return;
    }
    res = TEE_SetOperationKey(op.get(), key);
    if (res != TEE_SUCCESS) {
        KM_ERR("SetOperationKey failed with 0x%08x\n", res);
        TEE_MemFill(out, 0, out_len);
        return;
    }
    TEE_MACInit(op.get(), nullptr, 0);
    res = TEE_MACComputeFinal(op.get(), data, data_len, mac, &mac_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("MACComputeFinal failed with 0x%08x\n", res);
        TEE_MemFill(out, 0, out_len);
        return;
    }
    if (mac_len != 32)
        KM_ERR("Wrong MAC length, expected %dB, got %dB\n", 32, static_cast<int>(mac_len));
    TEE_MemMove(out, mac, out_len < mac_len ? out_len : mac_len);
}

uint32_t check_auth_token_valid(const uint8_t *token, uint32_t token_len) {
    if (token_len != kAuthTokenSize) {
        KM_ERR("Wrong auth token size, expected %dB, got %dB", static_cast<int>(kAuthTokenSize),
               static_cast<int>(token_len));
        return 1;
    }
    if (token[0] != 0) {
        KM_ERR("Wrong auth token version, expected %d, got %d", 0, token[0]);
        return 1;
    }
    uint8_t expected[32] = {};
    ComputeSignature(expected, sizeof expected, auth_token_key, token, kAuthTokenMacOffset);
    // Compare every byte: the time taken must not tell how much matched.
    uint8_t diff = 0;
    for (uint32_t i = 0; i < sizeof expected; ++i)
        diff |= static_cast<uint8_t>(expected[i] ^ token[kAuthTokenMacOffset + i]);
    return diff == 0 ? 0 : 1;
}

void auth_token_cache_add(const uint8_t *token) {
    for (uint32_t i = 0; i < kAuthTokenCacheSlots; ++i)
        if (!auth_token_cache[i].free && TEE_MemCompare(auth_token_cache[i].token, token, kAuthTokenSize) == 0)
            return;
    for (uint32_t i = 0; i < kAuthTokenCacheSlots; ++i) {
        if (auth_token_cache[i].free) {
            TEE_MemMove(auth_token_cache[i].token, token, kAuthTokenSize);
            auth_token_cache[i].free = 0;
            return;
        }
    }
}

uint32_t check_auth(uint64_t secure_id, uint64_t challenge, const uint8_t *token, const key_param_t *timeout,
                    const key_param_t *auth_type) {
    if (token) {
        uint32_t type = get_u32be(token + kAuthTypeOffset);
        auth_token_cache_add(token);
        if (get_u64le(token + kUserIdOffset) != secure_id && get_u64le(token + kAuthenticatorIdOffset) != secure_id) {
            KM_ERR("User id mismatch");
            return 1;
        }
        if ((type & auth_type->enumerated) == 0) {
            KM_ERR("Auth type mismatch");
            return 1;
        }
        if (challenge == 0 || get_u64le(token + kChallengeOffset) == challenge)
            return 0;
        KM_ERR("Challenge mismatch");
        return 1;
    }
    if (!timeout)
        return 1;
    TEE_Time now{};
    TEE_GetSystemTime(&now);
    const uint64_t now_ms = uint64_t{now.seconds} * 1000 + now.millis;
    const uint64_t window_ms = uint64_t{timeout->integer} * 1000;
    for (uint32_t i = 0; i < kAuthTokenCacheSlots; ++i) {
        const auth_token_slot_t &slot = auth_token_cache[i];
        if (slot.free)
            continue;
        if (get_u64le(slot.token + kUserIdOffset) != secure_id)
            continue;
        if ((get_u32be(slot.token + kAuthTypeOffset) & auth_type->enumerated) == 0)
            continue;
        // A token stamped in the future wraps to a huge age and never counts.
        if (now_ms - get_u64be(slot.token + kTimestampOffset) < window_ms)
            return 0;
    }
    return 1;
}
