/*
 * Persistent storage: data streams, persistence across a restart of the
 * TEE, OVERWRITE and the sharing rules, the RPMB storage going away, and
 * the on-disk behaviour (hex file names, atomic replacement, leftovers of
 * an interrupted write, damaged files).
 */
#include <algorithm>
#include <cstring>
#include <fstream>

#include "ta_fixture.h"

namespace fs = std::filesystem;

namespace {

constexpr uint32_t kRead = TEE_DATA_FLAG_ACCESS_READ;
constexpr uint32_t kWrite = TEE_DATA_FLAG_ACCESS_WRITE;
constexpr uint32_t kMeta = TEE_DATA_FLAG_ACCESS_WRITE_META;
constexpr uint32_t kShareRead = TEE_DATA_FLAG_SHARE_READ;
constexpr uint32_t kShareWrite = TEE_DATA_FLAG_SHARE_WRITE;
constexpr uint32_t kAll = kRead | kWrite | kMeta;

class Storage : public TeeTest {
  protected:
    fs::path private_dir() const { return dir_ / "storage" / "private"; }
    std::vector<std::string> files_in(const fs::path &d) const {
        std::vector<std::string> names;
        for (const auto &e : fs::directory_iterator(d))
            names.push_back(e.path().filename().string());
        std::sort(names.begin(), names.end());
        return names;
    }
};

const char kId[] = "key-blob";
const uint32_t kIdLen = sizeof kId - 1;
const std::string kIdHex = "6b65792d626c6f62";

TEE_Result create(uint32_t storage, const Bytes &data, uint32_t flags, TEE_ObjectHandle *h,
                  TEE_ObjectHandle attrs = TEE_HANDLE_NULL) {
    return TEE_CreatePersistentObject(storage, kId, kIdLen, flags, attrs, data.data(),
                                      static_cast<uint32_t>(data.size()), h);
}

TEE_Result open(uint32_t storage, uint32_t flags, TEE_ObjectHandle *h) {
    return TEE_OpenPersistentObject(storage, kId, kIdLen, flags, h);
}

// The whole stream from the start, leaving the position at its end.
Bytes read_all(TEE_ObjectHandle h) {
    EXPECT_EQ(TEE_SeekObjectData(h, 0, TEE_DATA_SEEK_SET), TEE_SUCCESS);
    Bytes out(4096);
    uint32_t n = 0;
    EXPECT_EQ(TEE_ReadObjectData(h, out.data(), static_cast<uint32_t>(out.size()), &n), TEE_SUCCESS);
    out.resize(n);
    return out;
}

Bytes text(const char *s) {
    return Bytes(s, s + std::strlen(s));
}

TEE_ObjectInfo info_of(TEE_ObjectHandle h) {
    TEE_ObjectInfo info{};
    EXPECT_EQ(TEE_GetObjectInfo1(h, &info), TEE_SUCCESS);
    return info;
}

TEST_F(Storage, DataStreamReadWriteSeekTruncate) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("hello world"), kAll, &h), TEE_SUCCESS);
    TEE_ObjectInfo info = info_of(h);
    EXPECT_EQ(info.objectType, TEE_TYPE_DATA);
    EXPECT_EQ(info.dataSize, 11u);
    EXPECT_EQ(info.dataPosition, 0u);
    EXPECT_EQ(info.handleFlags, TEE_HANDLE_FLAG_PERSISTENT | TEE_HANDLE_FLAG_INITIALIZED | kAll);

    char buf[32] = {};
    uint32_t n = 0;
    ASSERT_EQ(TEE_ReadObjectData(h, buf, 5, &n), TEE_SUCCESS);
    EXPECT_EQ(std::string(buf, n), "hello");
    ASSERT_EQ(TEE_SeekObjectData(h, 1, TEE_DATA_SEEK_CUR), TEE_SUCCESS);
    ASSERT_EQ(TEE_WriteObjectData(h, "WORLD!", 6), TEE_SUCCESS);
    EXPECT_EQ(info_of(h).dataPosition, 12u);
    EXPECT_EQ(read_all(h), text("hello WORLD!"));
    ASSERT_EQ(TEE_ReadObjectData(h, buf, sizeof buf, &n), TEE_SUCCESS);
    EXPECT_EQ(n, 0u) << "nothing left past the end";

    // Seeking: from the end, before the start (clamps), past the end.
    ASSERT_EQ(TEE_SeekObjectData(h, -6, TEE_DATA_SEEK_END), TEE_SUCCESS);
    ASSERT_EQ(TEE_ReadObjectData(h, buf, 3, &n), TEE_SUCCESS);
    EXPECT_EQ(std::string(buf, n), "WOR");
    ASSERT_EQ(TEE_SeekObjectData(h, -100, TEE_DATA_SEEK_CUR), TEE_SUCCESS);
    EXPECT_EQ(info_of(h).dataPosition, 0u);
    ASSERT_EQ(TEE_SeekObjectData(h, 4, TEE_DATA_SEEK_END), TEE_SUCCESS);
    ASSERT_EQ(TEE_WriteObjectData(h, "!", 1), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), Bytes({'h', 'e', 'l', 'l', 'o', ' ', 'W', 'O', 'R', 'L', 'D', '!', 0, 0, 0, 0, '!'}));

    // Truncation shortens or zero-extends and leaves the position alone.
    ASSERT_EQ(TEE_SeekObjectData(h, 3, TEE_DATA_SEEK_SET), TEE_SUCCESS);
    ASSERT_EQ(TEE_TruncateObjectData(h, 5), TEE_SUCCESS);
    EXPECT_EQ(info_of(h).dataPosition, 3u);
    EXPECT_EQ(read_all(h), text("hello"));
    ASSERT_EQ(TEE_TruncateObjectData(h, 7), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), Bytes({'h', 'e', 'l', 'l', 'o', 0, 0}));

    // Positions beyond what 32 bits can address overflow.
    ASSERT_EQ(TEE_SeekObjectData(h, 0x7FFFFFFF, TEE_DATA_SEEK_SET), TEE_SUCCESS);
    ASSERT_EQ(TEE_SeekObjectData(h, 0x7FFFFFFF, TEE_DATA_SEEK_CUR), TEE_SUCCESS);
    EXPECT_EQ(TEE_SeekObjectData(h, 2, TEE_DATA_SEEK_CUR), TEE_ERROR_OVERFLOW);
    EXPECT_EQ(TEE_WriteObjectData(h, "ab", 2), TEE_ERROR_OVERFLOW);
    // Within 32 bits but beyond what one object may hold.
    ASSERT_EQ(TEE_SeekObjectData(h, 16 << 20, TEE_DATA_SEEK_SET), TEE_SUCCESS);
    EXPECT_EQ(TEE_WriteObjectData(h, "a", 1), TEE_ERROR_STORAGE_NO_SPACE);
    EXPECT_EQ(TEE_TruncateObjectData(h, (16 << 20) + 1), TEE_ERROR_STORAGE_NO_SPACE);
    EXPECT_EQ(info_of(h).dataSize, 7u);
    TEE_CloseAndDeletePersistentObject(h);
    EXPECT_EQ(open(TEE_STORAGE_PRIVATE, kRead, &h), TEE_ERROR_ITEM_NOT_FOUND);
}

TEST_F(Storage, ObjectsSurviveARestartOfTheTee) {
    Bytes blob(3000);
    for (size_t i = 0; i < blob.size(); ++i)
        blob[i] = static_cast<uint8_t>(i * 7);
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, blob, kRead | kWrite, &h), TEE_SUCCESS);
    ASSERT_EQ(TEE_SeekObjectData(h, 0, TEE_DATA_SEEK_END), TEE_SUCCESS);
    ASSERT_EQ(TEE_WriteObjectData(h, "tail", 4), TEE_SUCCESS);
    TEE_CloseObject(h);
    ASSERT_EQ(TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE_RPMB, "r", 1, 0, TEE_HANDLE_NULL, "rpmb", 4, nullptr),
              TEE_SUCCESS);

    restart();
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kMeta, &h), TEE_SUCCESS);
    blob.insert(blob.end(), {'t', 'a', 'i', 'l'});
    EXPECT_EQ(read_all(h), blob);
    TEE_CloseAndDeletePersistentObject(h);
    ASSERT_EQ(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE_RPMB, "r", 1, kRead | kMeta, &h), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), text("rpmb"));
    EXPECT_EQ(TEE_CloseAndDeletePersistentObject1(h), TEE_SUCCESS);

    restart();
    EXPECT_EQ(open(TEE_STORAGE_PRIVATE, kRead, &h), TEE_ERROR_ITEM_NOT_FOUND);
}

TEST_F(Storage, OverwriteReplacesOnlyWhenAskedAndNothingIsOpen) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL, h2 = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("one"), kRead, &h), TEE_SUCCESS);
    EXPECT_EQ(create(TEE_STORAGE_PRIVATE, text("two"), kRead | TEE_DATA_FLAG_OVERWRITE, &h2), TEE_ERROR_ACCESS_CONFLICT)
        << "the object is open";
    EXPECT_EQ(h2, nullptr);
    TEE_CloseObject(h);
    EXPECT_EQ(create(TEE_STORAGE_PRIVATE, text("two"), kRead, &h2), TEE_ERROR_ACCESS_CONFLICT) << "it exists";
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("three"), kRead | TEE_DATA_FLAG_OVERWRITE, &h2), TEE_SUCCESS);
    EXPECT_EQ(read_all(h2), text("three"));
    TEE_CloseObject(h2);
    // Created with no handle wanted: made and closed at once.
    ASSERT_EQ(TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE, kId, kIdLen, TEE_DATA_FLAG_OVERWRITE, TEE_HANDLE_NULL,
                                         "four", 4, nullptr),
              TEE_SUCCESS);
    EXPECT_EQ(tee_host::handles::live_objects(), 0u);
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kMeta, &h), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), text("four"));
    TEE_CloseAndDeletePersistentObject(h);
}

TEST_F(Storage, SharingRulesDecideWhoMayOpenAlongside) {
    TEE_ObjectHandle first = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("data"), 0, &first), TEE_SUCCESS);
    TEE_CloseObject(first);
    struct {
        uint32_t have, want;
        bool ok;
    } cases[] = {
        {kRead, kRead, false},
        {kRead | kShareRead, kRead | kShareRead, true},
        {kRead | kShareRead, kRead, false}, // the newcomer must share what the first reads
        {kRead, kShareRead, true},          // a newcomer that does not read needs no read sharing
        {kWrite | kShareRead, kRead | kShareWrite, true},
        {kWrite | kShareWrite, kWrite | kShareWrite, true},
        {kWrite | kShareRead, kWrite | kShareWrite, false},
        {kRead | kShareRead | kShareWrite, kMeta | kShareRead | kShareWrite, false},
        {kMeta | kShareRead, kShareRead, false},
        {kShareRead, kRead | kShareRead | kShareWrite, true},
    };
    for (const auto &c : cases) {
        TEE_ObjectHandle a = TEE_HANDLE_NULL, b = TEE_HANDLE_NULL;
        ASSERT_EQ(open(TEE_STORAGE_PRIVATE, c.have, &a), TEE_SUCCESS);
        EXPECT_EQ(open(TEE_STORAGE_PRIVATE, c.want, &b), c.ok ? TEE_SUCCESS : TEE_ERROR_ACCESS_CONFLICT)
            << std::hex << c.have << " then " << c.want;
        TEE_CloseObject(b);
        TEE_CloseObject(a);
        ASSERT_EQ(open(TEE_STORAGE_PRIVATE, c.want, &b), TEE_SUCCESS) << "free again once closed";
        TEE_CloseObject(b);
    }

    // Writes through one handle are seen by the other; positions are per handle.
    TEE_ObjectHandle w = TEE_HANDLE_NULL, r = TEE_HANDLE_NULL;
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kWrite | kShareRead | kShareWrite, &w), TEE_SUCCESS);
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kShareRead | kShareWrite, &r), TEE_SUCCESS);
    ASSERT_EQ(TEE_WriteObjectData(w, "DA", 2), TEE_SUCCESS);
    EXPECT_EQ(info_of(r).dataPosition, 0u);
    EXPECT_EQ(read_all(r), text("DAta"));
    TEE_CloseObject(w);
    TEE_CloseObject(r);
}

TEST_F(Storage, RpmbUnusableRefusesEveryCallOnItButNotOnPrivate) {
    TEE_ObjectHandle rpmb = TEE_HANDLE_NULL, priv = TEE_HANDLE_NULL, h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE_RPMB, text("secret"), kAll, &rpmb), TEE_SUCCESS);
    EXPECT_EQ(files_in(dir_ / "storage" / "rpmb"), std::vector<std::string>{kIdHex + ".obj"});
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("plain"), kAll, &priv), TEE_SUCCESS);

    tee_->set_rpmb_usable(false);
    char buf[8] = {};
    uint32_t n = 0;
    TEE_ObjectInfo info{};
    EXPECT_EQ(create(TEE_STORAGE_PRIVATE_RPMB, text("x"), kAll | TEE_DATA_FLAG_OVERWRITE, &h),
              TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(open(TEE_STORAGE_PRIVATE_RPMB, kRead, &h), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_ReadObjectData(rpmb, buf, sizeof buf, &n), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_WriteObjectData(rpmb, "x", 1), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_TruncateObjectData(rpmb, 0), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_SeekObjectData(rpmb, 1, TEE_DATA_SEEK_SET), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_GetObjectInfo1(rpmb, &info), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(TEE_CloseAndDeletePersistentObject1(rpmb), TEE_ERROR_STORAGE_NOT_AVAILABLE);
    EXPECT_EQ(read_all(priv), text("plain"));

    tee_->set_rpmb_usable(true);
    EXPECT_EQ(read_all(rpmb), text("secret")) << "nothing changed while it was away";
    EXPECT_EQ(TEE_CloseAndDeletePersistentObject1(rpmb), TEE_SUCCESS);
    TEE_CloseAndDeletePersistentObject(priv);
}

TEST_F(Storage, UnknownStoragesAndIdentifiers) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    for (uint32_t storage : {0u, 2u, 0x80000000u, 0x80000002u}) {
        EXPECT_EQ(create(storage, text("x"), kAll, &h), TEE_ERROR_ITEM_NOT_FOUND) << storage;
        EXPECT_EQ(open(storage, kRead, &h), TEE_ERROR_ITEM_NOT_FOUND) << storage;
    }
    // Identifiers are any bytes, up to 64 of them; each maps to its own file.
    Bytes id64(64);
    for (size_t i = 0; i < id64.size(); ++i)
        id64[i] = static_cast<uint8_t>(i * 37 + 1);
    id64[0] = 0;
    id64[1] = '/';
    Bytes id63(id64.begin(), id64.end() - 1);
    for (const Bytes *id : {&id64, &id63}) {
        ASSERT_EQ(TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE, id->data(), static_cast<uint32_t>(id->size()), 0,
                                             TEE_HANDLE_NULL, id->data(), 4, nullptr),
                  TEE_SUCCESS);
    }
    EXPECT_EQ(files_in(private_dir()), (std::vector<std::string>{to_hex(id63) + ".obj", to_hex(id64) + ".obj"}));
    ASSERT_EQ(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, id63.data(), 63, kRead | kMeta, &h), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), Bytes(id63.begin(), id63.begin() + 4));
    TEE_CloseAndDeletePersistentObject(h);
    ASSERT_EQ(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, id64.data(), 64, kMeta, &h), TEE_SUCCESS);
    TEE_CloseAndDeletePersistentObject(h);
    EXPECT_TRUE(files_in(private_dir()).empty());
}

TEST_F(Storage, WritesLeaveNoTemporaryFileAndALeftoverOneIsHarmless) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("version 1"), kRead | kWrite, &h), TEE_SUCCESS);
    ASSERT_EQ(TEE_WriteObjectData(h, "VERSION", 7), TEE_SUCCESS);
    ASSERT_EQ(TEE_TruncateObjectData(h, 9), TEE_SUCCESS);
    EXPECT_EQ(files_in(private_dir()), std::vector<std::string>{kIdHex + ".obj"});
    TEE_CloseObject(h);

    // A crash while writing the next version left a partial temporary file.
    {
        std::ofstream tmp(private_dir() / (kIdHex + ".tmp"), std::ios::binary);
        tmp << "TEEOBJ01 torn half-written garbage";
    }
    restart();
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kWrite, &h), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), text("VERSION 1"));
    EXPECT_EQ(files_in(private_dir()), std::vector<std::string>{kIdHex + ".obj"});
    ASSERT_EQ(TEE_WriteObjectData(h, "!", 1), TEE_SUCCESS);
    TEE_CloseObject(h);
    restart();
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kMeta, &h), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), text("VERSION 1!"));
    TEE_CloseAndDeletePersistentObject(h);
}

TEST_F(Storage, DamagedFilesAreReportedCorrupt) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("0123456789"), 0, nullptr), TEE_SUCCESS);
    fs::path file = private_dir() / (kIdHex + ".obj");
    std::string good;
    {
        std::ifstream in(file, std::ios::binary);
        good.assign(std::istreambuf_iterator<char>(in), {});
    }
    auto damaged = [&](const std::string &contents) {
        std::ofstream(file, std::ios::binary | std::ios::trunc) << contents;
        return open(TEE_STORAGE_PRIVATE, kRead, &h);
    };
    std::string flipped = good;
    flipped[good.size() / 2] ^= 0x01;
    EXPECT_EQ(damaged(flipped), TEE_ERROR_CORRUPT_OBJECT);
    EXPECT_EQ(damaged(good.substr(0, good.size() - 1)), TEE_ERROR_CORRUPT_OBJECT);
    EXPECT_EQ(damaged(""), TEE_ERROR_CORRUPT_OBJECT);
    EXPECT_EQ(h, nullptr);
    ASSERT_EQ(damaged(good), TEE_SUCCESS);
    EXPECT_EQ(read_all(h), text("0123456789"));
    TEE_CloseObject(h);
}

TEST_F(Storage, KeyObjectsKeepTheirAttributes) {
    TEE_ObjectHandle key = TEE_HANDLE_NULL, h = TEE_HANDLE_NULL;
    Bytes secret = hex("2b7e151628aed2a6abf7158809cf4f3c");
    ASSERT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &key), TEE_SUCCESS);
    TEE_Attribute a{};
    TEE_InitRefAttribute(&a, TEE_ATTR_SECRET_VALUE, secret.data(), 16);
    ASSERT_EQ(TEE_PopulateTransientObject(key, &a, 1), TEE_SUCCESS);
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("payload"), 0, nullptr, key), TEE_SUCCESS);
    TEE_FreeTransientObject(key);

    restart();
    ASSERT_EQ(open(TEE_STORAGE_PRIVATE, kRead | kMeta, &h), TEE_SUCCESS);
    TEE_ObjectInfo info = info_of(h);
    EXPECT_EQ(info.objectType, TEE_TYPE_AES);
    EXPECT_EQ(info.objectSize, 128u);
    EXPECT_EQ(info.dataSize, 7u);
    Bytes out(32);
    uint32_t len = 32;
    ASSERT_EQ(TEE_GetObjectBufferAttribute(h, TEE_ATTR_SECRET_VALUE, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(Bytes(out.begin(), out.begin() + len), secret);

    // The stored key keys an operation: the first SP 800-38A ECB block.
    TEE_OperationHandle op = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateOperation(&op, TEE_ALG_AES_ECB_NOPAD, TEE_MODE_ENCRYPT, 128), TEE_SUCCESS);
    ASSERT_EQ(TEE_SetOperationKey(op, h), TEE_SUCCESS);
    TEE_CipherInit(op, nullptr, 0);
    Bytes block = hex("6bc1bee22e409f96e93d7e117393172a");
    len = 16;
    ASSERT_EQ(TEE_CipherDoFinal(op, block.data(), 16, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out.data(), len), "3ad77bb40d7a3660a89ecaf32466ef97");
    TEE_FreeOperation(op);
    TEE_CloseAndDeletePersistentObject(h);
}

using StorageDeathTest = Storage;

TEST_F(StorageDeathTest, MisusePanics) {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    ASSERT_EQ(create(TEE_STORAGE_PRIVATE, text("data"), kShareRead, &h), TEE_SUCCESS);
    char buf[4] = {};
    uint32_t n = 0;
    EXPECT_DEATH(TEE_ReadObjectData(h, buf, 4, &n), "without the access right");
    EXPECT_DEATH(TEE_WriteObjectData(h, buf, 4), "without the access right");
    EXPECT_DEATH(TEE_TruncateObjectData(h, 0), "without the access right");
    EXPECT_DEATH(TEE_CloseAndDeletePersistentObject(h), "without the access right");
    EXPECT_DEATH(TEE_FreeTransientObject(h), "on a persistent object");
    EXPECT_DEATH(TEE_ResetTransientObject(h), "on a persistent object");
    Bytes long_id(65, 'x');
    EXPECT_DEATH(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, long_id.data(), 65, kRead, &h), "too long");
    EXPECT_DEATH(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, kId, kIdLen, 0x8000, &h), "unknown flags");
    TEE_ObjectHandle transient = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateTransientObject(TEE_TYPE_AES, 128, &transient), TEE_SUCCESS);
    EXPECT_DEATH(TEE_SeekObjectData(transient, 0, TEE_DATA_SEEK_SET), "on a transient object");
    EXPECT_DEATH(create(TEE_STORAGE_PRIVATE, text("x"), TEE_DATA_FLAG_OVERWRITE, nullptr, transient),
                 "from an uninitialized object");
    TEE_FreeTransientObject(transient);
    TEE_CloseObject(h);
    EXPECT_DEATH(TEE_ReadObjectData(h, buf, 4, &n), "invalid or freed object handle");
}

} // namespace
