/*
 * ta_entry.h - the TA's identity as the TEE sees it: UUID, header and the
 * TA clients trusted with raw key material.
 */
#ifndef TA_ENTRY_H
#define TA_ENTRY_H

#include <tee_internal_api.h>
#include <tee_ta_header.h>

/* Command identifiers. */
enum keymaster_command_t : uint32_t {
    KM_CMD_GET_SUPPORT_ALGO_CNT = 1,
    KM_CMD_GET_SUPPORT_ALGO = 2,
    KM_CMD_GET_SUPPORT_BLK_MODE_CNT = 3,
    KM_CMD_GET_SUPPORT_BLK_MODE = 4,
    KM_CMD_GET_SUPPORT_PADDING_MODE_CNT = 5,
    KM_CMD_GET_SUPPORT_PADDING_MODE = 6,
    KM_CMD_GET_SUPPORT_DIGEST_CNT = 7,
    KM_CMD_GET_SUPPORT_DIGEST = 8,
    KM_CMD_GET_SUPPORT_IMPORT_FORMAT_CNT = 9,
    KM_CMD_GET_SUPPORT_IMPORT_FORMAT = 10,
    KM_CMD_GET_SUPPORT_EXPORT_FORMAT_CNT = 11,
    KM_CMD_GET_SUPPORT_EXPORT_FORMAT = 12,
    KM_CMD_GENERATE_KEY = 13,
    KM_CMD_GET_KEY_CHARACTER_SIZE = 14,
    KM_CMD_GET_KEY_CHARACTER = 15,
    KM_CMD_BEGIN = 16,
    KM_CMD_UPDATE = 17,
    KM_CMD_FINISH = 18,
    KM_CMD_IMPORT_KEY = 19,
    KM_CMD_EXPORT_KEY = 20,
    KM_CMD_DELETE_KEY = 21,
    KM_CMD_DELETE_ALL_KEY = 22,
    KM_CMD_ABORT = 23,
    KM_CMD_OPEN_KEY = 27,
    KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR = 0xFF00,
    KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR = 0xFF01,
    KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY = 0xFF02,
    KM_CMD_SOTER_GET_DEVICE_ID = 0xFF03,
    KM_CMD_SOTER_SET_FID = 0xFF04,
};

/* The Keymaster TA's own UUID. */
extern const TEE_UUID keymaster_ta_uuid;

/* trusted_client_uuids - the three client TAs allowed to open raw key blobs. */
constexpr uint32_t kTrustedClientCount = 3;
extern const TEE_UUID trusted_client_uuids[kTrustedClientCount];

/* keymaster_ta_header - what the TEE loads: UUID, stack, flags, entries, properties. */
extern const ta_header_t keymaster_ta_header;

#endif
