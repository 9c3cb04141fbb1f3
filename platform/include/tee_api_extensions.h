/*
 * tee_api_extensions.h - services this TEE offers beyond the published
 * GlobalPlatform Internal Core API. A port to another TEE provides these
 * (or maps them onto its own equivalents) and nothing else.
 */
#ifndef TEE_API_EXTENSIONS_H
#define TEE_API_EXTENSIONS_H

#include "tee_api_types.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Private storage kept in the replay-protected memory block. */
#define TEE_STORAGE_PRIVATE_RPMB 0x80000001u

/* RSAES-OAEP with MGF1 over the same digest as the label hash. */
#define TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA1_EXT 0x60212230u
#define TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA224_EXT 0x60312230u
#define TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA256_EXT 0x60412230u
#define TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA384_EXT 0x60512230u
#define TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA512_EXT 0x60612230u

/* Special values of TEE_ATTR_RSA_PSS_SALT_LENGTH. */
#define TEE_RSA_PSS_SALT_DIGEST_LENGTH 0xFFFFFFFFu
#define TEE_RSA_PSS_SALT_MAX_OR_AUTO 0xFFFFFFFEu

/* TEE_AsymmetricExport selector: DER SubjectPublicKeyInfo of an RSA key. */
#define TEE_EXPORT_RSA_PUBLIC_KEY_DER 5u

/* Trace levels. */
#define TEE_TRACE_ERROR 1
#define TEE_TRACE_INFO 2
#define TEE_TRACE_DEBUG 3
#define TEE_TRACE_FLOW 4

/*
 * TEE_RPMB_MakeFileSystem - prepares RPMB storage. Sets *status to 0 and
 * returns TEE_SUCCESS when storage TEE_STORAGE_PRIVATE_RPMB is usable; any
 * other outcome means it is not.
 */
TEE_Result TEE_RPMB_MakeFileSystem(uint32_t *status);

/*
 * TEE_GetBootSeed - copies the 32-byte seed of this boot into buf. Returns
 * TEE_SUCCESS, or TEE_ERROR_BAD_PARAMETERS unless len is 32. The seed stays
 * the same until the platform restarts.
 */
TEE_Result TEE_GetBootSeed(void *buf, uint32_t len);

/*
 * TEE_AsymmetricExport - with an operation of mode TEE_MODE_EXPORT and
 * selector TEE_EXPORT_RSA_PUBLIC_KEY_DER, writes the DER
 * SubjectPublicKeyInfo of the operation's key. *len is the capacity on
 * entry and the length written (or needed, with TEE_ERROR_SHORT_BUFFER).
 */
TEE_Result TEE_AsymmetricExport(TEE_OperationHandle operation, uint32_t selector, void *out, uint32_t *len);

/*
 * TEE_Trace - writes one trace line "LVL IDENT:func:line: text" (cut to
 * 256 bytes, ending in a newline). The platform filters by level.
 */
void TEE_Trace(int level, const char *ident, const char *func, int line, const char *fmt, ...)
    __attribute__((format(printf, 5, 6)));

/*
 * TEE_MallocAt / TEE_ReallocAt - TEE_Malloc and TEE_Realloc that also
 * record the allocating source file and line, so that the platform can
 * name any allocation still live when the TA instance is destroyed.
 * Same results and ownership as the plain functions.
 */
void *TEE_MallocAt(uint32_t size, uint32_t hint, const char *file, int line);
void *TEE_ReallocAt(void *buffer, uint32_t newSize, const char *file, int line);

#ifdef __cplusplus
}
#endif

#endif /* TEE_API_EXTENSIONS_H */
