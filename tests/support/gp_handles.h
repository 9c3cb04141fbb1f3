/*
 * gp_handles.h - GP object and operation handles for the suites that drive
 * the platform's crypto API directly, freed at scope exit so that a failed
 * assertion leaks no handle; and the small byte helpers those suites share.
 */
#ifndef GP_HANDLES_H
#define GP_HANDLES_H

#include <cstring>
#include <random>
#include <utility>
#include <vector>

#include "ta_fixture.h"

inline uint32_t u32(size_t n) {
    return static_cast<uint32_t>(n);
}

inline Bytes text(const char *s) {
    return Bytes(s, s + std::strlen(s));
}

inline Bytes random_bytes(std::mt19937 &rng, size_t n) {
    Bytes b(n);
    for (auto &x : b)
        x = static_cast<uint8_t>(rng());
    return b;
}

inline TEE_Attribute ref_attr(uint32_t id, const Bytes &b) {
    TEE_Attribute a{};
    TEE_InitRefAttribute(&a, id, b.data(), u32(b.size()));
    return a;
}

inline TEE_Attribute value_attr(uint32_t id, uint32_t a, uint32_t b = 0) {
    TEE_Attribute attr{};
    TEE_InitValueAttribute(&attr, id, a, b);
    return attr;
}

// Buffer attributes by id, each holding its bytes.
using Attrs = std::vector<std::pair<uint32_t, Bytes>>;

// A transient object of a type and maximum size, populated when attributes are given.
struct Obj {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    Obj(uint32_t type, uint32_t max_bits) {
        EXPECT_EQ(TEE_AllocateTransientObject(type, max_bits, &h), TEE_SUCCESS) << std::hex << type;
    }
    Obj(uint32_t type, uint32_t max_bits, const Attrs &attrs) : Obj(type, max_bits) {
        EXPECT_EQ(populate(attrs), TEE_SUCCESS);
    }
    ~Obj() { TEE_FreeTransientObject(h); }
    Obj(const Obj &) = delete;
    Obj &operator=(const Obj &) = delete;
    operator TEE_ObjectHandle() const { return h; }

    TEE_Result populate(const std::vector<TEE_Attribute> &attrs) {
        return TEE_PopulateTransientObject(h, attrs.data(), u32(attrs.size()));
    }
    TEE_Result populate(const Attrs &attrs) {
        std::vector<TEE_Attribute> refs;
        for (const auto &[id, bytes] : attrs)
            refs.push_back(ref_attr(id, bytes));
        return populate(refs);
    }
    // buffer - a buffer attribute (at most 1 KiB) read back whole.
    Bytes buffer(uint32_t id) const {
        Bytes out(1024);
        uint32_t len = u32(out.size());
        EXPECT_EQ(TEE_GetObjectBufferAttribute(h, id, out.data(), &len), TEE_SUCCESS) << std::hex << id;
        out.resize(len);
        return out;
    }
    TEE_ObjectInfo info() const {
        TEE_ObjectInfo i{};
        EXPECT_EQ(TEE_GetObjectInfo1(h, &i), TEE_SUCCESS);
        return i;
    }
};

// A secret-key object (AES, HMAC, generic secret) holding `secret`, with
// a maximum of its own size unless max_bits says otherwise.
struct Key : Obj {
    Key(uint32_t type, const Bytes &secret, uint32_t max_bits = 0)
        : Obj(type, max_bits ? max_bits : u32(secret.size() * 8)) {
        EXPECT_EQ(populate({ref_attr(TEE_ATTR_SECRET_VALUE, secret)}), TEE_SUCCESS);
    }
};

// An operation, keyed when a key is given.
struct Op {
    TEE_OperationHandle h = TEE_HANDLE_NULL;
    Op() = default;
    Op(uint32_t alg, uint32_t mode, uint32_t max_bits, TEE_ObjectHandle key = TEE_HANDLE_NULL) {
        EXPECT_EQ(TEE_AllocateOperation(&h, alg, mode, max_bits), TEE_SUCCESS) << std::hex << alg;
        if (key) {
            EXPECT_EQ(TEE_SetOperationKey(h, key), TEE_SUCCESS);
        }
    }
    ~Op() { TEE_FreeOperation(h); }
    Op(const Op &) = delete;
    Op &operator=(const Op &) = delete;
    operator TEE_OperationHandle() const { return h; }

    TEE_OperationInfo info() const {
        TEE_OperationInfo i{};
        TEE_GetOperationInfo(h, &i);
        return i;
    }
    uint32_t handle_state() const { return info().handleState; }
};

#endif
