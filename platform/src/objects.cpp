/*
 * objects.cpp - transient objects, the generic object functions shared
 * with persistent objects, the handle table and its accounting at the end
 * of a TA instance.
 *
 * Handles are never-reused numbers rather than pointers, so that a freed
 * or forged handle is always recognised and panics instead of reaching
 * freed memory.
 */
#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <unordered_map>

#include "object_internal.h"
#include "pkey_internal.h"

namespace tee_host {
namespace detail {
namespace {

struct HandleTable {
    std::mutex mu;
    std::unordered_map<uintptr_t, std::unique_ptr<Object>> objects;
    size_t leaked_at_last_destroy = 0;
};

// Never destroyed: a Tee kept in a static may still free handles as it
// ends at process exit, after function-local statics are gone.
HandleTable &table() {
    static HandleTable *t = new HandleTable;
    return *t;
}

// --- Secret-key types --------------------------------------------------------

constexpr uint32_t kSecretAttrs[] = {TEE_ATTR_SECRET_VALUE};

bool aes_size(uint32_t bits) {
    return bits == 128 || bits == 192 || bits == 256;
}

template <uint32_t Lo, uint32_t Hi> bool bytes_between(uint32_t bits) {
    return bits >= Lo && bits <= Hi && bits % 8 == 0;
}

template <bool (*Ok)(uint32_t)> TEE_Result secret_key_bits(const AttributeMap &attrs, uint32_t *bits) {
    size_t len = attrs.at(TEE_ATTR_SECRET_VALUE).bytes.size();
    if (len > 0xFFFFFFFFu / 8 || !Ok(static_cast<uint32_t>(len * 8)))
        return TEE_ERROR_BAD_PARAMETERS;
    *bits = static_cast<uint32_t>(len * 8);
    return TEE_SUCCESS;
}

TEE_Result secret_generate(AttributeMap &attrs, uint32_t bits, const TEE_Attribute *, uint32_t) {
    Attribute &a = attrs[TEE_ATTR_SECRET_VALUE];
    a.bytes.resize(bits / 8);
    // Through TEE_GenerateRandom so that scripted test bytes apply.
    TEE_GenerateRandom(a.bytes.data(), static_cast<uint32_t>(a.bytes.size()));
    return TEE_SUCCESS;
}

template <uint32_t Type, bool (*Ok)(uint32_t)>
constexpr ObjectTypeOps secret_type{Type, kSecretAttrs, {}, Ok, secret_key_bits<Ok>, secret_generate};

constexpr ObjectTypeOps kSecretTypes[] = {
    secret_type<TEE_TYPE_AES, aes_size>,
    secret_type<TEE_TYPE_HMAC_MD5, bytes_between<64, 512>>,
    secret_type<TEE_TYPE_HMAC_SHA1, bytes_between<80, 512>>,
    secret_type<TEE_TYPE_HMAC_SHA224, bytes_between<112, 512>>,
    secret_type<TEE_TYPE_HMAC_SHA256, bytes_between<192, 1024>>,
    secret_type<TEE_TYPE_HMAC_SHA384, bytes_between<256, 1024>>,
    secret_type<TEE_TYPE_HMAC_SHA512, bytes_between<256, 1024>>,
    secret_type<TEE_TYPE_GENERIC_SECRET, bytes_between<8, 4096>>,
};

// minimal_integers - each buffer attribute without its leading zero bytes.
void minimal_integers(AttributeMap &attrs) {
    for (auto &[id, attr] : attrs) {
        auto first = std::find_if(attr.bytes.begin(), attr.bytes.end(), [](uint8_t x) { return x != 0; });
        attr.bytes.erase(attr.bytes.begin(), first);
    }
}

bool listed(std::span<const uint32_t> ids, uint32_t id) {
    for (uint32_t x : ids)
        if (x == id)
            return true;
    return false;
}

// Copies the caller's attributes into a map, panicking on the TA bugs GP
// names: foreign or repeated attributes, null buffers, missing mandatory ones.
AttributeMap collect_attributes(const ObjectTypeOps &ops, const TEE_Attribute *attrs, uint32_t count) {
    if (count && !attrs)
        panic("TEE_PopulateTransientObject with null attributes");
    AttributeMap map;
    for (uint32_t i = 0; i < count; ++i) {
        const TEE_Attribute &in = attrs[i];
        if (!listed(ops.required, in.attributeID) && !listed(ops.optional, in.attributeID))
            panic("TEE_PopulateTransientObject with an attribute foreign to the object type");
        if (map.count(in.attributeID))
            panic("TEE_PopulateTransientObject with an attribute given twice");
        Attribute &out = map[in.attributeID];
        if (is_value_attribute(in.attributeID)) {
            out.a = in.content.value.a;
            out.b = in.content.value.b;
        } else {
            if (in.content.ref.length && !in.content.ref.buffer)
                panic("TEE_PopulateTransientObject with a null attribute buffer");
            const auto *p = static_cast<const uint8_t *>(in.content.ref.buffer);
            out.bytes.assign(p, p + in.content.ref.length);
        }
    }
    for (uint32_t id : ops.required)
        if (!map.count(id))
            panic("TEE_PopulateTransientObject without a mandatory attribute");
    return map;
}

Object &transient_uninitialized(TEE_ObjectHandle handle, const char *fn) {
    Object &obj = object_from_handle(handle, fn);
    if (obj.persistent())
        panic("a transient-object function on a persistent object");
    if (obj.initialized())
        panic("an already initialized transient object populated again");
    return obj;
}

// A readable attribute of an initialized object, after GP's misuse checks.
const Attribute *readable_attribute(const Object &obj, uint32_t id, bool want_value) {
    if (!obj.initialized())
        panic("an attribute read from an uninitialized object");
    if (is_value_attribute(id) != want_value)
        panic(want_value ? "TEE_GetObjectValueAttribute of a buffer attribute"
                         : "TEE_GetObjectBufferAttribute of a value attribute");
    if (!is_public_attribute(id) && !(obj.usage & TEE_USAGE_EXTRACTABLE))
        panic("a secret attribute read from a non-extractable object");
    return find_attribute(obj, id);
}

void fill_info(const Object &obj, TEE_ObjectInfo *info) {
    *info = TEE_ObjectInfo{};
    info->objectType = obj.type;
    info->objectSize = obj.key_size;
    info->maxObjectSize = obj.max_size;
    info->objectUsage = obj.usage;
    info->handleFlags = obj.flags;
    if (obj.persistent()) {
        info->dataSize = persistent_data_size(obj);
        info->dataPosition = obj.position;
    }
}

} // namespace

const ObjectTypeOps *secret_object_type(uint32_t type) {
    return find_type(kSecretTypes, type);
}

const ObjectTypeOps *find_object_type(uint32_t type) {
    for (auto lookup : {secret_object_type, rsa_object_type, ec_object_type})
        if (const ObjectTypeOps *ops = lookup(type))
            return ops;
    return nullptr;
}

void Object::clear_key() {
    attrs.clear(); // the allocator wipes the bytes
    if (pkey) {
        EVP_PKEY_free(pkey);
        pkey = nullptr;
    }
}

std::unique_ptr<Object> copy_key(const Object &src) {
    auto dst = std::make_unique<Object>();
    dst->type = src.type;
    dst->max_size = src.max_size;
    dst->key_size = src.key_size;
    dst->usage = src.usage;
    dst->flags = TEE_HANDLE_FLAG_INITIALIZED;
    dst->ops = src.ops;
    dst->attrs = src.attrs;
    if (src.pkey && EVP_PKEY_up_ref(src.pkey) == 1)
        dst->pkey = src.pkey;
    return dst;
}

TEE_Result generate_public_key(AttributeMap &, uint32_t, const TEE_Attribute *, uint32_t) {
    return TEE_ERROR_NOT_SUPPORTED;
}

const Attribute *find_attribute(const Object &obj, uint32_t id) {
    auto it = obj.attrs.find(id);
    return it == obj.attrs.end() ? nullptr : &it->second;
}

EVP_PKEY *object_pkey(Object &obj, EVP_PKEY *(*build)(const Object &obj)) {
    if (!obj.pkey)
        obj.pkey = build(obj);
    return obj.pkey;
}

uintptr_t next_handle_number() {
    static std::atomic<uintptr_t> next{0x1000};
    return next += 0x10;
}

TEE_ObjectHandle register_object(std::unique_ptr<Object> obj) {
    uintptr_t n = next_handle_number();
    HandleTable &t = table();
    obj->owner = current_ta();
    std::lock_guard<std::mutex> lock(t.mu);
    t.objects.emplace(n, std::move(obj));
    return reinterpret_cast<TEE_ObjectHandle>(n);
}

Object &object_from_handle(TEE_ObjectHandle handle, const char *fn) {
    HandleTable &t = table();
    std::lock_guard<std::mutex> lock(t.mu);
    auto it = t.objects.find(reinterpret_cast<uintptr_t>(handle));
    if (it == t.objects.end()) {
        std::fprintf(stderr, "%s: object handle %p\n", fn, static_cast<void *>(handle));
        panic(handle ? "an invalid or freed object handle" : "a null object handle");
    }
    return *it->second;
}

void release_object(TEE_ObjectHandle handle) {
    std::unique_ptr<Object> obj;
    {
        HandleTable &t = table();
        std::lock_guard<std::mutex> lock(t.mu);
        auto it = t.objects.find(reinterpret_cast<uintptr_t>(handle));
        if (it == t.objects.end())
            panic("an invalid or freed object handle released");
        obj = std::move(it->second);
        t.objects.erase(it);
    }
    if (obj->persistent())
        close_persistent(*obj);
}

bool charge_handle() {
    void *probe = TEE_Malloc(0, TEE_MALLOC_FILL_ZERO);
    if (!probe)
        return false;
    TEE_Free(probe);
    return true;
}

size_t free_all_objects(const void *owner) {
    std::unordered_map<uintptr_t, std::unique_ptr<Object>> all;
    {
        HandleTable &t = table();
        std::lock_guard<std::mutex> lock(t.mu);
        for (auto it = t.objects.begin(); it != t.objects.end();) {
            if (it->second->owner == owner) {
                all.emplace(it->first, std::move(it->second));
                it = t.objects.erase(it);
            } else {
                ++it;
            }
        }
    }
    for (auto &[n, obj] : all) {
        std::fprintf(stderr, "TA handle leak: %s object of type 0x%08x\n",
                     obj->persistent() ? "persistent" : "transient", obj->type);
        if (obj->persistent())
            close_persistent(*obj);
    }
    return all.size();
}

void handles_instance_ended(const void *owner) {
    // A real TEE reclaims every handle of the instance; so do we, after
    // reporting them.
    size_t leaked = free_all_operations(owner);
    leaked += free_all_objects(owner);
    std::lock_guard<std::mutex> lock(table().mu);
    table().leaked_at_last_destroy = leaked;
}

} // namespace detail

namespace handles {
size_t live_objects() {
    std::lock_guard<std::mutex> lock(detail::table().mu);
    return detail::table().objects.size();
}
size_t live_operations() {
    return detail::live_operation_count();
}
size_t leaked_at_last_destroy() {
    std::lock_guard<std::mutex> lock(detail::table().mu);
    return detail::table().leaked_at_last_destroy;
}
} // namespace handles
} // namespace tee_host

using namespace tee_host::detail;

extern "C" {

TEE_Result TEE_AllocateTransientObject(uint32_t objectType, uint32_t maxObjectSize, TEE_ObjectHandle *object) {
    if (!object)
        panic("TEE_AllocateTransientObject with a null handle pointer");
    *object = TEE_HANDLE_NULL;
    const ObjectTypeOps *ops = find_object_type(objectType);
    if (!ops || !ops->size_ok(maxObjectSize))
        return TEE_ERROR_NOT_SUPPORTED;
    if (!charge_handle())
        return TEE_ERROR_OUT_OF_MEMORY;
    auto obj = std::make_unique<Object>();
    obj->type = objectType;
    obj->max_size = maxObjectSize;
    obj->ops = ops;
    *object = register_object(std::move(obj));
    return TEE_SUCCESS;
}

void TEE_FreeTransientObject(TEE_ObjectHandle object) {
    if (!object)
        return;
    if (object_from_handle(object, __func__).persistent())
        panic("TEE_FreeTransientObject on a persistent object");
    release_object(object);
}

void TEE_ResetTransientObject(TEE_ObjectHandle object) {
    if (!object)
        return;
    Object &obj = object_from_handle(object, __func__);
    if (obj.persistent())
        panic("TEE_ResetTransientObject on a persistent object");
    obj.clear_key();
    obj.key_size = 0;
    obj.usage = 0xFFFFFFFFu;
    obj.flags = 0;
}

TEE_Result TEE_PopulateTransientObject(TEE_ObjectHandle object, const TEE_Attribute *attrs, uint32_t attrCount) {
    Object &obj = transient_uninitialized(object, __func__);
    AttributeMap map = collect_attributes(*obj.ops, attrs, attrCount);
    if (obj.ops->integers)
        minimal_integers(map);
    uint32_t bits = 0;
    TEE_Result res = obj.ops->key_bits(map, &bits);
    if (res != TEE_SUCCESS)
        return res;
    if (bits > obj.max_size)
        return TEE_ERROR_BAD_PARAMETERS;
    obj.attrs = std::move(map);
    obj.key_size = bits;
    obj.flags |= TEE_HANDLE_FLAG_INITIALIZED;
    return TEE_SUCCESS;
}

void TEE_InitRefAttribute(TEE_Attribute *attr, uint32_t attributeID, const void *buffer, uint32_t length) {
    if (!attr)
        panic("TEE_InitRefAttribute with a null attribute");
    if (is_value_attribute(attributeID))
        panic("TEE_InitRefAttribute for a value attribute");
    attr->attributeID = attributeID;
    attr->content.ref.buffer = buffer;
    attr->content.ref.length = length;
}

void TEE_InitValueAttribute(TEE_Attribute *attr, uint32_t attributeID, uint32_t a, uint32_t b) {
    if (!attr)
        panic("TEE_InitValueAttribute with a null attribute");
    if (!is_value_attribute(attributeID))
        panic("TEE_InitValueAttribute for a buffer attribute");
    attr->attributeID = attributeID;
    attr->content.value.a = a;
    attr->content.value.b = b;
}

TEE_Result TEE_GenerateKey(TEE_ObjectHandle object, uint32_t keySize, const TEE_Attribute *params,
                           uint32_t paramCount) {
    Object &obj = transient_uninitialized(object, __func__);
    if (paramCount && !params)
        panic("TEE_GenerateKey with null parameters");
    if (!obj.ops->size_ok(keySize))
        return TEE_ERROR_NOT_SUPPORTED;
    if (keySize > obj.max_size)
        return TEE_ERROR_BAD_PARAMETERS;
    AttributeMap map;
    TEE_Result res = obj.ops->generate(map, keySize, params, paramCount);
    if (res != TEE_SUCCESS)
        return res;
    obj.attrs = std::move(map);
    obj.key_size = keySize;
    obj.flags |= TEE_HANDLE_FLAG_INITIALIZED;
    return TEE_SUCCESS;
}

TEE_Result TEE_GetObjectInfo1(TEE_ObjectHandle object, TEE_ObjectInfo *objectInfo) {
    Object &obj = object_from_handle(object, __func__);
    if (!objectInfo)
        panic("TEE_GetObjectInfo1 with a null info pointer");
    if (obj.persistent()) {
        TEE_Result res = storage_available(obj);
        if (res != TEE_SUCCESS)
            return res;
    }
    fill_info(obj, objectInfo);
    return TEE_SUCCESS;
}

void TEE_GetObjectInfo(TEE_ObjectHandle object, TEE_ObjectInfo *objectInfo) {
    Object &obj = object_from_handle(object, __func__);
    if (!objectInfo)
        panic("TEE_GetObjectInfo with a null info pointer");
    // The old form cannot report an unreachable storage; what the handle
    // already knows is still right.
    fill_info(obj, objectInfo);
}

TEE_Result TEE_GetObjectBufferAttribute(TEE_ObjectHandle object, uint32_t attributeID, void *buffer, uint32_t *size) {
    Object &obj = object_from_handle(object, __func__);
    if (!size)
        panic("TEE_GetObjectBufferAttribute with a null size");
    const Attribute *attr = readable_attribute(obj, attributeID, false);
    if (obj.persistent()) {
        TEE_Result res = storage_available(obj);
        if (res != TEE_SUCCESS)
            return res;
    }
    if (!attr)
        return TEE_ERROR_ITEM_NOT_FOUND;
    uint32_t len = static_cast<uint32_t>(attr->bytes.size());
    if (*size < len) {
        *size = len;
        return TEE_ERROR_SHORT_BUFFER;
    }
    if (len && !buffer)
        panic("TEE_GetObjectBufferAttribute into a null buffer");
    if (len)
        std::memcpy(buffer, attr->bytes.data(), len);
    *size = len;
    return TEE_SUCCESS;
}

TEE_Result TEE_GetObjectValueAttribute(TEE_ObjectHandle object, uint32_t attributeID, uint32_t *a, uint32_t *b) {
    Object &obj = object_from_handle(object, __func__);
    const Attribute *attr = readable_attribute(obj, attributeID, true);
    if (obj.persistent()) {
        TEE_Result res = storage_available(obj);
        if (res != TEE_SUCCESS)
            return res;
    }
    if (!attr)
        return TEE_ERROR_ITEM_NOT_FOUND;
    if (a)
        *a = attr->a;
    if (b)
        *b = attr->b;
    return TEE_SUCCESS;
}

void TEE_CloseObject(TEE_ObjectHandle object) {
    if (!object)
        return;
    release_object(object);
}

} // extern "C"
