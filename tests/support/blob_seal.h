/*
 * blob_seal.h - key blobs around any payload, for tests and fuzzing.
 *
 * A changed blob never gets past the GCM tag, so what the TA does after
 * decryption (the payload's two lengths, the key data, the parameter set)
 * is out of reach of mutated blobs. seal_payload seals bytes of the
 * caller's choosing exactly as the TA seals a blob: under the KSK the TA
 * seals new blobs with, through the TA's own per-blob key derivation.
 *
 * Only tests and fuzz harnesses include this header: no production binary
 * (kmctl, kmd, the client library) contains the code, and the TA itself
 * offers no way to seal a payload it did not build.
 */
#ifndef BLOB_SEAL_H
#define BLOB_SEAL_H

#include <cstdint>
#include <optional>
#include <vector>

#include "key_store.h"

/*
 * seal_payload - a blob of len + 93 bytes that opens to exactly the len
 * payload bytes. Needs a live Keymaster TA instance (its KSKs); draws the
 * derivation bytes and the nonce from the TEE's random source, as the TA
 * does. nullopt when there is no instance or a TEE call fails.
 */
inline std::optional<std::vector<uint8_t>> seal_payload(const uint8_t *payload, size_t len) {
    TEE_ObjectHandle ksk = rpmb_ksk ? rpmb_ksk : derived_ksk;
    if (!ksk || len > UINT32_MAX - kBlobHeaderSize)
        return std::nullopt;
    // One spare byte: TEE buffers are never null, even for an empty payload.
    std::vector<uint8_t> blob(kBlobHeaderSize + len + 1, 0);
    std::vector<uint8_t> plain(payload, payload + len);
    plain.push_back(0);
    blob[0] = rpmb_ksk ? KEY_PROTECTION_RPMB : KEY_PROTECTION_DERIVED;
    TEE_GenerateRandom(blob.data() + kBlobDeriveOffset, kBlobDeriveSize);
    TEE_GenerateRandom(blob.data() + kBlobNonceOffset, kBlobNonceSize);

    TEE_ObjectHandle kk = TEE_HANDLE_NULL;
    if (TEE_DeriveKK(ksk, blob.data() + kBlobDeriveOffset, &kk) != TEE_SUCCESS)
        return std::nullopt;
    TEE_OperationHandle op = TEE_HANDLE_NULL;
    TEE_Result res = TEE_AllocateOperation(&op, TEE_ALG_AES_GCM, TEE_MODE_ENCRYPT, 256);
    if (res == TEE_SUCCESS)
        res = TEE_SetOperationKey(op, kk);
    if (res == TEE_SUCCESS)
        res = TEE_AEInit(op, blob.data() + kBlobNonceOffset, kBlobNonceSize, kBlobTagSize * 8, 0, 0);
    uint32_t out_len = static_cast<uint32_t>(len);
    uint32_t tag_len = kBlobTagSize;
    if (res == TEE_SUCCESS)
        res = TEE_AEEncryptFinal(op, plain.data(), static_cast<uint32_t>(len), blob.data() + kBlobHeaderSize, &out_len,
                                 blob.data() + kBlobTagOffset, &tag_len);
    if (op)
        TEE_FreeOperation(op);
    TEE_FreeTransientObject(kk);
    if (res != TEE_SUCCESS || out_len != len || tag_len != kBlobTagSize)
        return std::nullopt;
    blob.pop_back();
    return blob;
}

inline std::optional<std::vector<uint8_t>> seal_payload(const std::vector<uint8_t> &payload) {
    return seal_payload(payload.data(), payload.size());
}

#endif
