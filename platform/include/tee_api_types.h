/*
 * tee_api_types.h - GlobalPlatform TEE Internal Core API types.
 *
 * The platform's own rendering of the published GP types. Sizes of memory
 * references are 32-bit, as every length of the TA's wire formats is.
 */
#ifndef TEE_API_TYPES_H
#define TEE_API_TYPES_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef uint32_t TEE_Result;

typedef struct {
    uint32_t timeLow;
    uint16_t timeMid;
    uint16_t timeHiAndVersion;
    uint8_t clockSeqAndNode[8];
} TEE_UUID;

/* 20 bytes: login kind followed by the client UUID. */
typedef struct {
    uint32_t login;
    TEE_UUID uuid;
} TEE_Identity;

typedef union {
    struct {
        void *buffer;
        uint32_t size;
    } memref;
    struct {
        uint32_t a;
        uint32_t b;
    } value;
} TEE_Param;

typedef struct {
    uint32_t seconds;
    uint32_t millis;
} TEE_Time;

typedef struct {
    uint32_t attributeID;
    union {
        struct {
            const void *buffer;
            uint32_t length;
        } ref;
        struct {
            uint32_t a;
            uint32_t b;
        } value;
    } content;
} TEE_Attribute;

typedef struct {
    uint32_t objectType;
    uint32_t objectSize;
    uint32_t maxObjectSize;
    uint32_t objectUsage;
    uint32_t dataSize;
    uint32_t dataPosition;
    uint32_t handleFlags;
} TEE_ObjectInfo;

typedef enum { TEE_DATA_SEEK_SET = 0, TEE_DATA_SEEK_CUR = 1, TEE_DATA_SEEK_END = 2 } TEE_Whence;

typedef enum {
    TEE_MODE_ENCRYPT = 0,
    TEE_MODE_DECRYPT = 1,
    TEE_MODE_SIGN = 2,
    TEE_MODE_VERIFY = 3,
    TEE_MODE_MAC = 4,
    TEE_MODE_DIGEST = 5,
    TEE_MODE_DERIVE = 6,
    /* Platform extension: public-key export from an RSA key-pair object. */
    TEE_MODE_EXPORT = 8
} TEE_OperationMode;

typedef struct {
    uint32_t algorithm;
    uint32_t operationClass;
    uint32_t mode;
    uint32_t digestLength;
    uint32_t maxKeySize;
    uint32_t keySize;
    uint32_t requiredKeyUsage;
    uint32_t handleState;
} TEE_OperationInfo;

typedef struct __TEE_ObjectHandle *TEE_ObjectHandle;
typedef struct __TEE_OperationHandle *TEE_OperationHandle;
typedef struct __TEE_ObjectEnumHandle *TEE_ObjectEnumHandle;
typedef struct __TEE_PropSetHandle *TEE_PropSetHandle;
typedef struct __TEE_TASessionHandle *TEE_TASessionHandle;

#ifdef __cplusplus
}
#endif

#endif /* TEE_API_TYPES_H */
