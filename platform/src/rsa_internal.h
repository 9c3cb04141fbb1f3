/*
 * rsa_internal.h - how the RSA family (crypto_rsa.cpp) plugs into the
 * object layer (objects.cpp) and the operation layer (crypto_operation.cpp).
 */
#ifndef RSA_INTERNAL_H
#define RSA_INTERNAL_H

#include <cstdint>

#include "object_internal.h"
#include "operation_internal.h"

namespace tee_host::detail {

// rsa_object_type - the rules for TEE_TYPE_RSA_KEYPAIR and
// TEE_TYPE_RSA_PUBLIC_KEY; null for any other type.
const ObjectTypeOps *rsa_object_type(uint32_t type);

// rsa_minimal_integers - for an RSA object type, strips the leading zero
// bytes of every component in attrs, so that the object holds (and reads
// back) each integer in its shortest unsigned big-endian form whatever form
// the caller gave. Other types are left alone.
void rsa_minimal_integers(uint32_t type, AttributeMap &attrs);

// rsa_setup - the RSA part of TEE_AllocateOperation (see digest_setup).
// TEE_SUCCESS with digestLength, requiredKeyUsage and the engine set;
// TEE_ERROR_NOT_SUPPORTED for an algorithm, mode or maxKeySize it does not do.
TEE_Result rsa_setup(Operation &op);

} // namespace tee_host::detail

#endif
