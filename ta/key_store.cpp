/*
 * key_store.cpp - the key-store keys and the sealing and opening of key
 * blobs.
 */
#include "key_store.h"

#include "byte_io.h"
#include "key_cache.h"
#include "marshal.h"
#include "ta_log.h"
#include "tee_guard.h"

TEE_ObjectHandle derived_ksk = nullptr;
TEE_ObjectHandle rpmb_ksk = nullptr;
// One keyed MAC operation per KSK for the instance's life: every blob derives its key with it.
static TEE_OperationHandle derived_ksk_mac = nullptr;
static TEE_OperationHandle rpmb_ksk_mac = nullptr;

namespace {

constexpr uint32_t kKskSize = 32;
// Pads the 16-byte device identifier to a 256-bit derived KSK.
constexpr uint8_t kDerivedKskFill = 0x5C;
constexpr char kKskObjectId[] = "Keymaster KSK"; // stored with its zero byte: 14 bytes

// make_hmac_sha256_key - a 256-bit HMAC-SHA-256 object holding secret.
TEE_Result make_hmac_sha256_key(const uint8_t *secret, TEE_ObjectHandle *out) {
    return secret_key_object(TEE_TYPE_HMAC_SHA256, 8 * kKskSize, secret, out);
}

// The KSK named by a blob's protection byte; logs and fails like the readers need.
TEE_Result select_ksk(uint8_t kind, TEE_ObjectHandle *ksk, bool *unknown, const char *func = __builtin_FUNCTION()) {
    *unknown = false;
    if (kind == KEY_PROTECTION_DERIVED) {
        *ksk = derived_ksk;
        return TEE_SUCCESS;
    }
    if (kind == KEY_PROTECTION_RPMB) {
        if (!rpmb_ksk) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "RPMB KSK died, fail to open key");
            return TEE_ERROR_STORAGE_NOT_AVAILABLE;
        }
        *ksk = rpmb_ksk;
        return TEE_SUCCESS;
    }
    KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unknown key protection");
    *unknown = true;
    return TEE_SUCCESS;
}

// An AES-256-GCM operation under kk with the blob's nonce and a 128-bit tag.
TEE_Result start_gcm(TEE_ObjectHandle kk, uint32_t mode, const uint8_t *nonce, operation_guard *op) {
    TEE_Result res = keyed_operation(op->out(), TEE_ALG_AES_GCM, mode, 256, kk);
    if (res != TEE_SUCCESS)
        return res;
    res = TEE_AEInit(op->get(), nonce, kBlobNonceSize, kBlobTagSize * 8, 0, 0);
    if (res != TEE_SUCCESS)
        KM_ERR("AEInit failed with 0x%08x\n", res);
    return res;
}

} // namespace

TEE_Result key_store_init_derived_ksk() {
    uint8_t secret[kKskSize];
    TEE_UUID id{};
    TEE_MemFill(secret, kDerivedKskFill, sizeof secret);
    TEE_Result res = TEE_GetPropertyAsUUID(TEE_PROPSET_TEE_IMPLEMENTATION, "gpd.tee.deviceID", &id);
    if (res != TEE_SUCCESS) {
        KM_ERR("GetPropertyAsUUID failed with 0x%08x\n", res);
        return res;
    }
    // The UUID in its in-memory layout, each field little-endian.
    put_u32le(secret, id.timeLow);
    secret[4] = static_cast<uint8_t>(id.timeMid);
    secret[5] = static_cast<uint8_t>(id.timeMid >> 8);
    secret[6] = static_cast<uint8_t>(id.timeHiAndVersion);
    secret[7] = static_cast<uint8_t>(id.timeHiAndVersion >> 8);
    TEE_MemMove(secret + 8, id.clockSeqAndNode, 8);
    res = make_hmac_sha256_key(secret, &derived_ksk);
    TEE_MemFill(secret, 0, sizeof secret);
    return res;
}

bool judge_rpmb() {
    uint32_t status = 0;
    TEE_Result res = TEE_RPMB_MakeFileSystem(&status);
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_RPMB_MakeFileSystem return 0x%08x", res);
        return false;
    }
    return true;
}

TEE_Result key_store_init_rpmb_ksk() {
    persistent_guard pobj;
    uint8_t secret[kKskSize] = {};
    scope_exit wipe([&] { TEE_MemFill(secret, 0, sizeof secret); });

    TEE_Result res = TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskObjectId, sizeof kKskObjectId,
                                              TEE_DATA_FLAG_ACCESS_READ, pobj.out());
    if (res == TEE_ERROR_ITEM_NOT_FOUND) {
        object_guard ksk;
        uint32_t len = sizeof secret;
        res = key_object(TEE_TYPE_HMAC_SHA256, 256, nullptr, 0, ksk.out(), key_fill::generate);
        if (res != TEE_SUCCESS)
            return res;
        res = TEE_GetObjectBufferAttribute(ksk.get(), TEE_ATTR_SECRET_VALUE, secret, &len);
        if (res != TEE_SUCCESS) {
            KM_ERR("GetObjectBufferAttribute failed with 0x%08x\n", res);
            return res;
        }
        if (len != kKskSize) {
            KM_ERR("Wrong key size, expected %dB, got %dB", static_cast<int>(kKskSize), static_cast<int>(len));
            return TEE_ERROR_GENERIC;
        }
        res = TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskObjectId, sizeof kKskObjectId,
                                         TEE_DATA_FLAG_ACCESS_READ, TEE_HANDLE_NULL, secret, kKskSize, pobj.out());
        if (res == TEE_SUCCESS) {
            rpmb_ksk = ksk.release();
            return TEE_SUCCESS;
        }
        if (res != TEE_ERROR_ACCESS_CONFLICT) {
            KM_ERR("CreatePersistentObject failed with 0x%08x\n", res);
            return res;
        }
        // Another TEE on the same storage created it first: every blob must
        // be sealed with one KSK, so use the winner's.
        TEE_MemFill(secret, 0, sizeof secret);
        res = TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskObjectId, sizeof kKskObjectId,
                                       TEE_DATA_FLAG_ACCESS_READ, pobj.out());
    }
    if (res != TEE_SUCCESS) {
        KM_ERR("Open KSK failed with 0x%08x\n", res);
        return res;
    }

    uint32_t count = 0;
    res = TEE_ReadObjectData(pobj.get(), secret, kKskSize, &count);
    if (res != TEE_SUCCESS) {
        KM_ERR("ReadObjectData failed with 0x%08x\n", res);
        return res;
    }
    if (count < kKskSize) {
        KM_ERR("Wrong persistent data length, expected %dB, got %dB", static_cast<int>(kKskSize),
               static_cast<int>(count));
        KM_ERR("Now, delete the key and recreate it, but all previous keymaster key will die");
        pobj.reset();
        res = TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskObjectId, sizeof kKskObjectId,
                                       TEE_DATA_FLAG_ACCESS_WRITE_META, pobj.out());
        if (res != TEE_SUCCESS) {
            KM_ERR("OpenPersistentObject failed with 0x%08x\n", res);
            return res;
        }
        TEE_CloseAndDeletePersistentObject1(pobj.release());
        return TEE_ERROR_CORRUPT_OBJECT;
    }
    return make_hmac_sha256_key(secret, &rpmb_ksk);
}

TEE_Result key_store_init() {
    TEE_Result res = key_store_init_derived_ksk();
    if (res != TEE_SUCCESS) {
        KM_ERR("Init derived KSK failed with 0x%08x", res);
        return res;
    }
    if (judge_rpmb()) {
        res = key_store_init_rpmb_ksk();
        if (res != TEE_SUCCESS) {
            KM_ERR("Init RPMB KSK failed with 0x%08x", res);
            // A failed start leaves nothing behind; the next one starts over.
            key_store_deinit();
            return res;
        }
    } else {
        KM_INFO("no RPMB for ksk\n");
    }
    res = key_cache_init();
    if (res != TEE_SUCCESS) {
        KM_ERR("Out of memory");
        key_store_deinit();
    }
    return res;
}

void key_store_deinit() {
    free_object(&derived_ksk);
    free_object(&rpmb_ksk);
    free_operation(&derived_ksk_mac);
    free_operation(&rpmb_ksk_mac);
    key_cache_deinit();
}

TEE_Result TEE_DeriveKK(TEE_ObjectHandle ksk, const uint8_t *input, TEE_ObjectHandle *kk) {
    uint8_t mac[32] = {};
    uint32_t mac_len = sizeof mac;
    scope_exit wipe([&] { TEE_MemFill(mac, 0, sizeof mac); });
    *kk = nullptr;

    TEE_OperationHandle *slot = ksk == rpmb_ksk ? &rpmb_ksk_mac : &derived_ksk_mac;
    TEE_Result res = TEE_SUCCESS;
    if (!*slot) {
        res = keyed_operation(slot, TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 256, ksk);
        if (res != TEE_SUCCESS)
            return res;
    }
    TEE_MACInit(*slot, nullptr, 0);
    res = TEE_MACComputeFinal(*slot, input, kBlobDeriveSize, mac, &mac_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("MACComputeFinal failed with 0x%08x\n", res);
        return res;
    }
    if (mac_len != sizeof mac) {
        KM_ERR("Wrong MAC length, expected %dB, got %dB\n", static_cast<int>(sizeof mac), static_cast<int>(mac_len));
        return TEE_ERROR_BAD_PARAMETERS;
    }
    return secret_key_object(TEE_TYPE_AES, 256, mac, kk);
}

TEE_Result save_key(const uint8_t *key_data, uint32_t key_data_len, const keymaster_key_param_set_t *params,
                    uint8_t *blob, uint32_t *blob_len) {
    heap_buf serialized(true);
    uint8_t *ser = nullptr;
    uint32_t ser_len = 0;
    uint32_t capacity = *blob_len;
    *blob_len = 0;

    TEE_Result res = marshal(params, true, &ser, &ser_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("Marshal failed");
        return res;
    }
    serialized.adopt(ser, ser_len);

    uint64_t total = uint64_t{key_data_len} + ser_len + kBlobOverhead;
    if (total > capacity) {
        KM_ERR("Too short key blob");
        return TEE_ERROR_SHORT_BUFFER;
    }
    TEE_GenerateRandom(blob + kBlobDeriveOffset, kBlobDeriveSize);
    TEE_GenerateRandom(blob + kBlobNonceOffset, kBlobNonceSize);

    object_guard kk;
    blob[0] = rpmb_ksk ? KEY_PROTECTION_RPMB : KEY_PROTECTION_DERIVED;
    res = TEE_DeriveKK(rpmb_ksk ? rpmb_ksk : derived_ksk, blob + kBlobDeriveOffset, kk.out());
    if (res != TEE_SUCCESS) {
        KM_ERR("DeriveKK failed with 0x%08x\n", res);
        return res;
    }
    operation_guard op;
    res = start_gcm(kk.get(), TEE_MODE_ENCRYPT, blob + kBlobNonceOffset, &op);
    if (res != TEE_SUCCESS)
        return res;

    uint8_t l_word[4];
    uint8_t p_word[4];
    put_u32le(l_word, key_data_len);
    put_u32le(p_word, ser_len);
    uint8_t *out = blob + kBlobHeaderSize;
    uint32_t room = capacity - kBlobHeaderSize;
    const struct {
        const uint8_t *data;
        uint32_t len;
    } pieces[] = {{l_word, 4}, {key_data, key_data_len}, {p_word, 4}, {ser, ser_len}};
    for (const auto &piece : pieces) {
        uint32_t produced = room;
        res = TEE_AEUpdate(op.get(), piece.data, piece.len, out, &produced);
        if (res != TEE_SUCCESS) {
            KM_ERR("AEUpdate failed with 0x%08x\n", res);
            return res;
        }
        out += produced;
        room -= produced;
    }
    uint32_t produced = room;
    uint32_t tag_len = kBlobTagSize;
    res = TEE_AEEncryptFinal(op.get(), nullptr, 0, out, &produced, blob + kBlobTagOffset, &tag_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AEEncryptFinal failed with 0x%08x\n", res);
        return res;
    }
    out += produced;
    if (tag_len != kBlobTagSize) {
        KM_ERR("Wrong tag size, expect %dB, got %dB", static_cast<int>(kBlobTagSize), static_cast<int>(tag_len));
        return TEE_ERROR_GENERIC;
    }
    uint32_t written = static_cast<uint32_t>(out - blob);
    if (written != total) {
        KM_ERR("Unmatched total size, expected: %d actual: %d\n", static_cast<int>(total), static_cast<int>(written));
        return TEE_ERROR_GENERIC;
    }
    *blob_len = written;
    return TEE_SUCCESS;
}

namespace {

// The blob-decrypting AES-GCM operation of a blob whose header is at blob:
// the KSK its protection byte names, the blob key derived from it, and the
// nonce. *unknown when the protection byte names no KSK.
TEE_Result start_blob_decryption(const uint8_t *blob, operation_guard *op, bool *unknown,
                                 const char *func = __builtin_FUNCTION()) {
    TEE_ObjectHandle ksk = nullptr;
    TEE_Result res = select_ksk(blob[0], &ksk, unknown, func);
    if (res != TEE_SUCCESS || *unknown)
        return res;
    object_guard kk;
    res = TEE_DeriveKK(ksk, blob + kBlobDeriveOffset, kk.out());
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "DeriveKK failed with 0x%08x\n", res);
        return res;
    }
    return start_gcm(kk.get(), TEE_MODE_DECRYPT, blob + kBlobNonceOffset, op);
}

} // namespace

namespace {

// decrypt_blob - the authenticated plaintext of a blob (longer than its
// header) into *plain; TEE errors as the TEE gave them, *error -33 for a
// protection byte naming no KSK.
TEE_Result decrypt_blob(const uint8_t *blob, uint32_t blob_len, heap_buf *plain, int32_t *error,
                        const char *func = __builtin_FUNCTION()) {
    operation_guard op;
    bool unknown = false;
    TEE_Result res = start_blob_decryption(blob, &op, &unknown, func);
    if (res != TEE_SUCCESS)
        return res;
    if (unknown) {
        *error = KM_ERROR_INVALID_KEY_BLOB;
        return TEE_SUCCESS;
    }
    const uint32_t plain_len = blob_len - kBlobHeaderSize;
    if (!plain->alloc(plain_len)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    uint32_t first = plain_len;
    res = TEE_AEUpdate(op.get(), blob + kBlobHeaderSize, plain_len, plain->get(), &first);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AEUpdate failed with 0x%08x\n", res);
        return res;
    }
    uint32_t rest = plain_len - first;
    res = TEE_AEDecryptFinal(op.get(), nullptr, 0, plain->get() + first, &rest, blob + kBlobTagOffset, kBlobTagSize);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AEDecryptFinal failed with 0x%08x\n", res);
        return res;
    }
    if (first + rest != plain_len) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Too short output of AES, expect %dB, got %dB",
                    static_cast<int>(plain_len), static_cast<int>(first + rest));
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

} // namespace

TEE_Result open_key(const uint8_t *blob, uint32_t blob_len, uint8_t **key_data, uint32_t *key_data_len,
                    keymaster_key_param_set_t *params, int32_t *error) {
    *key_data = nullptr;
    *key_data_len = 0;
    params->params = nullptr;
    params->length = 0;

    if (blob_len <= kBlobHeaderSize) {
        KM_ERR("Too short key blob");
        *error = KM_ERROR_INVALID_KEY_BLOB;
        return TEE_SUCCESS;
    }
    // A blob equal in every byte to one opened before needs no derivation
    // and no decryption: its plaintext was authenticated then.
    heap_buf plain(true);
    const uint8_t *text = nullptr;
    uint32_t text_len = 0;
    const bool cached = key_cache_find(blob, blob_len, &text, &text_len);
    if (!cached) {
        int32_t decrypt_error = KM_ERROR_OK;
        TEE_Result res = decrypt_blob(blob, blob_len, &plain, &decrypt_error);
        if (res != TEE_SUCCESS)
            return res;
        if (decrypt_error) {
            *error = decrypt_error;
            return TEE_SUCCESS;
        }
        text = plain.get();
        text_len = plain.len();
    }

    byte_reader in(text, text_len);
    const uint8_t *kd = nullptr;
    uint32_t kd_len = 0;
    const uint8_t *ser = nullptr;
    uint32_t ser_len = 0;
    if (!in.read_lv(&kd, &kd_len))
        return TEE_ERROR_GENERIC;
    heap_buf data(true);
    if (!data.alloc(kd_len)) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    TEE_MemMove(data.get(), kd, kd_len);
    if (!in.read_lv(&ser, &ser_len))
        return TEE_ERROR_GENERIC;
    if (unmarshal(ser, ser_len, params) != TEE_SUCCESS) {
        KM_ERR("Unmarshal failed");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    if (!cached)
        key_cache_put(blob, blob_len, text, text_len);
    *key_data_len = data.len();
    *key_data = data.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result open_key_raw(uint8_t *buf, uint32_t *len) {
    if (*len <= kBlobHeaderSize) {
        KM_ERR("Too short key blob");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    operation_guard op;
    bool unknown = false;
    TEE_Result res = start_blob_decryption(buf, &op, &unknown);
    if (res != TEE_SUCCESS)
        return res;
    if (unknown)
        return TEE_ERROR_BAD_PARAMETERS;
    uint8_t tag[kBlobTagSize];
    TEE_MemMove(tag, buf + kBlobTagOffset, kBlobTagSize);
    uint32_t out_len = *len - kBlobHeaderSize;
    res = TEE_AEDecryptFinal(op.get(), buf + kBlobHeaderSize, out_len, buf + kBlobHeaderSize, &out_len, tag,
                             kBlobTagSize);
    if (res != TEE_SUCCESS) {
        KM_ERR("AEDecryptFinal failed with 0x%08x\n", res);
        return res;
    }
    TEE_MemMove(buf, buf + kBlobHeaderSize, out_len);
    *len = out_len;
    return TEE_SUCCESS;
}

TEE_Result key_store_delete_key(const uint8_t *blob, uint32_t blob_len, int32_t *error) {
    *error = blob_len < 2 ? KM_ERROR_INVALID_KEY_BLOB : KM_ERROR_OK;
    // The blob stays valid (nothing is stored per key), but its opened copy goes.
    key_cache_forget(blob, blob_len);
    return TEE_SUCCESS;
}

TEE_Result key_store_delete_all_keys() {
    key_cache_clear();
    return TEE_SUCCESS;
}
