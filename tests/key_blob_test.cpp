/*
 * Key blobs and key-store keys: the sealed layout (checked by decrypting a
 * blob independently), tampering, restarts with and without RPMB, a
 * damaged stored KSK, and the raw opening for trusted TAs.
 */
#include <cstring>
#include <vector>

#include <openssl/evp.h>
#include <openssl/hmac.h>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

const char kKskId[] = "Keymaster KSK";

class KeyBlob : public KeyTest {
  protected:
    // Replaces the stored RPMB KSK while no TA instance runs.
    void plant_ksk(const Bytes &content) {
        tee_->close_session(session_);
        session_ = 0;
        ASSERT_FALSE(tee_->instance_alive(keymaster_ta_uuid));
        TEE_ObjectHandle h = nullptr;
        if (TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskId, sizeof kKskId, TEE_DATA_FLAG_ACCESS_WRITE_META,
                                     &h) == TEE_SUCCESS)
            TEE_CloseAndDeletePersistentObject1(h);
        ASSERT_EQ(TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskId, sizeof kKskId, TEE_DATA_FLAG_ACCESS_READ,
                                             TEE_HANDLE_NULL, content.data(), static_cast<uint32_t>(content.size()),
                                             &h),
                  TEE_SUCCESS);
        TEE_CloseObject(h);
    }
    bool ksk_stored() {
        TEE_ObjectHandle h = nullptr;
        if (TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, kKskId, sizeof kKskId, TEE_DATA_FLAG_ACCESS_READ, &h) !=
            TEE_SUCCESS)
            return false;
        TEE_CloseObject(h);
        return true;
    }
    void restart(bool rpmb) {
        stop();
        tee_host::Config config;
        config.rpmb_usable = rpmb;
        start(config);
    }
    Bytes make_blob(const Bytes &material = Bytes(32, 0x5A)) {
        Bytes blob;
        EXPECT_TRUE(import(hmac_params(), material, &blob).ok()) << dump_log();
        return blob;
    }
    Outcome describe(const Bytes &blob) {
        Bytes chars;
        return characteristics(key_reference(blob), &chars);
    }
};

// Decrypts a blob the way the TA must have sealed it.
Bytes unseal(const Bytes &ksk, const Bytes &blob) {
    unsigned char kk[32];
    unsigned int kk_len = 0;
    EXPECT_NE(HMAC(EVP_sha256(), ksk.data(), 32, blob.data() + 1, 64, kk, &kk_len), nullptr);
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    Bytes plain(blob.size() - 93);
    int n = 0, m = 0;
    EXPECT_EQ(EVP_DecryptInit_ex2(ctx, EVP_aes_256_gcm(), nullptr, nullptr, nullptr), 1);
    EXPECT_EQ(EVP_CIPHER_CTX_ctrl(ctx, EVP_CTRL_GCM_SET_IVLEN, 12, nullptr), 1);
    EXPECT_EQ(EVP_DecryptInit_ex2(ctx, nullptr, kk, blob.data() + 65, nullptr), 1);
    EXPECT_EQ(EVP_DecryptUpdate(ctx, plain.data(), &n, blob.data() + 93, static_cast<int>(plain.size())), 1);
    EXPECT_EQ(EVP_CIPHER_CTX_ctrl(ctx, EVP_CTRL_GCM_SET_TAG, 16, const_cast<uint8_t *>(blob.data() + 77)), 1);
    int ok = EVP_DecryptFinal_ex(ctx, plain.data() + n, &m);
    EVP_CIPHER_CTX_free(ctx);
    EXPECT_EQ(ok, 1) << "the tag does not verify under the expected key";
    return plain;
}

TEST_F(KeyBlob, SealedUnderThePerBlobKeyOfTheStoredKsk) {
    Bytes stored(33);
    for (size_t i = 0; i < stored.size(); ++i)
        stored[i] = static_cast<uint8_t>(0xA0 + i);
    plant_ksk(stored); // 33 bytes: the first 32 are the KSK
    session_ = open();

    ParamSet params = hmac_params();
    params.add_bytes(KM_TAG_APPLICATION_ID, "owner");
    Bytes material(32);
    for (size_t i = 0; i < 32; ++i)
        material[i] = static_cast<uint8_t>(i * 7);
    Bytes blob;
    ASSERT_TRUE(import(params, material, &blob).ok()) << dump_log();
    EXPECT_EQ(blob[0], 1) << "sealed under the RPMB KSK";

    Bytes plain = unseal(Bytes(stored.begin(), stored.begin() + 32), blob);
    ASSERT_GE(plain.size(), 8u);
    uint32_t l = km::get_u32(plain.data());
    ASSERT_EQ(l, 40u);
    EXPECT_EQ(to_hex(Bytes(plain.begin() + 4, plain.begin() + 12)), "00010000040000a0");
    EXPECT_EQ(Bytes(plain.begin() + 12, plain.begin() + 44), material);
    uint32_t p = km::get_u32(plain.data() + 4 + l);
    EXPECT_EQ(blob.size(), l + p + 101);
    auto set = ParamSet::parse(plain.data() + 8 + l, p);
    ASSERT_TRUE(set);
    // The blob keeps the hidden binding and the completed parameters.
    ASSERT_NE(set->find(KM_TAG_APPLICATION_ID), nullptr);
    EXPECT_EQ(set->find(KM_TAG_APPLICATION_ID)->bytes, Bytes({'o', 'w', 'n', 'e', 'r'}));
    EXPECT_EQ(set->find(KM_TAG_KEY_SIZE)->value, 256u);
    EXPECT_EQ(set->find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);
}

TEST_F(KeyBlob, EverySingleByteChangeIsRefused) {
    Bytes blob = make_blob();
    for (size_t i = 0; i < blob.size(); ++i) {
        Bytes bad = blob;
        bad[i] ^= 0x01; // byte 0 goes from 1 to 0: the other KSK
        tee_host::trace::clear();
        Outcome o = describe(bad);
        EXPECT_FALSE(o.ok()) << "byte " << i;
        EXPECT_EQ(o.res, TEE_ERROR_MAC_INVALID) << "byte " << i;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_key_character", "Open key failed"));
    }
    Bytes unknown = blob;
    for (uint8_t kind : {2, 0x80, 0xFF}) {
        unknown[0] = kind;
        tee_host::trace::clear();
        Outcome o = describe(unknown);
        EXPECT_EQ(o.res, TEE_SUCCESS);
        EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key", "Unknown key protection"));
    }
    EXPECT_TRUE(describe(blob).ok());
}

TEST_F(KeyBlob, LengthBoundaries) {
    Bytes blob = make_blob();
    tee_host::trace::clear();
    Outcome o = describe(Bytes(blob.begin(), blob.begin() + 93));
    EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key", "Too short key blob"));
    // 94 bytes pass the length check and fail on the tag.
    EXPECT_EQ(describe(Bytes(blob.begin(), blob.begin() + 94)).res, TEE_ERROR_MAC_INVALID);
    EXPECT_EQ(describe(Bytes(blob.begin(), blob.end() - 1)).res, TEE_ERROR_MAC_INVALID);
    Bytes longer = blob;
    longer.push_back(0);
    EXPECT_EQ(describe(longer).res, TEE_ERROR_MAC_INVALID);
}

// TA heap allocations a command makes: opening a blob already opened
// skips its decryption buffer, so a cached open makes fewer.
template <typename F> uint64_t allocations_of(F f) {
    const uint64_t before = tee_host::heap::stats().allocations;
    f();
    return tee_host::heap::stats().allocations - before;
}

TEST_F(KeyBlob, AnOpenedBlobIsReusedOnlyForTheSameBytes) {
    Bytes blob = make_blob();
    const uint64_t cold = allocations_of([&] { ASSERT_TRUE(describe(blob).ok()); });
    const uint64_t warm = allocations_of([&] { ASSERT_TRUE(describe(blob).ok()); });
    EXPECT_LT(warm, cold) << "the second open of the same blob should not decrypt it again";

    // With the blob cached, no changed, shorter or longer blob opens.
    for (size_t i = 1; i < blob.size(); ++i) {
        Bytes bad = blob;
        bad[i] ^= 0x80;
        EXPECT_EQ(describe(bad).res, TEE_ERROR_MAC_INVALID) << "byte " << i;
    }
    Bytes other_ksk = blob;
    other_ksk[0] ^= 0x01;
    EXPECT_EQ(describe(other_ksk).res, TEE_ERROR_MAC_INVALID);
    EXPECT_EQ(describe(Bytes(blob.begin(), blob.end() - 1)).res, TEE_ERROR_MAC_INVALID);
    Bytes longer = blob;
    longer.push_back(0);
    EXPECT_EQ(describe(longer).res, TEE_ERROR_MAC_INVALID);
    EXPECT_TRUE(describe(blob).ok());

    // A hit answers exactly as the first open did.
    Bytes first, again;
    ASSERT_TRUE(characteristics(key_reference(blob), &first).ok());
    ASSERT_TRUE(characteristics(key_reference(blob), &again).ok());
    EXPECT_EQ(first, again);
}

TEST_F(KeyBlob, OpenedBlobsAreForgottenOnEvictionDeletionAndRestart) {
    std::vector<Bytes> blobs;
    for (uint8_t i = 0; i < 9; ++i)
        blobs.push_back(make_blob(Bytes(32, static_cast<uint8_t>(0x10 + i))));
    const uint64_t cold = allocations_of([&] { ASSERT_TRUE(describe(blobs[0]).ok()); });
    const uint64_t warm = allocations_of([&] { ASSERT_TRUE(describe(blobs[0]).ok()); });
    ASSERT_LT(warm, cold);
    auto is_warm = [&](const Bytes &b) {
        const uint64_t n = allocations_of([&] { EXPECT_TRUE(describe(b).ok()); });
        return n == warm;
    };

    // Eight keys fit; a ninth evicts the least recently used.
    for (size_t i = 1; i < 9; ++i)
        describe(blobs[i]);
    EXPECT_FALSE(is_warm(blobs[0])) << "the least recently used blob should have been evicted";
    EXPECT_TRUE(is_warm(blobs[8]));

    EXPECT_TRUE(delete_key(blobs[8]).ok());
    EXPECT_FALSE(is_warm(blobs[8])) << "a deleted key's opened copy should be gone";
    EXPECT_TRUE(is_warm(blobs[8]));

    EXPECT_TRUE(delete_all().ok());
    for (size_t i = 6; i < 9; ++i)
        EXPECT_FALSE(is_warm(blobs[i])) << "delete-all should forget key " << i;

    restart_instance();
    EXPECT_FALSE(is_warm(blobs[8])) << "a new instance starts with nothing opened";
    EXPECT_TRUE(is_warm(blobs[8]));
    EXPECT_EQ(extra_allocations(), 0u);
}

TEST_F(KeyBlob, BlobSizeIsExactAndCapacityIsChecked) {
    Bytes blob;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok());
    // L = 40 bytes of key data; P = the parameters with the origin added.
    ParamSet stored = hmac_params();
    stored.add(KM_TAG_ORIGIN, KM_ORIGIN_GENERATED);
    EXPECT_EQ(blob.size(), 40 + stored.serialize().size() + 101);
    Bytes exact;
    EXPECT_TRUE(generate(hmac_params(), &exact, blob.size()).ok());
    EXPECT_EQ(exact.size(), blob.size());
    Bytes small;
    tee_host::trace::clear();
    Outcome o = generate(hmac_params(), &small, blob.size() - 1);
    EXPECT_EQ(o.res, TEE_ERROR_SHORT_BUFFER);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "save_key", "Too short key blob"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "generate_key", "Can't save key to TEE storage"));
    EXPECT_TRUE(small.empty());
}

TEST_F(KeyBlob, TwoBlobsOfOneKeyDifferButOpenAlike) {
    uint32_t trusted = open(&trusted_client_uuids[2]);
    Bytes a = make_blob(), b = make_blob();
    ASSERT_EQ(a.size(), b.size());
    EXPECT_EQ(a[0], b[0]);
    EXPECT_NE(Bytes(a.begin() + 1, a.begin() + 65), Bytes(b.begin() + 1, b.begin() + 65));
    EXPECT_NE(Bytes(a.begin() + 65, a.begin() + 77), Bytes(b.begin() + 65, b.begin() + 77));
    EXPECT_NE(Bytes(a.begin() + 77, a.end()), Bytes(b.begin() + 77, b.end()));
    Bytes pa, pb;
    ASSERT_EQ(open_raw(trusted, a, &pa), TEE_SUCCESS);
    ASSERT_EQ(open_raw(trusted, b, &pb), TEE_SUCCESS);
    EXPECT_EQ(pa, pb);
    EXPECT_EQ(pa.size(), a.size() - 93);
    EXPECT_EQ(km::get_u32(pa.data()), 40u);
    tee_->close_session(trusted);
}

TEST_F(KeyBlob, RawOpeningIsForTrustedTasOnly) {
    Bytes blob = make_blob(), payload;
    EXPECT_EQ(open_raw(session_, blob, &payload), TEE_ERROR_SECURITY);
    TEE_UUID stranger = {0x99999999, 0x1, 0x2, {3}};
    uint32_t other = open(&stranger);
    EXPECT_EQ(open_raw(other, blob, &payload), TEE_ERROR_SECURITY);
    tee_->close_session(other);

    uint32_t trusted = open(&trusted_client_uuids[0]);
    EXPECT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
    tee_host::trace::clear();
    EXPECT_EQ(open_raw(trusted, Bytes(blob.begin(), blob.begin() + 93), &payload), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key_raw", "Too short key blob"));
    Bytes bad = blob;
    bad[0] = 7;
    EXPECT_EQ(open_raw(trusted, bad, &payload), TEE_ERROR_BAD_PARAMETERS);
    bad = blob;
    bad[100] ^= 0x80;
    EXPECT_EQ(open_raw(trusted, bad, &payload), TEE_ERROR_MAC_INVALID);
    tee_->close_session(trusted);
}

TEST_F(KeyBlob, BlobsSurviveRestartsUnderBothKsks) {
    Bytes rpmb_blob = make_blob();
    EXPECT_EQ(rpmb_blob[0], 1);
    restart(true);
    EXPECT_TRUE(describe(rpmb_blob).ok());

    restart(false);
    EXPECT_TRUE(logged(TEE_TRACE_INFO, "key_store_init", "no RPMB for ksk")) << dump_log();
    EXPECT_TRUE(logged_message("TEE_RPMB_MakeFileSystem return 0xf0100003"));
    Bytes derived_blob = make_blob();
    EXPECT_EQ(derived_blob[0], 0);
    tee_host::trace::clear();
    Outcome o = describe(rpmb_blob);
    EXPECT_EQ(o.res, TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key", "RPMB KSK died, fail to open key"));

    restart(false);
    EXPECT_TRUE(describe(derived_blob).ok());
    restart(true);
    EXPECT_TRUE(describe(derived_blob).ok());
    EXPECT_TRUE(describe(rpmb_blob).ok());
}

TEST_F(KeyBlob, AShortStoredKskIsReplacedAndItsBlobsDie) {
    Bytes old_blob = make_blob();
    plant_ksk(Bytes(31, 0x11));
    uint32_t s = 0;
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &s);
    EXPECT_EQ(res, TEE_ERROR_CORRUPT_OBJECT);
    EXPECT_TRUE(logged_message("Wrong persistent data length, expected 32B, got 31B"));
    EXPECT_TRUE(logged_message("Now, delete the key and recreate it, but all previous keymaster key will die"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_CreateEntryPoint", "Init key store failed"));
    EXPECT_FALSE(tee_->instance_alive(keymaster_ta_uuid));
    EXPECT_FALSE(ksk_stored());

    session_ = open();
    EXPECT_TRUE(ksk_stored());
    Bytes fresh = make_blob();
    EXPECT_TRUE(describe(fresh).ok());
    EXPECT_EQ(describe(old_blob).res, TEE_ERROR_MAC_INVALID);
}

} // namespace
