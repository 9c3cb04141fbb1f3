/*
 * tee_ta_header.h - what a TA publishes to the TEE that loads it: its
 * identity, stack and flags, its entry points and its property table.
 */
#ifndef TEE_TA_HEADER_H
#define TEE_TA_HEADER_H

#include "tee_api_types.h"

#ifdef __cplusplus
extern "C" {
#endif

#define TA_FLAG_SINGLE_INSTANCE 0x1u
#define TA_FLAG_MULTI_SESSION 0x2u
#define TA_FLAG_INSTANCE_KEEP_ALIVE 0x4u
#define TA_FLAG_SECURE_DATA_PATH 0x8u

enum ta_prop_type { TA_PROP_BOOL, TA_PROP_U32, TA_PROP_STRING, TA_PROP_UUID };

typedef struct {
    const char *name;
    enum ta_prop_type type;
    /* bool, uint32_t, NUL-terminated string or TEE_UUID, by type */
    const void *value;
} ta_property_t;

typedef struct {
    TEE_UUID uuid;
    uint32_t stack_size;
    uint32_t flags;
    TEE_Result (*create_entry)(void);
    void (*destroy_entry)(void);
    TEE_Result (*open_session_entry)(uint32_t paramTypes, TEE_Param params[4], void **sessionContext);
    void (*close_session_entry)(void *sessionContext);
    TEE_Result (*invoke_command_entry)(void *sessionContext, uint32_t commandID, uint32_t paramTypes,
                                       TEE_Param params[4]);
    const ta_property_t *props;
    uint32_t num_props;
} ta_header_t;

#ifdef __cplusplus
}
#endif

#endif /* TEE_TA_HEADER_H */
