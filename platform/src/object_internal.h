/*
 * object_internal.h - the object model shared by the object, storage and
 * crypto sources: what a transient or persistent object handle holds, the
 * per-type rules for populating and generating keys, and the handle table.
 *
 * A key family (RSA, EC) plugs in by providing an ObjectTypeOps per type
 * and listing its lookup in find_object_type() in objects.cpp.
 */
#ifndef OBJECT_INTERNAL_H
#define OBJECT_INTERNAL_H

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <new>
#include <span>
#include <vector>

#include <openssl/crypto.h>
#include <openssl/evp.h>

#include "platform_internal.h"

namespace tee_host::detail {

// An allocator that wipes memory before handing it back, so that key
// bytes never linger in freed heap memory (also across vector growth).
template <class T> struct WipingAllocator {
    using value_type = T;
    WipingAllocator() = default;
    template <class U> WipingAllocator(const WipingAllocator<U> &) {}
    T *allocate(size_t n) { return static_cast<T *>(::operator new(n * sizeof(T))); }
    void deallocate(T *p, size_t n) {
        OPENSSL_cleanse(p, n * sizeof(T));
        ::operator delete(p);
    }
    template <class U> bool operator==(const WipingAllocator<U> &) const { return true; }
};

using SecretBytes = std::vector<uint8_t, WipingAllocator<uint8_t>>;

// One attribute: bytes for a buffer attribute, (a, b) for a value one
// (TEE_ATTR_FLAG_VALUE set in its ID).
struct Attribute {
    SecretBytes bytes;
    uint32_t a = 0;
    uint32_t b = 0;
};
using AttributeMap = std::map<uint32_t, Attribute>;

// is_value_attribute / is_public_attribute - what an attribute ID's flag
// bits say: (a, b) rather than bytes; readable even when not extractable.
inline bool is_value_attribute(uint32_t id) {
    return (id & TEE_ATTR_FLAG_VALUE) != 0;
}
inline bool is_public_attribute(uint32_t id) {
    return (id & TEE_ATTR_FLAG_PUBLIC) != 0;
}

// What the object layer needs to know about one object type.
struct ObjectTypeOps {
    uint32_t type;
    // Attributes TEE_PopulateTransientObject insists on / also accepts.
    // Anything else is a TA bug and panics.
    std::span<const uint32_t> required;
    std::span<const uint32_t> optional;
    // size_ok - whether a key size in bits is one this type can have; also
    // decides which maxObjectSize values TEE_AllocateTransientObject takes.
    bool (*size_ok)(uint32_t bits);
    // key_bits - checks populated attributes for consistency and gives the
    // key size in bits. TEE_SUCCESS, or TEE_ERROR_BAD_PARAMETERS for a bad
    // value. Called before the object changes.
    TEE_Result (*key_bits)(const AttributeMap &attrs, uint32_t *bits);
    // generate - fills attrs with a fresh key of `bits` bits (size_ok and
    // the object's maximum already checked). params are TEE_GenerateKey's.
    // TEE_SUCCESS; TEE_ERROR_BAD_PARAMETERS for bad params. On failure attrs
    // may hold partial results, which the caller discards (wiped).
    TEE_Result (*generate)(AttributeMap &attrs, uint32_t bits, const TEE_Attribute *params, uint32_t count);
    // integers - the buffer attributes are unsigned big-endian integers:
    // the object keeps (and reads back) each in its shortest form, leading
    // zero bytes stripped, whatever form the caller gave.
    bool integers = false;
};

// generate_public_key - ObjectTypeOps::generate of the public-key types:
// TEE_ERROR_NOT_SUPPORTED, since GP generates key pairs only.
TEE_Result generate_public_key(AttributeMap &attrs, uint32_t bits, const TEE_Attribute *params, uint32_t count);

// find_type - the entry of `types` for an object type, or null.
inline const ObjectTypeOps *find_type(std::span<const ObjectTypeOps> types, uint32_t type) {
    for (const ObjectTypeOps &t : types)
        if (t.type == type)
            return &t;
    return nullptr;
}

// find_object_type - the rules for an object type, or null when the
// platform does not support it.
const ObjectTypeOps *find_object_type(uint32_t type);
// secret_object_type - AES, HMAC and generic-secret types (objects.cpp).
const ObjectTypeOps *secret_object_type(uint32_t type);

struct StoredObject; // storage.cpp: the on-disk object behind persistent handles

// The state behind a TEE_ObjectHandle, and also the operation's private
// copy of its key.
struct Object {
    const void *owner = nullptr; // the TA whose call made it; reclaimed with that instance
    uint32_t type = 0;
    uint32_t max_size = 0; // bits
    uint32_t key_size = 0; // bits; 0 while uninitialized
    uint32_t usage = 0xFFFFFFFFu;
    uint32_t flags = 0; // TEE_HANDLE_FLAG_* plus, when persistent, the TEE_DATA_FLAG_* it was opened with
    AttributeMap attrs;
    const ObjectTypeOps *ops = nullptr; // null for data objects

    // The key in a backend's prepared form (an EVP_PKEY for RSA or EC),
    // built on first use by object_pkey() and dropped whenever attrs change.
    EVP_PKEY *pkey = nullptr;

    // Persistent handles only: the object in storage and this handle's
    // data position.
    std::shared_ptr<StoredObject> stored;
    uint32_t storage_id = 0;
    uint32_t position = 0;

    Object() = default;
    Object(const Object &) = delete;
    Object &operator=(const Object &) = delete;
    ~Object() { clear_key(); }

    bool persistent() const { return (flags & TEE_HANDLE_FLAG_PERSISTENT) != 0; }
    bool initialized() const { return (flags & TEE_HANDLE_FLAG_INITIALIZED) != 0; }

    // clear_key - wipes the attributes and drops the prepared key.
    void clear_key();
};

// copy_key - a standalone transient copy of src's type, sizes, usage and
// attributes, sharing its prepared key. The caller owns the copy.
std::unique_ptr<Object> copy_key(const Object &src);

// find_attribute - the attribute with that ID, or null.
const Attribute *find_attribute(const Object &obj, uint32_t id);

// object_pkey - the object's key as an EVP_PKEY, built by `build` the first
// time and cached on the object until its attributes change. Null when
// build fails. The object keeps ownership.
EVP_PKEY *object_pkey(Object &obj, EVP_PKEY *(*build)(const Object &obj));

// register_object - takes ownership of obj and gives its new handle.
// object_from_handle - the object behind a handle, still owned by the
// table; panics (naming fn) on a null, unknown or freed handle.
// release_object - unregisters and destroys, detaching a persistent
// handle from its storage first; panics on an unknown handle.
TEE_ObjectHandle register_object(std::unique_ptr<Object> obj);
Object &object_from_handle(TEE_ObjectHandle handle, const char *fn);
void release_object(TEE_ObjectHandle handle);

// next_handle_number - a fresh handle value. Object and operation handles
// share one never-reused number space, so that one kind of handle passed
// for the other, or a freed one, is never found.
uintptr_t next_handle_number();

// charge_handle - counts a new handle against the TA heap's allocation
// attempts, so that injected heap failures reach handle allocation as
// they would on a TEE that takes handles from the TA's memory. false when
// the allocation is to fail.
bool charge_handle();

// Storage hooks for the object and operation layers (storage.cpp).
// storage_available - TEE_SUCCESS, or TEE_ERROR_STORAGE_NOT_AVAILABLE while
// the object's storage cannot be reached.
TEE_Result storage_available(const Object &obj);
// persistent_data_size - the data stream's current length.
uint32_t persistent_data_size(const Object &obj);
// close_persistent - detaches a persistent handle from its stored object
// before the handle is destroyed.
void close_persistent(Object &obj);

// live_operation_count - operation handles not freed yet (crypto_operation.cpp).
size_t live_operation_count();
// free_all_operations / free_all_objects - report each live handle on
// stderr, free them all and return how many there were.
size_t free_all_operations(const void *owner);
size_t free_all_objects(const void *owner);

} // namespace tee_host::detail

#endif
