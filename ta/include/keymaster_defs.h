/*
 * keymaster_defs.h - Keymaster tags, enumerations and errors, the key
 * parameter record and parameter set, and the small inline functions
 * every source file uses on sets.
 */
#ifndef KEYMASTER_DEFS_H
#define KEYMASTER_DEFS_H

#include <cstddef>
#include <cstdint>

#include <tee_internal_api.h>

#include "ta_heap.h"

/* Tag types: the top four bits of a tag. */
enum keymaster_tag_type_t : uint32_t {
    KM_INVALID = 0x00000000,
    KM_ENUM = 0x10000000,
    KM_ENUM_REP = 0x20000000,
    KM_UINT = 0x30000000,
    KM_UINT_REP = 0x40000000,
    KM_ULONG = 0x50000000,
    KM_DATE = 0x60000000,
    KM_BOOL = 0x70000000,
    KM_BIGNUM = 0x80000000,
    KM_BYTES = 0x90000000,
    KM_ULONG_REP = 0xA0000000,
};

enum keymaster_tag_t : uint32_t {
    KM_TAG_INVALID = 0,
    KM_TAG_PURPOSE = KM_ENUM_REP | 1,
    KM_TAG_ALGORITHM = KM_ENUM | 2,
    KM_TAG_KEY_SIZE = KM_UINT | 3,
    KM_TAG_BLOCK_MODE = KM_ENUM_REP | 4,
    KM_TAG_DIGEST = KM_ENUM_REP | 5,
    KM_TAG_PADDING = KM_ENUM_REP | 6,
    KM_TAG_CALLER_NONCE = KM_BOOL | 7,
    KM_TAG_MIN_MAC_LENGTH = KM_UINT | 8,
    KM_TAG_RSA_PUBLIC_EXPONENT = KM_ULONG | 200,
    KM_TAG_BLOB_USAGE_REQUIREMENTS = KM_ENUM | 301,
    KM_TAG_BOOTLOADER_ONLY = KM_BOOL | 302,
    KM_TAG_ACTIVE_DATETIME = KM_DATE | 400,
    KM_TAG_ORIGINATION_EXPIRE_DATETIME = KM_DATE | 401,
    KM_TAG_USAGE_EXPIRE_DATETIME = KM_DATE | 402,
    KM_TAG_MIN_SECONDS_BETWEEN_OPS = KM_UINT | 403,
    KM_TAG_MAX_USES_PER_BOOT = KM_UINT | 404,
    KM_TAG_USER_SECURE_ID = KM_ULONG_REP | 502,
    KM_TAG_NO_AUTH_REQUIRED = KM_BOOL | 503,
    KM_TAG_USER_AUTH_TYPE = KM_ENUM | 504,
    KM_TAG_AUTH_TIMEOUT = KM_UINT | 505,
    KM_TAG_APPLICATION_ID = KM_BYTES | 601,
    KM_TAG_APPLICATION_DATA = KM_BYTES | 700,
    KM_TAG_ORIGIN = KM_ENUM | 702,
    KM_TAG_ROOT_OF_TRUST = KM_BYTES | 704,
    KM_TAG_ASSOCIATED_DATA = KM_BYTES | 1000,
    KM_TAG_NONCE = KM_BYTES | 1001,
    KM_TAG_AUTH_TOKEN = KM_BYTES | 1002,
    KM_TAG_MAC_LENGTH = KM_UINT | 1003,

    /* SOTER tags */
    KM_TAG_SOTER_IS_FROM_SOTER = KM_BOOL | 11000,
    KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY = KM_BOOL | 11001,
    KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY = KM_BOOL | 11002,
    KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY = KM_BYTES | 11003,
    KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY = KM_BOOL | 11004,
    KM_TAG_SOTER_UID = KM_UINT | 11007,
    KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB = KM_BYTES | 11008,
};

enum keymaster_algorithm_t : uint32_t {
    KM_ALGORITHM_RSA = 1,
    KM_ALGORITHM_EC = 3,
    KM_ALGORITHM_AES = 32,
    KM_ALGORITHM_HMAC = 128,
};

enum keymaster_purpose_t : uint32_t {
    KM_PURPOSE_ENCRYPT = 0,
    KM_PURPOSE_DECRYPT = 1,
    KM_PURPOSE_SIGN = 2,
    KM_PURPOSE_VERIFY = 3,
};

enum keymaster_block_mode_t : uint32_t {
    KM_MODE_ECB = 1,
    KM_MODE_CBC = 2,
    KM_MODE_CTR = 3,
    KM_MODE_GCM = 32,
};

enum keymaster_padding_t : uint32_t {
    KM_PAD_NONE = 1,
    KM_PAD_RSA_OAEP = 2,
    KM_PAD_RSA_PSS = 3,
    KM_PAD_RSA_PKCS1_1_5_ENCRYPT = 4,
    KM_PAD_RSA_PKCS1_1_5_SIGN = 5,
    KM_PAD_PKCS7 = 64,
};

enum keymaster_digest_t : uint32_t {
    KM_DIGEST_NONE = 0,
    KM_DIGEST_MD5 = 1,
    KM_DIGEST_SHA1 = 2,
    KM_DIGEST_SHA_2_224 = 3,
    KM_DIGEST_SHA_2_256 = 4,
    KM_DIGEST_SHA_2_384 = 5,
    KM_DIGEST_SHA_2_512 = 6,
};

enum keymaster_key_format_t : uint32_t {
    KM_KEY_FORMAT_X509 = 0,
    KM_KEY_FORMAT_PKCS8 = 1,
    KM_KEY_FORMAT_RAW = 3,
};

enum keymaster_key_origin_t : uint32_t {
    KM_ORIGIN_GENERATED = 0,
    KM_ORIGIN_IMPORTED = 2,
};

enum keymaster_error_t : int32_t {
    KM_ERROR_OK = 0,
    KM_ERROR_ROOT_OF_TRUST_ALREADY_SET = -1,
    KM_ERROR_UNSUPPORTED_PURPOSE = -2,
    KM_ERROR_INCOMPATIBLE_PURPOSE = -3,
    KM_ERROR_UNSUPPORTED_ALGORITHM = -4,
    KM_ERROR_INCOMPATIBLE_ALGORITHM = -5,
    KM_ERROR_UNSUPPORTED_KEY_SIZE = -6,
    KM_ERROR_UNSUPPORTED_BLOCK_MODE = -7,
    KM_ERROR_INCOMPATIBLE_BLOCK_MODE = -8,
    KM_ERROR_UNSUPPORTED_MAC_LENGTH = -9,
    KM_ERROR_UNSUPPORTED_PADDING_MODE = -10,
    KM_ERROR_INCOMPATIBLE_PADDING_MODE = -11,
    KM_ERROR_UNSUPPORTED_DIGEST = -12,
    KM_ERROR_INCOMPATIBLE_DIGEST = -13,
    KM_ERROR_INVALID_EXPIRATION_TIME = -14,
    KM_ERROR_INVALID_USER_ID = -15,
    KM_ERROR_INVALID_AUTHORIZATION_TIMEOUT = -16,
    KM_ERROR_UNSUPPORTED_KEY_FORMAT = -17,
    KM_ERROR_INCOMPATIBLE_KEY_FORMAT = -18,
    KM_ERROR_UNSUPPORTED_KEY_ENCRYPTION_ALGORITHM = -19,
    KM_ERROR_UNSUPPORTED_KEY_VERIFICATION_ALGORITHM = -20,
    KM_ERROR_INVALID_INPUT_LENGTH = -21,
    KM_ERROR_KEY_EXPORT_OPTIONS_INVALID = -22,
    KM_ERROR_DELEGATION_NOT_ALLOWED = -23,
    KM_ERROR_KEY_NOT_YET_VALID = -24,
    KM_ERROR_KEY_EXPIRED = -25,
    KM_ERROR_KEY_USER_NOT_AUTHENTICATED = -26,
    KM_ERROR_OUTPUT_PARAMETER_NULL = -27,
    KM_ERROR_INVALID_OPERATION_HANDLE = -28,
    KM_ERROR_INSUFFICIENT_BUFFER_SPACE = -29,
    KM_ERROR_VERIFICATION_FAILED = -30,
    KM_ERROR_TOO_MANY_OPERATIONS = -31,
    KM_ERROR_UNEXPECTED_NULL_POINTER = -32,
    KM_ERROR_INVALID_KEY_BLOB = -33,
    KM_ERROR_IMPORTED_KEY_NOT_ENCRYPTED = -34,
    KM_ERROR_IMPORTED_KEY_DECRYPTION_FAILED = -35,
    KM_ERROR_IMPORTED_KEY_NOT_SIGNED = -36,
    KM_ERROR_IMPORTED_KEY_VERIFICATION_FAILED = -37,
    KM_ERROR_INVALID_ARGUMENT = -38,
    KM_ERROR_UNSUPPORTED_TAG = -39,
    KM_ERROR_INVALID_TAG = -40,
    KM_ERROR_MEMORY_ALLOCATION_FAILED = -41,
    KM_ERROR_IMPORT_PARAMETER_MISMATCH = -44,
    KM_ERROR_SECURE_HW_ACCESS_DENIED = -45,
    KM_ERROR_OPERATION_CANCELLED = -46,
    KM_ERROR_CONCURRENT_ACCESS_CONFLICT = -47,
    KM_ERROR_SECURE_HW_BUSY = -48,
    KM_ERROR_SECURE_HW_COMMUNICATION_FAILED = -49,
    KM_ERROR_UNSUPPORTED_EC_FIELD = -50,
    KM_ERROR_MISSING_NONCE = -51,
    KM_ERROR_INVALID_NONCE = -52,
    KM_ERROR_MISSING_MAC_LENGTH = -53,
    KM_ERROR_KEY_RATE_LIMIT_EXCEEDED = -54,
    KM_ERROR_CALLER_NONCE_PROHIBITED = -55,
    KM_ERROR_KEY_MAX_OPS_EXCEEDED = -56,
    KM_ERROR_INVALID_MAC_LENGTH = -57,
    KM_ERROR_MISSING_MIN_MAC_LENGTH = -58,
    KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH = -59,
    KM_ERROR_UNSUPPORTED_KDF = -60,
    KM_ERROR_UNSUPPORTED_EC_CURVE = -61,
    KM_ERROR_KEY_REQUIRES_UPGRADE = -62,
    KM_ERROR_UNIMPLEMENTED = -100,
    KM_ERROR_VERSION_MISMATCH = -101,
    KM_ERROR_UNKNOWN_ERROR = -1000,
};

/*
 * key_param_t - one key parameter, laid out byte for byte as its 24-byte
 * serialized record: tag at 0, an unused word at 4, the value area at 8.
 * A byte string keeps its data pointer in an 8-byte slot at 8 and its
 * length at 16, whatever the pointer size.
 */
struct key_param_t {
    uint32_t tag;
    uint32_t unused;
    union {
        uint32_t enumerated;   /* KM_ENUM, KM_ENUM_REP */
        uint32_t integer;      /* KM_UINT, KM_UINT_REP */
        uint64_t long_integer; /* KM_ULONG, KM_ULONG_REP */
        uint64_t date_time;    /* KM_DATE */
        uint8_t boolean;       /* KM_BOOL */
        struct {
            union {
                uint8_t *data;
                uint64_t data_slot;
            };
            uint32_t data_length;
            uint32_t data_unused;
        } blob; /* KM_BIGNUM, KM_BYTES */
        uint8_t raw[16];
    };
};
static_assert(sizeof(key_param_t) == 24, "a key parameter is one 24-byte record");
static_assert(offsetof(key_param_t, blob.data_length) == 16, "byte-string length at byte 16");

/* keymaster_key_param_set_t - an owned array of parameters; empty is {null, 0}. */
struct keymaster_key_param_set_t {
    key_param_t *params;
    uint32_t length;
};

inline uint32_t key_tag_type(uint32_t tag) {
    return tag & 0xF0000000u;
}

inline bool key_tag_is_blob(uint32_t tag) {
    uint32_t t = key_tag_type(tag);
    return t == KM_BIGNUM || t == KM_BYTES;
}

/* key_param_values_release - frees the data of every byte-string record of the array. */
inline void key_param_values_release(key_param_t *params, uint32_t count) {
    if (!params)
        return;
    for (uint32_t i = 0; i < count; ++i) {
        if (key_tag_is_blob(params[i].tag) && params[i].blob.data) {
            ta_free_wiped(params[i].blob.data, params[i].blob.data_length);
            params[i].blob.data = nullptr;
        }
    }
}

/* key_param_set_release - frees a set's data and array and leaves it empty. */
inline void key_param_set_release(keymaster_key_param_set_t *set) {
    if (!set || !set->params)
        return;
    key_param_values_release(set->params, set->length);
    ta_free(set->params);
    set->params = nullptr;
    set->length = 0;
}

inline int32_t key_param_set_count_tag(const keymaster_key_param_set_t *set, uint32_t tag) {
    int32_t n = 0;
    if (!set || !set->params)
        return 0;
    for (uint32_t i = 0; i < set->length; ++i)
        if (set->params[i].tag == tag)
            ++n;
    return n;
}

inline bool key_param_set_has_tag(const keymaster_key_param_set_t *set, uint32_t tag) {
    return key_param_set_count_tag(set, tag) >= 1;
}

inline bool key_param_set_at_most_one(const keymaster_key_param_set_t *set, uint32_t tag) {
    return key_param_set_count_tag(set, tag) <= 1;
}

/* key_param_set_find_unique - the one record with that tag; null for none or several. */
inline key_param_t *key_param_set_find_unique(const keymaster_key_param_set_t *set, uint32_t tag) {
    key_param_t *found = nullptr;
    if (!set || !set->params)
        return nullptr;
    for (uint32_t i = 0; i < set->length; ++i) {
        if (set->params[i].tag != tag)
            continue;
        if (found)
            return nullptr;
        found = &set->params[i];
    }
    return found;
}

/*
 * key_param_set_add - appends a copy of param. On success the set owns the
 * param's data buffer. On failure (TEE_ERROR_OUT_OF_MEMORY, or
 * TEE_ERROR_OVERFLOW for a set that cannot grow) the set is unchanged and
 * the caller still owns the data.
 */
inline TEE_Result key_param_set_add(keymaster_key_param_set_t *set, key_param_t param,
                                    const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
    uint32_t n = set->params ? set->length : 0;
    if (n >= UINT32_MAX / sizeof(key_param_t))
        return TEE_ERROR_OVERFLOW;
    void *grown = ta_realloc(set->params, static_cast<uint32_t>((n + 1) * sizeof(key_param_t)), file, line);
    if (!grown)
        return TEE_ERROR_OUT_OF_MEMORY;
    set->params = static_cast<key_param_t *>(grown);
    set->params[n] = param;
    set->length = n + 1;
    return TEE_SUCCESS;
}

/* Convenience constructors for records. */
inline key_param_t key_param_enum(uint32_t tag, uint32_t v) {
    key_param_t p{};
    p.tag = tag;
    p.enumerated = v;
    return p;
}
inline key_param_t key_param_long(uint32_t tag, uint64_t v) {
    key_param_t p{};
    p.tag = tag;
    p.long_integer = v;
    return p;
}
inline key_param_t key_param_bool(uint32_t tag) {
    key_param_t p{};
    p.tag = tag;
    p.boolean = 1;
    return p;
}

/*
 * keymaster_dump_key_param_set - writes the set to the debug log, naming
 * the caller's file and line. Byte strings show only their length.
 */
void keymaster_dump_key_param_set(const char *file, int line, const keymaster_key_param_set_t *set);
#define KM_DUMP_PARAM_SET(set) keymaster_dump_key_param_set(__FILE_NAME__, __LINE__, (set))

/*
 * settle_error - the common exit of a command or provider step: a failure
 * (done false) that set neither a TEE result nor an error becomes
 * KM_ERROR_UNKNOWN_ERROR, so that no failure ever reads as success.
 */
inline void settle_error(TEE_Result res, bool done, int32_t *error) {
    if (!done && res == TEE_SUCCESS && *error == KM_ERROR_OK)
        *error = KM_ERROR_UNKNOWN_ERROR;
}

/* param_set_guard - releases the set it watches when the scope ends. */
class param_set_guard {
  public:
    explicit param_set_guard(keymaster_key_param_set_t *set) : set_(set) {}
    ~param_set_guard() { key_param_set_release(set_); }
    param_set_guard(const param_set_guard &) = delete;
    param_set_guard &operator=(const param_set_guard &) = delete;

  private:
    keymaster_key_param_set_t *set_;
};

#endif
