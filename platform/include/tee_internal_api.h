/*
 * tee_internal_api.h - GlobalPlatform TEE Internal Core API functions.
 *
 * The TA includes this header (and tee_api_extensions.h) and nothing else
 * of the platform. Functions panic on misuse (bad handle, wrong operation
 * class or state) and return error codes for bad data, as a real TEE does.
 */
#ifndef TEE_INTERNAL_API_H
#define TEE_INTERNAL_API_H

#include "tee_api_defines.h"
#include "tee_api_types.h"

#ifdef __cplusplus
extern "C" {
#endif

/* TA entry points, implemented by the TA. */
TEE_Result TA_CreateEntryPoint(void);
void TA_DestroyEntryPoint(void);
TEE_Result TA_OpenSessionEntryPoint(uint32_t paramTypes, TEE_Param params[4], void **sessionContext);
void TA_CloseSessionEntryPoint(void *sessionContext);
TEE_Result TA_InvokeCommandEntryPoint(void *sessionContext, uint32_t commandID, uint32_t paramTypes,
                                      TEE_Param params[4]);

/* Panic */
void TEE_Panic(TEE_Result panicCode) __attribute__((noreturn));

/* Properties */
TEE_Result TEE_GetPropertyAsString(TEE_PropSetHandle propsetOrEnumerator, const char *name, char *valueBuffer,
                                   uint32_t *valueBufferLen);
TEE_Result TEE_GetPropertyAsBool(TEE_PropSetHandle propsetOrEnumerator, const char *name, bool *value);
TEE_Result TEE_GetPropertyAsU32(TEE_PropSetHandle propsetOrEnumerator, const char *name, uint32_t *value);
TEE_Result TEE_GetPropertyAsBinaryBlock(TEE_PropSetHandle propsetOrEnumerator, const char *name, void *valueBuffer,
                                        uint32_t *valueBufferLen);
TEE_Result TEE_GetPropertyAsUUID(TEE_PropSetHandle propsetOrEnumerator, const char *name, TEE_UUID *value);
TEE_Result TEE_GetPropertyAsIdentity(TEE_PropSetHandle propsetOrEnumerator, const char *name, TEE_Identity *value);

/* Memory */
void *TEE_Malloc(uint32_t size, uint32_t hint);
void *TEE_Realloc(void *buffer, uint32_t newSize);
void TEE_Free(void *buffer);
void TEE_MemMove(void *dest, const void *src, uint32_t size);
int32_t TEE_MemCompare(const void *buffer1, const void *buffer2, uint32_t size);
void TEE_MemFill(void *buffer, uint32_t x, uint32_t size);

/* Time */
void TEE_GetSystemTime(TEE_Time *time);
TEE_Result TEE_Wait(uint32_t timeout);
void TEE_GetREETime(TEE_Time *time);

/* Random */
void TEE_GenerateRandom(void *randomBuffer, uint32_t randomBufferLen);

/* TA-to-TA sessions */
TEE_Result TEE_OpenTASession(const TEE_UUID *destination, uint32_t cancellationRequestTimeout, uint32_t paramTypes,
                             TEE_Param params[4], TEE_TASessionHandle *session, uint32_t *returnOrigin);
void TEE_CloseTASession(TEE_TASessionHandle session);
TEE_Result TEE_InvokeTACommand(TEE_TASessionHandle session, uint32_t cancellationRequestTimeout, uint32_t commandID,
                               uint32_t paramTypes, TEE_Param params[4], uint32_t *returnOrigin);

/* Transient and generic objects */
void TEE_GetObjectInfo(TEE_ObjectHandle object, TEE_ObjectInfo *objectInfo);
TEE_Result TEE_GetObjectInfo1(TEE_ObjectHandle object, TEE_ObjectInfo *objectInfo);
TEE_Result TEE_GetObjectBufferAttribute(TEE_ObjectHandle object, uint32_t attributeID, void *buffer, uint32_t *size);
TEE_Result TEE_GetObjectValueAttribute(TEE_ObjectHandle object, uint32_t attributeID, uint32_t *a, uint32_t *b);
void TEE_CloseObject(TEE_ObjectHandle object);
TEE_Result TEE_AllocateTransientObject(uint32_t objectType, uint32_t maxObjectSize, TEE_ObjectHandle *object);
void TEE_FreeTransientObject(TEE_ObjectHandle object);
void TEE_ResetTransientObject(TEE_ObjectHandle object);
TEE_Result TEE_PopulateTransientObject(TEE_ObjectHandle object, const TEE_Attribute *attrs, uint32_t attrCount);
void TEE_InitRefAttribute(TEE_Attribute *attr, uint32_t attributeID, const void *buffer, uint32_t length);
void TEE_InitValueAttribute(TEE_Attribute *attr, uint32_t attributeID, uint32_t a, uint32_t b);
TEE_Result TEE_GenerateKey(TEE_ObjectHandle object, uint32_t keySize, const TEE_Attribute *params, uint32_t paramCount);

/* Persistent objects and data streams */
TEE_Result TEE_OpenPersistentObject(uint32_t storageID, const void *objectID, uint32_t objectIDLen, uint32_t flags,
                                    TEE_ObjectHandle *object);
TEE_Result TEE_CreatePersistentObject(uint32_t storageID, const void *objectID, uint32_t objectIDLen, uint32_t flags,
                                      TEE_ObjectHandle attributes, const void *initialData, uint32_t initialDataLen,
                                      TEE_ObjectHandle *object);
void TEE_CloseAndDeletePersistentObject(TEE_ObjectHandle object);
TEE_Result TEE_CloseAndDeletePersistentObject1(TEE_ObjectHandle object);
TEE_Result TEE_ReadObjectData(TEE_ObjectHandle object, void *buffer, uint32_t size, uint32_t *count);
TEE_Result TEE_WriteObjectData(TEE_ObjectHandle object, const void *buffer, uint32_t size);
TEE_Result TEE_TruncateObjectData(TEE_ObjectHandle object, uint32_t size);
TEE_Result TEE_SeekObjectData(TEE_ObjectHandle object, int32_t offset, TEE_Whence whence);

/* Cryptographic operations */
TEE_Result TEE_AllocateOperation(TEE_OperationHandle *operation, uint32_t algorithm, uint32_t mode,
                                 uint32_t maxKeySize);
void TEE_FreeOperation(TEE_OperationHandle operation);
void TEE_GetOperationInfo(TEE_OperationHandle operation, TEE_OperationInfo *operationInfo);
void TEE_ResetOperation(TEE_OperationHandle operation);
TEE_Result TEE_SetOperationKey(TEE_OperationHandle operation, TEE_ObjectHandle key);
void TEE_CopyOperation(TEE_OperationHandle dstOperation, TEE_OperationHandle srcOperation);

void TEE_DigestUpdate(TEE_OperationHandle operation, const void *chunk, uint32_t chunkSize);
TEE_Result TEE_DigestDoFinal(TEE_OperationHandle operation, const void *chunk, uint32_t chunkLen, void *hash,
                             uint32_t *hashLen);

void TEE_CipherInit(TEE_OperationHandle operation, const void *IV, uint32_t IVLen);
TEE_Result TEE_CipherUpdate(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                            uint32_t *destLen);
TEE_Result TEE_CipherDoFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                             uint32_t *destLen);

void TEE_MACInit(TEE_OperationHandle operation, const void *IV, uint32_t IVLen);
void TEE_MACUpdate(TEE_OperationHandle operation, const void *chunk, uint32_t chunkSize);
TEE_Result TEE_MACComputeFinal(TEE_OperationHandle operation, const void *message, uint32_t messageLen, void *mac,
                               uint32_t *macLen);
TEE_Result TEE_MACCompareFinal(TEE_OperationHandle operation, const void *message, uint32_t messageLen, const void *mac,
                               uint32_t macLen);

TEE_Result TEE_AEInit(TEE_OperationHandle operation, const void *nonce, uint32_t nonceLen, uint32_t tagLen,
                      uint32_t AADLen, uint32_t payloadLen);
void TEE_AEUpdateAAD(TEE_OperationHandle operation, const void *AADdata, uint32_t AADdataLen);
TEE_Result TEE_AEUpdate(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                        uint32_t *destLen);
TEE_Result TEE_AEEncryptFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                              uint32_t *destLen, void *tag, uint32_t *tagLen);
TEE_Result TEE_AEDecryptFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                              uint32_t *destLen, const void *tag, uint32_t tagLen);

TEE_Result TEE_AsymmetricEncrypt(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                 const void *srcData, uint32_t srcLen, void *destData, uint32_t *destLen);
TEE_Result TEE_AsymmetricDecrypt(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                 const void *srcData, uint32_t srcLen, void *destData, uint32_t *destLen);
TEE_Result TEE_AsymmetricSignDigest(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                    const void *digest, uint32_t digestLen, void *signature, uint32_t *signatureLen);
TEE_Result TEE_AsymmetricVerifyDigest(TEE_OperationHandle operation, const TEE_Attribute *params, uint32_t paramCount,
                                      const void *digest, uint32_t digestLen, const void *signature,
                                      uint32_t signatureLen);

#ifdef __cplusplus
}
#endif

#include "tee_api_extensions.h"

#endif /* TEE_INTERNAL_API_H */
