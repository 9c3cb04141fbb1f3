/*
 * crypto_operation.cpp - operation handles: allocation routed to a family
 * by operation class, the operation's own copy of its key, the state
 * machine every family shares, copy, reset and info; and the asymmetric
 * entry points, which route to AsymmetricEngine subclasses.
 */
#include <cstdio>
#include <cstring>
#include <mutex>
#include <unordered_map>

#include "operation_internal.h"
#include "pkey_internal.h"

namespace tee_host::detail {
namespace {

struct OperationTable {
    std::mutex mu;
    std::unordered_map<uintptr_t, std::unique_ptr<Operation>> ops;
};

// Never destroyed, like the object table (objects.cpp).
OperationTable &table() {
    static OperationTable *t = new OperationTable;
    return *t;
}

// The operation class sits in the top nibble of every GP algorithm identifier.
uint32_t class_of(uint32_t algorithm) {
    return algorithm >> 28;
}

TEE_Result setup_by_class(Operation &op) {
    switch (op.info.operationClass) {
    case TEE_OPERATION_DIGEST:
        return digest_setup(op);
    case TEE_OPERATION_MAC:
        return mac_setup(op);
    case TEE_OPERATION_CIPHER:
        return cipher_setup(op);
    case TEE_OPERATION_AE:
        return ae_setup(op);
    case TEE_OPERATION_ASYMMETRIC_CIPHER:
    case TEE_OPERATION_ASYMMETRIC_SIGNATURE:
    case TEE_OPERATION_KEY_DERIVATION:
        // The RSA and EC families go here, chosen by the algorithm's low
        // byte (0x30 RSA, 0x41 ECDSA); their engines derive from
        // AsymmetricEngine. TEE_MODE_EXPORT arrives with an RSA
        // algorithm's class.
        switch (op.info.algorithm & 0xFF) {
        case 0x30:
            return rsa_setup(op);
        case 0x41:
            return ec_setup(op);
        default:
            return TEE_ERROR_NOT_SUPPORTED;
        }
    default:
        return TEE_ERROR_NOT_SUPPORTED;
    }
}

Operation &any_operation(TEE_OperationHandle handle, const char *fn) {
    OperationTable &t = table();
    std::lock_guard<std::mutex> lock(t.mu);
    auto it = t.ops.find(reinterpret_cast<uintptr_t>(handle));
    if (it == t.ops.end()) {
        std::fprintf(stderr, "%s: operation handle %p\n", fn, static_cast<void *>(handle));
        panic(handle ? "an invalid or freed operation handle" : "a null operation handle");
    }
    return *it->second;
}

bool is_digest(const Operation &op) {
    return op.info.operationClass == TEE_OPERATION_DIGEST;
}

// Back to the initial state with the key kept; digests are ready at once.
void to_initial(Operation &op) {
    op.engine->reset();
    op.active = false;
    if (!is_digest(op))
        op.info.handleState &= ~TEE_HANDLE_FLAG_INITIALIZED;
}

AsymmetricEngine &asymmetric(Operation &op) {
    return static_cast<AsymmetricEngine &>(*op.engine);
}

} // namespace

Operation &operation_from_handle(TEE_OperationHandle handle, uint32_t cls, const char *fn) {
    Operation &op = any_operation(handle, fn);
    if (op.info.operationClass != cls) {
        std::fprintf(stderr, "%s: operation of class %u, algorithm 0x%08x\n", fn, op.info.operationClass,
                     op.info.algorithm);
        panic("an operation of the wrong class");
    }
    return op;
}

void require_mode(const Operation &op, uint32_t mode, const char *fn) {
    if (op.info.mode != mode) {
        std::fprintf(stderr, "%s: operation mode %u\n", fn, op.info.mode);
        panic("an operation of the wrong mode");
    }
}

void require_key(const Operation &op, const char *fn) {
    if (!(op.info.handleState & TEE_HANDLE_FLAG_KEY_SET)) {
        std::fprintf(stderr, "%s\n", fn);
        panic("an operation used before its key was set");
    }
}

void require_initialized(const Operation &op, const char *fn) {
    if (!(op.info.handleState & TEE_HANDLE_FLAG_INITIALIZED)) {
        std::fprintf(stderr, "%s\n", fn);
        panic("an operation used before it was initialized");
    }
}

void begin(Operation &op) {
    op.info.handleState |= TEE_HANDLE_FLAG_INITIALIZED;
    op.active = true;
}

void finish(Operation &op) {
    to_initial(op);
}

const SecretBytes &secret_value(const Operation &op) {
    const Attribute *a = op.key ? find_attribute(*op.key, TEE_ATTR_SECRET_VALUE) : nullptr;
    if (!a)
        panic("an operation key without a secret value");
    return a->bytes;
}

bool output_fits(uint32_t *len, size_t needed, const char *fn) {
    if (!len) {
        std::fprintf(stderr, "%s\n", fn);
        panic("a null output length");
    }
    if (needed > 0xFFFFFFFFu)
        panic("an output larger than 4 GiB");
    if (*len < needed) {
        *len = static_cast<uint32_t>(needed);
        return false;
    }
    return true;
}

InputView::InputView(const void *src, size_t len, const void *dst, size_t dst_len, const char *fn, bool in_place)
    : src_(static_cast<const uint8_t *>(src)), len_(len) {
    if (len && !src) {
        std::fprintf(stderr, "%s\n", fn);
        panic("a null input buffer");
    }
    auto s = reinterpret_cast<uintptr_t>(src);
    auto d = reinterpret_cast<uintptr_t>(dst);
    if (len && dst && dst_len && s < d + dst_len && d < s + len && !(in_place && s == d))
        copy_.assign(src_, src_ + len);
}

bool cipher_update(EVP_CIPHER_CTX *ctx, uint8_t *out, const uint8_t *in, size_t len, size_t *written) {
    constexpr size_t kChunk = size_t{1} << 30;
    *written = 0;
    while (len) {
        size_t n = len < kChunk ? len : kChunk;
        int outl = 0;
        if (EVP_CipherUpdate(ctx, out ? out + *written : nullptr, &outl, in, static_cast<int>(n)) != 1 || outl < 0)
            return false;
        if (out)
            *written += static_cast<size_t>(outl);
        in += n;
        len -= n;
    }
    return true;
}

TEE_Result AsymmetricEngine::encrypt(Operation &, const TEE_Attribute *, uint32_t, const uint8_t *, size_t, uint8_t *,
                                     uint32_t *) {
    panic("TEE_AsymmetricEncrypt not offered by this algorithm");
}
TEE_Result AsymmetricEngine::decrypt(Operation &, const TEE_Attribute *, uint32_t, const uint8_t *, size_t, uint8_t *,
                                     uint32_t *) {
    panic("TEE_AsymmetricDecrypt not offered by this algorithm");
}
TEE_Result AsymmetricEngine::sign_digest(Operation &, const TEE_Attribute *, uint32_t, const uint8_t *, size_t,
                                         uint8_t *, uint32_t *) {
    panic("TEE_AsymmetricSignDigest not offered by this algorithm");
}
TEE_Result AsymmetricEngine::verify_digest(Operation &, const TEE_Attribute *, uint32_t, const uint8_t *, size_t,
                                           const uint8_t *, size_t) {
    panic("TEE_AsymmetricVerifyDigest not offered by this algorithm");
}
TEE_Result AsymmetricEngine::export_key(Operation &, uint32_t, uint8_t *, uint32_t *) {
    panic("TEE_AsymmetricExport not offered by this algorithm");
}

size_t live_operation_count() {
    std::lock_guard<std::mutex> lock(table().mu);
    return table().ops.size();
}

size_t free_all_operations(const void *owner) {
    std::unordered_map<uintptr_t, std::unique_ptr<Operation>> all;
    {
        std::lock_guard<std::mutex> lock(table().mu);
        auto &ops = table().ops;
        for (auto it = ops.begin(); it != ops.end();) {
            if (it->second->owner == owner) {
                all.emplace(it->first, std::move(it->second));
                it = ops.erase(it);
            } else {
                ++it;
            }
        }
    }
    for (auto &[n, op] : all)
        std::fprintf(stderr, "TA handle leak: operation for algorithm 0x%08x\n", op->info.algorithm);
    return all.size();
}

} // namespace tee_host::detail

using namespace tee_host::detail;

namespace {

// The asymmetric entry points share their checks.
Operation &asymmetric_operation(TEE_OperationHandle handle, uint32_t cls, uint32_t mode, const TEE_Attribute *params,
                                uint32_t count, const char *fn) {
    Operation &op = operation_from_handle(handle, cls, fn);
    require_mode(op, mode, fn);
    require_key(op, fn);
    if (count && !params)
        panic("asymmetric operation with null parameters");
    return op;
}

} // namespace

extern "C" {

TEE_Result TEE_AllocateOperation(TEE_OperationHandle *operation, uint32_t algorithm, uint32_t mode,
                                 uint32_t maxKeySize) {
    if (!operation)
        panic("TEE_AllocateOperation with a null handle pointer");
    *operation = TEE_HANDLE_NULL;
    auto op = std::make_unique<Operation>();
    op->info.algorithm = algorithm;
    op->info.operationClass = class_of(algorithm);
    op->info.mode = mode;
    op->info.maxKeySize = maxKeySize;
    TEE_Result res = setup_by_class(*op);
    if (res != TEE_SUCCESS)
        return res;
    if (!charge_handle())
        return TEE_ERROR_OUT_OF_MEMORY;
    uintptr_t n = next_handle_number();
    {
        std::lock_guard<std::mutex> lock(table().mu);
        op->owner = current_ta();
        table().ops.emplace(n, std::move(op));
    }
    *operation = reinterpret_cast<TEE_OperationHandle>(n);
    return TEE_SUCCESS;
}

void TEE_FreeOperation(TEE_OperationHandle operation) {
    if (!operation)
        return;
    std::unique_ptr<Operation> op;
    {
        std::lock_guard<std::mutex> lock(table().mu);
        auto it = table().ops.find(reinterpret_cast<uintptr_t>(operation));
        if (it == table().ops.end())
            panic("TEE_FreeOperation of an invalid or freed operation handle");
        op = std::move(it->second);
        table().ops.erase(it);
    }
}

void TEE_GetOperationInfo(TEE_OperationHandle operation, TEE_OperationInfo *operationInfo) {
    Operation &op = any_operation(operation, __func__);
    if (!operationInfo)
        panic("TEE_GetOperationInfo with a null info pointer");
    *operationInfo = op.info;
}

void TEE_ResetOperation(TEE_OperationHandle operation) {
    Operation &op = any_operation(operation, __func__);
    require_key(op, __func__);
    to_initial(op);
}

TEE_Result TEE_SetOperationKey(TEE_OperationHandle operation, TEE_ObjectHandle key) {
    Operation &op = any_operation(operation, __func__);
    if (is_digest(op))
        panic("TEE_SetOperationKey on a digest operation");
    if (op.active)
        panic("TEE_SetOperationKey on an active operation");
    if (!key) {
        op.engine->rekey();
        op.key.reset();
        op.info.keySize = 0;
        op.info.handleState &= ~(TEE_HANDLE_FLAG_KEY_SET | TEE_HANDLE_FLAG_INITIALIZED);
        return TEE_SUCCESS;
    }
    Object &obj = object_from_handle(key, __func__);
    if (!obj.initialized())
        panic("TEE_SetOperationKey with an uninitialized key object");
    if (!op.engine->accepts_key(obj.type))
        panic("TEE_SetOperationKey with a key of the wrong type");
    if (!op.engine->accepts_key_size(obj.key_size))
        panic("TEE_SetOperationKey with a key of the wrong size for the algorithm");
    if (obj.key_size > op.info.maxKeySize)
        panic("TEE_SetOperationKey with a key larger than the operation's maximum");
    if ((obj.usage & op.info.requiredKeyUsage) != op.info.requiredKeyUsage)
        panic("TEE_SetOperationKey with a key whose usage forbids this operation");
    if (obj.persistent()) {
        TEE_Result res = storage_available(obj);
        if (res != TEE_SUCCESS)
            return res;
    }
    op.engine->rekey();
    op.key = copy_key(obj);
    op.info.keySize = obj.key_size;
    op.info.handleState |= TEE_HANDLE_FLAG_KEY_SET;
    op.info.handleState &= ~TEE_HANDLE_FLAG_INITIALIZED;
    return TEE_SUCCESS;
}

void TEE_CopyOperation(TEE_OperationHandle dstOperation, TEE_OperationHandle srcOperation) {
    Operation &dst = any_operation(dstOperation, __func__);
    const Operation &src = any_operation(srcOperation, __func__);
    if (&dst == &src)
        return;
    if (dst.info.algorithm != src.info.algorithm || dst.info.mode != src.info.mode)
        panic("TEE_CopyOperation between operations of different algorithm or mode");
    if (src.info.keySize > dst.info.maxKeySize)
        panic("TEE_CopyOperation of a key larger than the destination's maximum");
    std::unique_ptr<Engine> engine = src.engine->clone();
    dst.key = src.key ? copy_key(*src.key) : nullptr;
    dst.engine = std::move(engine);
    uint32_t max = dst.info.maxKeySize;
    dst.info = src.info;
    dst.info.maxKeySize = max;
    dst.active = src.active;
}

TEE_Result TEE_AsymmetricEncrypt(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                 const void *srcData, uint32_t srcLen, void *destData, uint32_t *destLen) {
    Operation &op = asymmetric_operation(operation, TEE_OPERATION_ASYMMETRIC_CIPHER, TEE_MODE_ENCRYPT, params,
                                         paramCount, __func__);
    InputView in(srcData, srcLen, destData, destLen ? *destLen : 0, __func__);
    if (!destLen)
        panic("TEE_AsymmetricEncrypt with a null output length");
    return asymmetric(op).encrypt(op, params, paramCount, in.data(), in.size(), static_cast<uint8_t *>(destData),
                                  destLen);
}

TEE_Result TEE_AsymmetricDecrypt(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                 const void *srcData, uint32_t srcLen, void *destData, uint32_t *destLen) {
    Operation &op = asymmetric_operation(operation, TEE_OPERATION_ASYMMETRIC_CIPHER, TEE_MODE_DECRYPT, params,
                                         paramCount, __func__);
    InputView in(srcData, srcLen, destData, destLen ? *destLen : 0, __func__);
    if (!destLen)
        panic("TEE_AsymmetricDecrypt with a null output length");
    return asymmetric(op).decrypt(op, params, paramCount, in.data(), in.size(), static_cast<uint8_t *>(destData),
                                  destLen);
}

TEE_Result TEE_AsymmetricSignDigest(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                    const void *digest, uint32_t digestLen, void *signature, uint32_t *signatureLen) {
    Operation &op = asymmetric_operation(operation, TEE_OPERATION_ASYMMETRIC_SIGNATURE, TEE_MODE_SIGN, params,
                                         paramCount, __func__);
    InputView in(digest, digestLen, signature, signatureLen ? *signatureLen : 0, __func__);
    if (!signatureLen)
        panic("TEE_AsymmetricSignDigest with a null signature length");
    return asymmetric(op).sign_digest(op, params, paramCount, in.data(), in.size(), static_cast<uint8_t *>(signature),
                                      signatureLen);
}

TEE_Result TEE_AsymmetricVerifyDigest(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                      const void *digest, uint32_t digestLen, const void *signature,
                                      uint32_t signatureLen) {
    Operation &op = asymmetric_operation(operation, TEE_OPERATION_ASYMMETRIC_SIGNATURE, TEE_MODE_VERIFY, params,
                                         paramCount, __func__);
    if ((digestLen && !digest) || (signatureLen && !signature))
        panic("TEE_AsymmetricVerifyDigest with a null buffer");
    return asymmetric(op).verify_digest(op, params, paramCount, static_cast<const uint8_t *>(digest), digestLen,
                                        static_cast<const uint8_t *>(signature), signatureLen);
}

TEE_Result TEE_AsymmetricExport(TEE_OperationHandle operation, uint32_t selector, void *out, uint32_t *len) {
    Operation &op = any_operation(operation, __func__);
    if (op.info.operationClass != TEE_OPERATION_ASYMMETRIC_CIPHER &&
        op.info.operationClass != TEE_OPERATION_ASYMMETRIC_SIGNATURE)
        panic("TEE_AsymmetricExport on a non-asymmetric operation");
    require_mode(op, TEE_MODE_EXPORT, __func__);
    require_key(op, __func__);
    if (!len)
        panic("TEE_AsymmetricExport with a null length");
    return asymmetric(op).export_key(op, selector, static_cast<uint8_t *>(out), len);
}

} // extern "C"
