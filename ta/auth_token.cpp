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

// The fields of a token, read in wire order.
struct auth_token_fields_t {
    uint8_t version;
    uint64_t challenge;
    uint64_t user_id;
    uint64_t authenticator_id;
    uint32_t auth_type;
    uint64_t timestamp;
};

// Parses the 37 authenticated bytes of a token already known to be 69 bytes long.
auth_token_fields_t parse_token(const uint8_t *token) {
    auth_token_fields_t f{};
    byte_reader r(token, kAuthTokenMacOffset);
    // Cannot run short: 1 + 8 + 8 + 8 + 4 + 8 = 37 bytes.
    (void)(r.read_u8(&f.version) && r.read_u64(&f.challenge) && r.read_u64(&f.user_id) &&
           r.read_u64(&f.authenticator_id) && r.read_u32be(&f.auth_type) && r.read_u64be(&f.timestamp));
    return f;
}

void release_all() {
    use_log_release();
    if (auth_token_cache)
        TEE_MemFill(auth_token_cache, 0, kAuthTokenCacheSlots * sizeof(auth_token_slot_t));
    ta_free(auth_token_cache);
    auth_token_cache = nullptr;
    free_object(&auth_token_key);
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
    res = use_log_init();
    auth_token_cache =
        res == TEE_SUCCESS
            ? static_cast<auth_token_slot_t *>(ta_malloc(kAuthTokenCacheSlots * sizeof(auth_token_slot_t)))
            : nullptr;
    if (!auth_token_cache) {
        KM_ERR("Out of memory");
        release_all();
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    for (uint32_t i = 0; i < kAuthTokenCacheSlots; ++i)
        auth_token_cache[i].free = 1;
    time_anchors_init();
    return TEE_SUCCESS;
}

void authorization_deinit() {
    release_all();
}

TEE_Result ComputeSignature(uint8_t *out, uint32_t out_len, TEE_ObjectHandle key, const uint8_t *data,
                            uint32_t data_len) {
    uint8_t mac[256] = {};
    uint32_t mac_len = sizeof mac;
    scope_exit wipe([&] { TEE_MemFill(mac, 0, sizeof mac); });
    if (out_len != 32) {
        TEE_MemFill(out, 0, out_len);
        KM_ERR("Wrong signature size, expected %dB, got %dB\n", 32, static_cast<int>(out_len));
    }
    operation_guard op;
    TEE_Result res = keyed_operation(op.out(), TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 256, key);
    if (res == TEE_SUCCESS) {
        TEE_MACInit(op.get(), nullptr, 0);
        res = TEE_MACComputeFinal(op.get(), data, data_len, mac, &mac_len);
        if (res != TEE_SUCCESS)
            KM_ERR("MACComputeFinal failed with 0x%08x\n", res);
    }
    if (res != TEE_SUCCESS) {
        TEE_MemFill(out, 0, out_len);
        return res;
    }
    if (mac_len != 32)
        KM_ERR("Wrong MAC length, expected %dB, got %dB\n", 32, static_cast<int>(mac_len));
    TEE_MemMove(out, mac, out_len < mac_len ? out_len : mac_len);
    return TEE_SUCCESS;
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
    // No expected MAC, no valid token: a token must never be checked against zeros.
    if (ComputeSignature(expected, sizeof expected, auth_token_key, token, kAuthTokenMacOffset) != TEE_SUCCESS) {
        KM_ERR("Auth token MAC not computed, token refused");
        return 1;
    }
    return bytes_equal_ct(expected, token + kAuthTokenMacOffset, sizeof expected) ? 0 : 1;
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
        const auth_token_fields_t t = parse_token(token);
        auth_token_cache_add(token);
        if (t.user_id != secure_id && t.authenticator_id != secure_id) {
            KM_ERR("User id mismatch");
            return 1;
        }
        if ((t.auth_type & auth_type->enumerated) == 0) {
            KM_ERR("Auth type mismatch");
            return 1;
        }
        if (challenge == 0 || t.challenge == challenge)
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
        const auth_token_fields_t t = parse_token(slot.token);
        if (t.user_id != secure_id || (t.auth_type & auth_type->enumerated) == 0)
            continue;
        // A token stamped in the future wraps to a huge age and never counts.
        if (now_ms - t.timestamp < window_ms)
            return 0;
    }
    return 1;
}
