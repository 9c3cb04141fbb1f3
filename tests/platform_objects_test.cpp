/*
 * Transient objects: allocation by type and size, populating and reading
 * attributes back, key generation, reset, the panics on misuse, and the
 * handle accounting done when a TA instance ends.
 */
#include <cstring>

#include "gp_handles.h"

namespace {

class Objects : public TeeTest {};

TEE_Result populate_secret(TEE_ObjectHandle h, const Bytes &secret) {
    TEE_Attribute a{};
    TEE_InitRefAttribute(&a, TEE_ATTR_SECRET_VALUE, secret.data(), static_cast<uint32_t>(secret.size()));
    return TEE_PopulateTransientObject(h, &a, 1);
}

TEE_ObjectInfo info_of(TEE_ObjectHandle h) {
    TEE_ObjectInfo info{};
    EXPECT_EQ(TEE_GetObjectInfo1(h, &info), TEE_SUCCESS);
    return info;
}

Bytes read_secret(TEE_ObjectHandle h) {
    Bytes out(600);
    uint32_t len = static_cast<uint32_t>(out.size());
    EXPECT_EQ(TEE_GetObjectBufferAttribute(h, TEE_ATTR_SECRET_VALUE, out.data(), &len), TEE_SUCCESS);
    out.resize(len);
    return out;
}

// HMAC-SHA256 of "msg" under the key object, to show which key is in force.
Bytes hmac_with(TEE_ObjectHandle key) {
    TEE_OperationHandle op = TEE_HANDLE_NULL;
    EXPECT_EQ(TEE_AllocateOperation(&op, TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 1024), TEE_SUCCESS);
    EXPECT_EQ(TEE_SetOperationKey(op, key), TEE_SUCCESS);
    TEE_MACInit(op, nullptr, 0);
    Bytes mac(32);
    uint32_t len = 32;
    EXPECT_EQ(TEE_MACComputeFinal(op, "msg", 3, mac.data(), &len), TEE_SUCCESS);
    TEE_FreeOperation(op);
    return mac;
}

TEST_F(Objects, AllocationTakesExactlyTheSizesEachTypeAllows) {
    struct {
        uint32_t type;
        std::vector<uint32_t> ok, refused;
    } cases[] = {
        {TEE_TYPE_AES, {128, 192, 256}, {0, 64, 127, 136, 512}},
        {TEE_TYPE_HMAC_MD5, {64, 72, 512}, {56, 65, 520}},
        {TEE_TYPE_HMAC_SHA1, {80, 160, 512}, {72, 84, 520}},
        {TEE_TYPE_HMAC_SHA224, {112, 224, 512}, {104, 520}},
        {TEE_TYPE_HMAC_SHA256, {192, 256, 1024}, {184, 196, 1032}},
        {TEE_TYPE_HMAC_SHA384, {256, 384, 1024}, {248, 1032}},
        {TEE_TYPE_HMAC_SHA512, {256, 512, 1024}, {248, 1032}},
        {TEE_TYPE_GENERIC_SECRET, {8, 1000, 4096}, {0, 4, 4104}},
        {TEE_TYPE_DATA, {}, {0, 128}},
        {0xA0000099u, {}, {128}},
    };
    for (const auto &c : cases) {
        for (uint32_t bits : c.ok) {
            Obj o(c.type, bits);
            TEE_ObjectInfo info = info_of(o);
            EXPECT_EQ(info.objectType, c.type);
            EXPECT_EQ(info.maxObjectSize, bits);
            EXPECT_EQ(info.objectSize, 0u);
            EXPECT_EQ(info.handleFlags, 0u) << "a new object is uninitialized";
            EXPECT_EQ(info.objectUsage, 0xFFFFFFFFu);
        }
        for (uint32_t bits : c.refused) {
            TEE_ObjectHandle h = reinterpret_cast<TEE_ObjectHandle>(1);
            EXPECT_EQ(TEE_AllocateTransientObject(c.type, bits, &h), TEE_ERROR_NOT_SUPPORTED)
                << std::hex << c.type << std::dec << " " << bits;
            EXPECT_EQ(h, nullptr);
        }
    }
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    tee_host::heap::fail_nth(1);
    EXPECT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &h), TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_EQ(h, nullptr);
}

TEST_F(Objects, PopulatedSecretReadsBackWithGpBufferSizing) {
    Obj o(TEE_TYPE_GENERIC_SECRET, 256);
    Bytes secret = hex("00112233445566778899aabbccddeeff0102");
    Bytes caller_copy = secret;
    ASSERT_EQ(populate_secret(o, caller_copy), TEE_SUCCESS);
    std::fill(caller_copy.begin(), caller_copy.end(), 0); // the object holds its own copy

    TEE_ObjectInfo info = info_of(o);
    EXPECT_EQ(info.objectSize, 144u);
    EXPECT_EQ(info.handleFlags, TEE_HANDLE_FLAG_INITIALIZED);

    Bytes out(64, 0x5A);
    uint32_t len = 0;
    EXPECT_EQ(TEE_GetObjectBufferAttribute(o, TEE_ATTR_SECRET_VALUE, nullptr, &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, secret.size());
    len = 17;
    EXPECT_EQ(TEE_GetObjectBufferAttribute(o, TEE_ATTR_SECRET_VALUE, out.data(), &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 18u);
    EXPECT_EQ(out, Bytes(64, 0x5A)) << "nothing written on a short buffer";
    len = 64;
    ASSERT_EQ(TEE_GetObjectBufferAttribute(o, TEE_ATTR_SECRET_VALUE, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(len, 18u);
    EXPECT_EQ(Bytes(out.begin(), out.begin() + 18), secret);

    len = 64;
    EXPECT_EQ(TEE_GetObjectBufferAttribute(o, TEE_ATTR_RSA_MODULUS, out.data(), &len), TEE_ERROR_ITEM_NOT_FOUND);
    uint32_t a = 0, b = 0;
    EXPECT_EQ(TEE_GetObjectValueAttribute(o, TEE_ATTR_ECC_CURVE, &a, &b), TEE_ERROR_ITEM_NOT_FOUND);
}

TEST_F(Objects, PopulateRefusesSizesTheTypeOrMaximumDoNotAllow) {
    struct {
        uint32_t type, max;
        size_t bytes;
    } refused[] = {
        {TEE_TYPE_AES, 256, 20},       {TEE_TYPE_AES, 128, 32},          {TEE_TYPE_HMAC_SHA256, 1024, 20},
        {TEE_TYPE_HMAC_SHA1, 512, 65}, {TEE_TYPE_GENERIC_SECRET, 64, 9}, {TEE_TYPE_GENERIC_SECRET, 64, 0},
    };
    for (const auto &r : refused) {
        Obj o(r.type, r.max);
        EXPECT_EQ(populate_secret(o, Bytes(r.bytes, 1)), TEE_ERROR_BAD_PARAMETERS) << std::hex << r.type;
        EXPECT_EQ(info_of(o).handleFlags, 0u) << "a refused populate leaves the object uninitialized";
        EXPECT_EQ(populate_secret(o, Bytes(r.max / 8, 2)), TEE_SUCCESS) << "and it can still be populated";
    }
}

TEST_F(Objects, GenerateKeyChecksSizesAndMakesFreshKeys) {
    for (uint32_t bits : {128u, 192u, 256u}) {
        Obj a(TEE_TYPE_AES, 256), b(TEE_TYPE_AES, 256);
        ASSERT_EQ(TEE_GenerateKey(a, bits, nullptr, 0), TEE_SUCCESS);
        ASSERT_EQ(TEE_GenerateKey(b, bits, nullptr, 0), TEE_SUCCESS);
        EXPECT_EQ(info_of(a).objectSize, bits);
        EXPECT_EQ(read_secret(a).size(), bits / 8);
        EXPECT_NE(read_secret(a), read_secret(b));
    }
    Obj aes(TEE_TYPE_AES, 128);
    EXPECT_EQ(TEE_GenerateKey(aes, 100, nullptr, 0), TEE_ERROR_NOT_SUPPORTED);
    EXPECT_EQ(TEE_GenerateKey(aes, 256, nullptr, 0), TEE_ERROR_BAD_PARAMETERS) << "above the object's maximum";
    Obj hmac(TEE_TYPE_HMAC_SHA1, 512);
    EXPECT_EQ(TEE_GenerateKey(hmac, 72, nullptr, 0), TEE_ERROR_NOT_SUPPORTED);
    EXPECT_EQ(TEE_GenerateKey(hmac, 84, nullptr, 0), TEE_ERROR_NOT_SUPPORTED);
    EXPECT_EQ(info_of(hmac).handleFlags, 0u);
    ASSERT_EQ(TEE_GenerateKey(hmac, 80, nullptr, 0), TEE_SUCCESS);
    EXPECT_EQ(info_of(hmac).objectSize, 80u);

    // Key bytes come from TEE_GenerateRandom, so scripted bytes show up.
    Bytes scripted = hex("000102030405060708090a0b0c0d0e0f");
    tee_host::rng::script(scripted);
    Obj g(TEE_TYPE_GENERIC_SECRET, 128);
    ASSERT_EQ(TEE_GenerateKey(g, 128, nullptr, 0), TEE_SUCCESS);
    EXPECT_EQ(read_secret(g), scripted);
}

TEST_F(Objects, ResetForgetsTheKeyAndAllowsANewOne) {
    Obj o(TEE_TYPE_HMAC_SHA256, 512);
    Bytes first(32, 0x01), second(40, 0x02);
    ASSERT_EQ(populate_secret(o, first), TEE_SUCCESS);
    Bytes mac_first = hmac_with(o);
    TEE_ResetTransientObject(o);
    TEE_ObjectInfo info = info_of(o);
    EXPECT_EQ(info.handleFlags, 0u);
    EXPECT_EQ(info.objectSize, 0u);
    EXPECT_EQ(info.maxObjectSize, 512u);
    EXPECT_EQ(info.objectType, TEE_TYPE_HMAC_SHA256);
    ASSERT_EQ(populate_secret(o, second), TEE_SUCCESS);
    EXPECT_EQ(read_secret(o), second);
    EXPECT_NE(hmac_with(o), mac_first);
    TEE_ResetTransientObject(TEE_HANDLE_NULL); // a null handle is ignored
}

TEST_F(Objects, HandlesAreCountedUntilFreedOrClosed) {
    EXPECT_EQ(tee_host::handles::live_objects(), 0u);
    TEE_ObjectHandle a = TEE_HANDLE_NULL, b = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &a), TEE_SUCCESS);
    ASSERT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &b), TEE_SUCCESS);
    EXPECT_NE(a, b);
    EXPECT_EQ(tee_host::handles::live_objects(), 2u);
    TEE_CloseObject(a); // the same as freeing, for a transient object
    TEE_FreeTransientObject(b);
    TEE_FreeTransientObject(TEE_HANDLE_NULL);
    TEE_CloseObject(TEE_HANDLE_NULL);
    EXPECT_EQ(tee_host::handles::live_objects(), 0u);
}

// --- Handles left behind by a TA instance ---------------------------------------------

constexpr TEE_UUID kLeakyUuid = {0x1eaf0001, 0x0002, 0x0003, {4, 5, 6, 7, 8, 9, 10, 11}};
bool g_leak = false;

TEE_Result leaky_create() {
    return TEE_SUCCESS;
}
void leaky_destroy() {}
TEE_Result leaky_open(uint32_t, TEE_Param *, void **ctx) {
    *ctx = nullptr;
    return TEE_SUCCESS;
}
void leaky_close(void *) {}
// Allocates an object and an operation, freeing them unless told to leak.
TEE_Result leaky_invoke(void *, uint32_t, uint32_t, TEE_Param *) {
    TEE_ObjectHandle obj = TEE_HANDLE_NULL;
    TEE_OperationHandle op = TEE_HANDLE_NULL;
    TEE_Result res = TEE_AllocateTransientObject(TEE_TYPE_AES, 256, &obj);
    if (res == TEE_SUCCESS)
        res = TEE_AllocateOperation(&op, TEE_ALG_SHA256, TEE_MODE_DIGEST, 0);
    if (!g_leak) {
        TEE_FreeOperation(op);
        TEE_FreeTransientObject(obj);
    }
    return res;
}

const ta_header_t kLeakyTa = {
    kLeakyUuid,
    0x1000,
    TA_FLAG_SINGLE_INSTANCE | TA_FLAG_MULTI_SESSION,
    leaky_create,
    leaky_destroy,
    leaky_open,
    leaky_close,
    leaky_invoke,
    nullptr,
    0,
};

TEST_F(Objects, HandlesLeftAtInstanceEndAreReportedCountedAndFreed) {
    tee_->install_ta(&kLeakyTa);
    for (bool leak : {true, false}) {
        g_leak = leak;
        uint32_t session = 0;
        ASSERT_EQ(tee_->open_session(kLeakyUuid, tee_host::normal_world_identity(), 0, nullptr, &session), TEE_SUCCESS);
        ASSERT_EQ(tee_->invoke(session, 1, 0, nullptr), TEE_SUCCESS);
        EXPECT_EQ(tee_host::handles::live_objects(), leak ? 1u : 0u);
        EXPECT_EQ(tee_host::handles::live_operations(), leak ? 1u : 0u);
        testing::internal::CaptureStderr();
        tee_->close_session(session);
        std::string err = testing::internal::GetCapturedStderr();
        EXPECT_EQ(tee_host::handles::leaked_at_last_destroy(), leak ? 2u : 0u);
        EXPECT_EQ(err.find("TA handle leak") != std::string::npos, leak) << err;
        EXPECT_EQ(tee_host::handles::live_objects(), 0u);
        EXPECT_EQ(tee_host::handles::live_operations(), 0u);
    }
}

// --- Misuse panics ------------------------------------------------------------------

using ObjectsDeathTest = Objects;

TEST_F(ObjectsDeathTest, MisusePanics) {
    Obj aes(TEE_TYPE_AES, 128);
    Bytes key(16, 3);
    TEE_Attribute attr{};
    EXPECT_DEATH(TEE_GetObjectBufferAttribute(aes, TEE_ATTR_SECRET_VALUE, key.data(), nullptr), "null size");
    uint32_t len = 16;
    EXPECT_DEATH(TEE_GetObjectBufferAttribute(aes, TEE_ATTR_SECRET_VALUE, key.data(), &len), "uninitialized");
    EXPECT_DEATH(TEE_PopulateTransientObject(aes, nullptr, 0), "without a mandatory attribute");
    TEE_InitRefAttribute(&attr, TEE_ATTR_RSA_MODULUS, key.data(), 16);
    EXPECT_DEATH(TEE_PopulateTransientObject(aes, &attr, 1), "foreign to the object type");
    EXPECT_DEATH(TEE_InitRefAttribute(&attr, TEE_ATTR_ECC_CURVE, key.data(), 4), "value attribute");
    EXPECT_DEATH(TEE_InitValueAttribute(&attr, TEE_ATTR_SECRET_VALUE, 1, 2), "buffer attribute");
    TEE_Attribute twice[2] = {};
    TEE_InitRefAttribute(&twice[0], TEE_ATTR_SECRET_VALUE, key.data(), 16);
    twice[1] = twice[0];
    EXPECT_DEATH(TEE_PopulateTransientObject(aes, twice, 2), "given twice");

    ASSERT_EQ(populate_secret(aes, key), TEE_SUCCESS);
    EXPECT_DEATH(populate_secret(aes, key), "already initialized");
    EXPECT_DEATH(TEE_GenerateKey(aes, 128, nullptr, 0), "already initialized");
    uint32_t a = 0;
    EXPECT_DEATH(TEE_GetObjectValueAttribute(aes, TEE_ATTR_SECRET_VALUE, &a, &a), "of a buffer attribute");
    EXPECT_DEATH(TEE_GetObjectBufferAttribute(aes, TEE_ATTR_ECC_CURVE, key.data(), &len), "of a value attribute");

    TEE_ObjectHandle freed = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &freed), TEE_SUCCESS);
    TEE_FreeTransientObject(freed);
    TEE_ObjectInfo info{};
    EXPECT_DEATH(TEE_GetObjectInfo1(freed, &info), "invalid or freed object handle");
    EXPECT_DEATH(TEE_FreeTransientObject(freed), "invalid or freed object handle");
    EXPECT_DEATH(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, nullptr), "null handle pointer");

    TEE_OperationHandle op = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateOperation(&op, TEE_ALG_SHA1, TEE_MODE_DIGEST, 0), TEE_SUCCESS);
    EXPECT_DEATH(TEE_GetObjectInfo1(reinterpret_cast<TEE_ObjectHandle>(op), &info), "invalid or freed object");
    TEE_FreeOperation(op);
}

} // namespace
