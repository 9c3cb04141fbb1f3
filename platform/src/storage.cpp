/*
 * storage.cpp - persistent objects and their data streams.
 *
 * Each storage is a directory under the Tee's state directory; an object
 * is one file named after the hex of its identifier, holding its type,
 * attributes and data followed by a SHA-256 of the rest, so that damage
 * shows as TEE_ERROR_CORRUPT_OBJECT. Every change rewrites the whole file
 * through a temporary one (write, fsync, rename, fsync the directory): a
 * crash leaves the old or the new object, never a mix.
 *
 * While any handle is open the object's contents live in one StoredObject
 * shared by its handles; each handle keeps its own data position.
 */
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <map>
#include <mutex>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "object_internal.h"

namespace fs = std::filesystem;

namespace tee_host::detail {

struct StoredObject {
    uint32_t storage = 0;
    fs::path dir;
    std::string name; // hex of the object identifier
    // Fixed at creation.
    uint32_t type = TEE_TYPE_DATA;
    uint32_t key_size = 0;
    uint32_t usage = 0xFFFFFFFFu;
    AttributeMap attrs;
    // The data stream.
    SecretBytes data;
    std::vector<Object *> handles; // open on this object

    fs::path file() const { return dir / (name + ".obj"); }
    // A crash's leftover from before temporaries were named per process.
    fs::path temp() const { return dir / (name + ".tmp"); }
    // Each process writes its own temporary: TEEs in several processes may
    // share one state directory.
    fs::path own_temp() const { return dir / (name + ".tmp." + std::to_string(::getpid())); }
};

namespace {

constexpr uint32_t kAccessFlags =
    TEE_DATA_FLAG_ACCESS_READ | TEE_DATA_FLAG_ACCESS_WRITE | TEE_DATA_FLAG_ACCESS_WRITE_META;
constexpr uint32_t kShareFlags = TEE_DATA_FLAG_SHARE_READ | TEE_DATA_FLAG_SHARE_WRITE;
constexpr uint32_t kHandleDataFlags = kAccessFlags | kShareFlags;
constexpr uint32_t kCreateFlags = kHandleDataFlags | TEE_DATA_FLAG_OVERWRITE;
constexpr char kMagic[8] = {'T', 'E', 'E', 'O', 'B', 'J', '0', '1'};
constexpr size_t kHashLen = 32;
// What one object's data stream may grow to: secure storage is small, and
// a far seek followed by a write must not ask the host for gigabytes.
constexpr size_t kMaxDataSize = size_t{16} << 20;

struct StorageState {
    std::mutex mu;
    std::map<fs::path, std::weak_ptr<StoredObject>> open; // objects with open handles
};

// Never destroyed: a Tee kept in a static may still close objects as it
// ends at process exit, after function-local statics are gone.
StorageState &state() {
    static StorageState *s = new StorageState;
    return *s;
}

// --- Locations -----------------------------------------------------------------

TEE_Result check_storage(uint32_t storage) {
    if (storage == TEE_STORAGE_PRIVATE)
        return TEE_SUCCESS;
    if (storage == TEE_STORAGE_PRIVATE_RPMB)
        return globals().rpmb_usable ? TEE_SUCCESS : TEE_ERROR_STORAGE_NOT_AVAILABLE;
    return TEE_ERROR_ITEM_NOT_FOUND;
}

fs::path storage_dir(uint32_t storage) {
    fs::path base = globals().config.state_dir / "storage";
    return base / (storage == TEE_STORAGE_PRIVATE ? "private" : "rpmb");
}

std::string hex_name(const void *id, uint32_t len) {
    static const char digits[] = "0123456789abcdef";
    const auto *p = static_cast<const uint8_t *>(id);
    std::string s;
    for (uint32_t i = 0; i < len; ++i) {
        s += digits[p[i] >> 4];
        s += digits[p[i] & 15];
    }
    return s;
}

void check_object_id(const void *id, uint32_t len, const char *fn) {
    if (len > TEE_OBJECT_ID_MAX_LEN || (len && !id)) {
        std::fprintf(stderr, "%s: object identifier of %u bytes\n", fn, len);
        panic("an object identifier that is null or too long");
    }
}

// --- File format ---------------------------------------------------------------

void put32(SecretBytes &out, uint32_t v) {
    for (int i = 0; i < 4; ++i)
        out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

bool sha256(const uint8_t *p, size_t n, uint8_t out[kHashLen]) {
    unsigned int len = 0;
    return EVP_Digest(p, n, out, &len, EVP_sha256(), nullptr) == 1 && len == kHashLen;
}

SecretBytes serialize(const StoredObject &o, const SecretBytes &data) {
    SecretBytes out(kMagic, kMagic + sizeof kMagic);
    put32(out, o.type);
    put32(out, o.key_size);
    put32(out, o.usage);
    put32(out, static_cast<uint32_t>(o.attrs.size()));
    for (const auto &[id, a] : o.attrs) {
        put32(out, id);
        put32(out, a.a);
        put32(out, a.b);
        put32(out, static_cast<uint32_t>(a.bytes.size()));
        out.insert(out.end(), a.bytes.begin(), a.bytes.end());
    }
    put32(out, static_cast<uint32_t>(data.size()));
    out.insert(out.end(), data.begin(), data.end());
    uint8_t hash[kHashLen] = {};
    if (!sha256(out.data(), out.size(), hash))
        panic("the storage digest failed");
    out.insert(out.end(), hash, hash + kHashLen);
    return out;
}

class Reader {
  public:
    Reader(const uint8_t *p, size_t n) : p_(p), n_(n) {}
    bool u32(uint32_t *v) {
        if (n_ - pos_ < 4)
            return false;
        *v = 0;
        for (int i = 0; i < 4; ++i)
            *v |= uint32_t{p_[pos_ + i]} << (8 * i);
        pos_ += 4;
        return true;
    }
    bool bytes(size_t len, SecretBytes *out) {
        if (n_ - pos_ < len)
            return false;
        out->assign(p_ + pos_, p_ + pos_ + len);
        pos_ += len;
        return true;
    }
    bool done() const { return pos_ == n_; }

  private:
    const uint8_t *p_;
    size_t n_;
    size_t pos_ = 0;
};

// parse - fills o's metadata and data from a file's bytes; false when the
// file is not a whole, undamaged object.
bool parse(const SecretBytes &file, StoredObject &o) {
    if (file.size() < sizeof kMagic + kHashLen || std::memcmp(file.data(), kMagic, sizeof kMagic) != 0)
        return false;
    size_t body = file.size() - kHashLen;
    uint8_t hash[kHashLen] = {};
    if (!sha256(file.data(), body, hash) || CRYPTO_memcmp(hash, file.data() + body, kHashLen) != 0)
        return false;
    Reader r(file.data() + sizeof kMagic, body - sizeof kMagic);
    uint32_t count = 0;
    if (!r.u32(&o.type) || !r.u32(&o.key_size) || !r.u32(&o.usage) || !r.u32(&count))
        return false;
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t id = 0;
        uint32_t len = 0;
        Attribute a;
        if (!r.u32(&id) || !r.u32(&a.a) || !r.u32(&a.b) || !r.u32(&len) || !r.bytes(len, &a.bytes))
            return false;
        o.attrs[id] = std::move(a);
    }
    uint32_t len = 0;
    return r.u32(&len) && r.bytes(len, &o.data) && r.done();
}

// --- Files -----------------------------------------------------------------------

TEE_Result io_error(int err) {
    return err == ENOSPC || err == EDQUOT ? TEE_ERROR_STORAGE_NO_SPACE : TEE_ERROR_STORAGE_NOT_AVAILABLE;
}

// replace_file - makes `bytes` the object's file, atomically. exclusive:
// only when no file is there yet (another process may be creating the same
// object), TEE_ERROR_ACCESS_CONFLICT when one is.
TEE_Result replace_file(const StoredObject &o, const SecretBytes &bytes, bool exclusive = false) {
    std::error_code ec;
    fs::create_directories(o.dir, ec);
    if (ec)
        return io_error(ec.value());
    int err = atomic_write(o.file(), o.own_temp(), bytes.data(), bytes.size(), exclusive);
    if (err == EEXIST && exclusive)
        return TEE_ERROR_ACCESS_CONFLICT;
    return err ? io_error(err) : TEE_SUCCESS;
}

// read_file - the whole file; ENOENT and other errors as errno values.
int read_file(const fs::path &path, SecretBytes *out) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return errno;
    uint8_t buf[4096] = {};
    int err = 0;
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0) {
            err = errno;
            break;
        }
        if (n == 0)
            break;
        out->insert(out->end(), buf, buf + n);
    }
    OPENSSL_cleanse(buf, sizeof buf);
    ::close(fd);
    return err;
}

// load - the object from its file. A temporary file beside it is what an
// interrupted write left: the object file is intact, so the leftover goes.
TEE_Result load(StoredObject &o) {
    SecretBytes bytes;
    int err = read_file(o.file(), &bytes);
    if (err == ENOENT)
        return TEE_ERROR_ITEM_NOT_FOUND;
    if (err)
        return io_error(err);
    if (!parse(bytes, o)) {
        o.attrs.clear();
        o.data.clear();
        return TEE_ERROR_CORRUPT_OBJECT;
    }
    ::unlink(o.temp().c_str());
    return TEE_SUCCESS;
}

// --- Handles -----------------------------------------------------------------------

// Whether a handle opened with `want` may join one opened with `have`.
bool compatible(uint32_t have, uint32_t want) {
    if ((have | want) & TEE_DATA_FLAG_ACCESS_WRITE_META)
        return false; // deleting or renaming needs the object to itself
    if ((want & TEE_DATA_FLAG_ACCESS_READ) && !(have & TEE_DATA_FLAG_SHARE_READ))
        return false;
    if ((have & TEE_DATA_FLAG_ACCESS_READ) && !(want & TEE_DATA_FLAG_SHARE_READ))
        return false;
    if ((want & TEE_DATA_FLAG_ACCESS_WRITE) && !(have & TEE_DATA_FLAG_SHARE_WRITE))
        return false;
    if ((have & TEE_DATA_FLAG_ACCESS_WRITE) && !(want & TEE_DATA_FLAG_SHARE_WRITE))
        return false;
    return true;
}

std::shared_ptr<StoredObject> find_open(StorageState &s, const fs::path &file) {
    auto it = s.open.find(file);
    return it == s.open.end() ? nullptr : it->second.lock();
}

// new_handle - a handle on o with the given data flags; called with the lock held.
std::unique_ptr<Object> new_handle(StorageState &s, const std::shared_ptr<StoredObject> &o, uint32_t flags) {
    auto h = std::make_unique<Object>();
    h->type = o->type;
    h->key_size = o->key_size;
    h->max_size = o->key_size;
    h->usage = o->usage;
    h->flags = TEE_HANDLE_FLAG_PERSISTENT | TEE_HANDLE_FLAG_INITIALIZED | (flags & kHandleDataFlags);
    h->attrs = o->attrs;
    h->ops = find_object_type(o->type);
    h->stored = o;
    h->storage_id = o->storage;
    o->handles.push_back(h.get());
    s.open[o->file()] = o;
    return h;
}

Object &persistent_handle(TEE_ObjectHandle handle, const char *fn) {
    Object &obj = object_from_handle(handle, fn);
    if (!obj.persistent()) {
        std::fprintf(stderr, "%s\n", fn);
        panic("a data-stream function on a transient object");
    }
    return obj;
}

void require_access(const Object &obj, uint32_t flag, const char *fn) {
    if (!(obj.flags & flag)) {
        std::fprintf(stderr, "%s\n", fn);
        panic("a persistent object used without the access right it needs");
    }
}

} // namespace

TEE_Result storage_available(const Object &obj) {
    return check_storage(obj.storage_id);
}

uint32_t persistent_data_size(const Object &obj) {
    std::lock_guard<std::mutex> lock(state().mu);
    return static_cast<uint32_t>(obj.stored->data.size());
}

void close_persistent(Object &obj) {
    StorageState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (!obj.stored)
        return;
    auto &hs = obj.stored->handles;
    hs.erase(std::remove(hs.begin(), hs.end(), &obj), hs.end());
    if (hs.empty()) {
        auto it = s.open.find(obj.stored->file());
        if (it != s.open.end() && it->second.lock() == obj.stored)
            s.open.erase(it);
    }
    obj.stored.reset();
}

} // namespace tee_host::detail

using namespace tee_host::detail;

extern "C" {

TEE_Result TEE_CreatePersistentObject(uint32_t storageID, const void *objectID, uint32_t objectIDLen, uint32_t flags,
                                      TEE_ObjectHandle attributes, const void *initialData, uint32_t initialDataLen,
                                      TEE_ObjectHandle *object) {
    if (object)
        *object = TEE_HANDLE_NULL;
    check_object_id(objectID, objectIDLen, __func__);
    if (flags & ~kCreateFlags)
        panic("TEE_CreatePersistentObject with unknown flags");
    if (initialDataLen && !initialData)
        panic("TEE_CreatePersistentObject with null initial data");
    if (initialDataLen > kMaxDataSize)
        return TEE_ERROR_STORAGE_NO_SPACE;
    const Object *from = attributes ? &object_from_handle(attributes, __func__) : nullptr;
    if (from && !from->initialized())
        panic("TEE_CreatePersistentObject from an uninitialized object");
    TEE_Result res = check_storage(storageID);
    if (res == TEE_SUCCESS && from && from->persistent())
        res = storage_available(*from);
    if (res != TEE_SUCCESS)
        return res;
    if (!charge_handle())
        return TEE_ERROR_OUT_OF_MEMORY;

    auto o = std::make_shared<StoredObject>();
    o->storage = storageID;
    o->dir = storage_dir(storageID);
    o->name = hex_name(objectID, objectIDLen);
    if (from) {
        o->type = from->type;
        o->key_size = from->key_size;
        o->usage = from->usage;
        o->attrs = from->attrs;
    }
    const auto *init = static_cast<const uint8_t *>(initialData);
    o->data.assign(init, init + initialDataLen);

    StorageState &s = state();
    std::unique_ptr<Object> handle;
    {
        std::lock_guard<std::mutex> lock(s.mu);
        // Replacing an object someone has open would pull it from under them.
        if (find_open(s, o->file()))
            return TEE_ERROR_ACCESS_CONFLICT;
        std::error_code ec;
        if (!(flags & TEE_DATA_FLAG_OVERWRITE) && fs::exists(o->file(), ec))
            return TEE_ERROR_ACCESS_CONFLICT;
        res = replace_file(*o, serialize(*o, o->data), !(flags & TEE_DATA_FLAG_OVERWRITE));
        if (res != TEE_SUCCESS)
            return res;
        handle = new_handle(s, o, flags);
    }
    TEE_ObjectHandle h = register_object(std::move(handle));
    if (object)
        *object = h;
    else
        TEE_CloseObject(h);
    return TEE_SUCCESS;
}

TEE_Result TEE_OpenPersistentObject(uint32_t storageID, const void *objectID, uint32_t objectIDLen, uint32_t flags,
                                    TEE_ObjectHandle *object) {
    if (!object)
        panic("TEE_OpenPersistentObject with a null handle pointer");
    *object = TEE_HANDLE_NULL;
    check_object_id(objectID, objectIDLen, __func__);
    if (flags & ~kCreateFlags)
        panic("TEE_OpenPersistentObject with unknown flags");
    TEE_Result res = check_storage(storageID);
    if (res != TEE_SUCCESS)
        return res;
    if (!charge_handle())
        return TEE_ERROR_OUT_OF_MEMORY;

    fs::path dir = storage_dir(storageID);
    std::string name = hex_name(objectID, objectIDLen);
    StorageState &s = state();
    std::unique_ptr<Object> handle;
    {
        std::lock_guard<std::mutex> lock(s.mu);
        std::shared_ptr<StoredObject> o = find_open(s, dir / (name + ".obj"));
        if (o) {
            for (const Object *other : o->handles)
                if (!compatible(other->flags, flags))
                    return TEE_ERROR_ACCESS_CONFLICT;
        } else {
            o = std::make_shared<StoredObject>();
            o->storage = storageID;
            o->dir = dir;
            o->name = name;
            res = load(*o);
            if (res != TEE_SUCCESS)
                return res;
        }
        handle = new_handle(s, o, flags);
    }
    *object = register_object(std::move(handle));
    return TEE_SUCCESS;
}

TEE_Result TEE_CloseAndDeletePersistentObject1(TEE_ObjectHandle object) {
    if (!object)
        return TEE_SUCCESS;
    Object &obj = persistent_handle(object, __func__);
    require_access(obj, TEE_DATA_FLAG_ACCESS_WRITE_META, __func__);
    TEE_Result res = storage_available(obj);
    if (res != TEE_SUCCESS)
        return res;
    {
        std::lock_guard<std::mutex> lock(state().mu);
        const StoredObject &o = *obj.stored;
        if (::unlink(o.file().c_str()) != 0 && errno != ENOENT)
            return io_error(errno);
        ::unlink(o.temp().c_str());
        int err = sync_dir(o.dir);
        if (err)
            return io_error(err);
    }
    release_object(object);
    return TEE_SUCCESS;
}

void TEE_CloseAndDeletePersistentObject(TEE_ObjectHandle object) {
    if (TEE_CloseAndDeletePersistentObject1(object) != TEE_SUCCESS)
        panic("TEE_CloseAndDeletePersistentObject could not delete the object");
}

TEE_Result TEE_ReadObjectData(TEE_ObjectHandle object, void *buffer, uint32_t size, uint32_t *count) {
    Object &obj = persistent_handle(object, __func__);
    require_access(obj, TEE_DATA_FLAG_ACCESS_READ, __func__);
    if (!count || (size && !buffer))
        panic("TEE_ReadObjectData with a null buffer or count");
    TEE_Result res = storage_available(obj);
    if (res != TEE_SUCCESS)
        return res;
    std::lock_guard<std::mutex> lock(state().mu);
    const SecretBytes &data = obj.stored->data;
    size_t n = obj.position < data.size() ? std::min<size_t>(size, data.size() - obj.position) : 0;
    if (n)
        std::memcpy(buffer, data.data() + obj.position, n);
    obj.position += static_cast<uint32_t>(n);
    *count = static_cast<uint32_t>(n);
    return TEE_SUCCESS;
}

TEE_Result TEE_WriteObjectData(TEE_ObjectHandle object, const void *buffer, uint32_t size) {
    Object &obj = persistent_handle(object, __func__);
    require_access(obj, TEE_DATA_FLAG_ACCESS_WRITE, __func__);
    if (size && !buffer)
        panic("TEE_WriteObjectData with a null buffer");
    TEE_Result res = storage_available(obj);
    if (res != TEE_SUCCESS)
        return res;
    if (uint64_t{obj.position} + size > TEE_DATA_MAX_POSITION)
        return TEE_ERROR_OVERFLOW;
    std::lock_guard<std::mutex> lock(state().mu);
    StoredObject &o = *obj.stored;
    // The change is made on a copy and kept only once it is on disk.
    SecretBytes data = o.data;
    size_t end = size_t{obj.position} + size;
    if (end > kMaxDataSize)
        return TEE_ERROR_STORAGE_NO_SPACE;
    if (data.size() < end)
        data.resize(end); // a gap before the position reads as zeroes
    if (size)
        std::memcpy(data.data() + obj.position, buffer, size);
    res = replace_file(o, serialize(o, data));
    if (res != TEE_SUCCESS)
        return res;
    o.data.swap(data);
    obj.position = static_cast<uint32_t>(end);
    return TEE_SUCCESS;
}

TEE_Result TEE_TruncateObjectData(TEE_ObjectHandle object, uint32_t size) {
    Object &obj = persistent_handle(object, __func__);
    require_access(obj, TEE_DATA_FLAG_ACCESS_WRITE, __func__);
    TEE_Result res = storage_available(obj);
    if (res != TEE_SUCCESS)
        return res;
    if (size > kMaxDataSize)
        return TEE_ERROR_STORAGE_NO_SPACE;
    std::lock_guard<std::mutex> lock(state().mu);
    StoredObject &o = *obj.stored;
    SecretBytes data = o.data;
    data.resize(size);
    res = replace_file(o, serialize(o, data));
    if (res != TEE_SUCCESS)
        return res;
    o.data.swap(data);
    return TEE_SUCCESS;
}

TEE_Result TEE_SeekObjectData(TEE_ObjectHandle object, int32_t offset, TEE_Whence whence) {
    Object &obj = persistent_handle(object, __func__);
    TEE_Result res = storage_available(obj);
    if (res != TEE_SUCCESS)
        return res;
    std::lock_guard<std::mutex> lock(state().mu);
    int64_t base = 0;
    switch (whence) {
    case TEE_DATA_SEEK_SET:
        base = 0;
        break;
    case TEE_DATA_SEEK_CUR:
        base = obj.position;
        break;
    case TEE_DATA_SEEK_END:
        base = static_cast<int64_t>(obj.stored->data.size());
        break;
    default:
        panic("TEE_SeekObjectData with an unknown origin");
    }
    int64_t pos = base + offset;
    if (pos > int64_t{TEE_DATA_MAX_POSITION})
        return TEE_ERROR_OVERFLOW;
    obj.position = pos < 0 ? 0 : static_cast<uint32_t>(pos);
    return TEE_SUCCESS;
}

} // extern "C"
