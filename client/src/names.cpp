/*
 * names.cpp - the name tables. Values come from the TA's own headers so
 * that the tables cannot drift from what the TA sends.
 */
#include "km/names.h"

#include <cstdio>

#include "keymaster_defs.h"
#include "tee_api_defines.h"

namespace km {
namespace {

constexpr EnumName kAlgorithms[] = {
    {KM_ALGORITHM_RSA, "rsa"},
    {KM_ALGORITHM_EC, "ec"},
    {KM_ALGORITHM_AES, "aes"},
    {KM_ALGORITHM_HMAC, "hmac"},
};
constexpr EnumName kPurposes[] = {
    {KM_PURPOSE_ENCRYPT, "encrypt"},
    {KM_PURPOSE_DECRYPT, "decrypt"},
    {KM_PURPOSE_SIGN, "sign"},
    {KM_PURPOSE_VERIFY, "verify"},
};
constexpr EnumName kBlockModes[] = {
    {KM_MODE_ECB, "ecb"},
    {KM_MODE_CBC, "cbc"},
    {KM_MODE_CTR, "ctr"},
    {KM_MODE_GCM, "gcm"},
};
constexpr EnumName kPaddings[] = {
    {KM_PAD_NONE, "none"},
    {KM_PAD_RSA_OAEP, "rsa_oaep"},
    {KM_PAD_RSA_PSS, "rsa_pss"},
    {KM_PAD_RSA_PKCS1_1_5_ENCRYPT, "rsa_pkcs1_1_5_encrypt"},
    {KM_PAD_RSA_PKCS1_1_5_SIGN, "rsa_pkcs1_1_5_sign"},
    {KM_PAD_PKCS7, "pkcs7"},
};
constexpr EnumName kDigests[] = {
    {KM_DIGEST_NONE, "none"},           {KM_DIGEST_MD5, "md5"},
    {KM_DIGEST_SHA1, "sha1"},           {KM_DIGEST_SHA_2_224, "sha_2_224"},
    {KM_DIGEST_SHA_2_256, "sha_2_256"}, {KM_DIGEST_SHA_2_384, "sha_2_384"},
    {KM_DIGEST_SHA_2_512, "sha_2_512"},
};
constexpr EnumName kKeyFormats[] = {
    {KM_KEY_FORMAT_X509, "x509"},
    {KM_KEY_FORMAT_PKCS8, "pkcs8"},
    {KM_KEY_FORMAT_RAW, "raw"},
};
constexpr EnumName kKeyOrigins[] = {
    {KM_ORIGIN_GENERATED, "generated"},
    {KM_ORIGIN_IMPORTED, "imported"},
};

// Aliases are what people type from habit. "pkcs1" is deliberately absent:
// it would be either of two RSA paddings.
constexpr EnumAlias kAlgorithmAliases[] = {{"ecdsa", KM_ALGORITHM_EC}};
constexpr EnumAlias kPurposeAliases[] = {{"enc", KM_PURPOSE_ENCRYPT}, {"dec", KM_PURPOSE_DECRYPT}};
constexpr EnumAlias kPaddingAliases[] = {
    {"oaep", KM_PAD_RSA_OAEP},
    {"pss", KM_PAD_RSA_PSS},
    {"pkcs1_encrypt", KM_PAD_RSA_PKCS1_1_5_ENCRYPT},
    {"pkcs1_sign", KM_PAD_RSA_PKCS1_1_5_SIGN},
    {"pkcs1_1_5_encrypt", KM_PAD_RSA_PKCS1_1_5_ENCRYPT},
    {"pkcs1_1_5_sign", KM_PAD_RSA_PKCS1_1_5_SIGN},
};
constexpr EnumAlias kDigestAliases[] = {
    {"sha_1", KM_DIGEST_SHA1},         {"sha224", KM_DIGEST_SHA_2_224},   {"sha256", KM_DIGEST_SHA_2_256},
    {"sha384", KM_DIGEST_SHA_2_384},   {"sha512", KM_DIGEST_SHA_2_512},   {"sha_224", KM_DIGEST_SHA_2_224},
    {"sha_256", KM_DIGEST_SHA_2_256},  {"sha_384", KM_DIGEST_SHA_2_384},  {"sha_512", KM_DIGEST_SHA_2_512},
    {"sha2_224", KM_DIGEST_SHA_2_224}, {"sha2_256", KM_DIGEST_SHA_2_256}, {"sha2_384", KM_DIGEST_SHA_2_384},
    {"sha2_512", KM_DIGEST_SHA_2_512},
};
constexpr EnumAlias kKeyFormatAliases[] = {{"spki", KM_KEY_FORMAT_X509}};

struct EnumTable {
    Enumeration e;
    std::string_view label;
    std::span<const EnumName> names;
    std::span<const EnumAlias> aliases;
};

constexpr EnumTable kEnumTables[] = {
    {Enumeration::algorithm, "algorithm", kAlgorithms, kAlgorithmAliases},
    {Enumeration::purpose, "purpose", kPurposes, kPurposeAliases},
    {Enumeration::block_mode, "block_mode", kBlockModes, {}},
    {Enumeration::padding, "padding", kPaddings, kPaddingAliases},
    {Enumeration::digest, "digest", kDigests, kDigestAliases},
    {Enumeration::key_format, "key_format", kKeyFormats, kKeyFormatAliases},
    {Enumeration::key_origin, "key_origin", kKeyOrigins, {}},
};

constexpr Enumeration kEnumerations[] = {
    Enumeration::algorithm, Enumeration::purpose,    Enumeration::block_mode, Enumeration::padding,
    Enumeration::digest,    Enumeration::key_format, Enumeration::key_origin,
};

const EnumTable *table_of(Enumeration e) {
    for (const EnumTable &t : kEnumTables)
        if (t.e == e)
            return &t;
    return nullptr;
}

#define KM_TAG_ENTRY(tag, values)                                                                                      \
    { tag, #tag, Enumeration::values }

constexpr TagInfo kTags[] = {
    KM_TAG_ENTRY(KM_TAG_PURPOSE, purpose),
    KM_TAG_ENTRY(KM_TAG_ALGORITHM, algorithm),
    KM_TAG_ENTRY(KM_TAG_KEY_SIZE, none),
    KM_TAG_ENTRY(KM_TAG_BLOCK_MODE, block_mode),
    KM_TAG_ENTRY(KM_TAG_DIGEST, digest),
    KM_TAG_ENTRY(KM_TAG_PADDING, padding),
    KM_TAG_ENTRY(KM_TAG_CALLER_NONCE, none),
    KM_TAG_ENTRY(KM_TAG_MIN_MAC_LENGTH, none),
    KM_TAG_ENTRY(KM_TAG_RSA_PUBLIC_EXPONENT, none),
    // Enumerated, but keymaster_defs.h names none of its values.
    KM_TAG_ENTRY(KM_TAG_BLOB_USAGE_REQUIREMENTS, none),
    KM_TAG_ENTRY(KM_TAG_BOOTLOADER_ONLY, none),
    KM_TAG_ENTRY(KM_TAG_ACTIVE_DATETIME, none),
    KM_TAG_ENTRY(KM_TAG_ORIGINATION_EXPIRE_DATETIME, none),
    KM_TAG_ENTRY(KM_TAG_USAGE_EXPIRE_DATETIME, none),
    KM_TAG_ENTRY(KM_TAG_MIN_SECONDS_BETWEEN_OPS, none),
    KM_TAG_ENTRY(KM_TAG_MAX_USES_PER_BOOT, none),
    KM_TAG_ENTRY(KM_TAG_USER_SECURE_ID, none),
    KM_TAG_ENTRY(KM_TAG_NO_AUTH_REQUIRED, none),
    // Likewise: an authenticator bit mask with no names in keymaster_defs.h.
    KM_TAG_ENTRY(KM_TAG_USER_AUTH_TYPE, none),
    KM_TAG_ENTRY(KM_TAG_AUTH_TIMEOUT, none),
    KM_TAG_ENTRY(KM_TAG_APPLICATION_ID, none),
    KM_TAG_ENTRY(KM_TAG_APPLICATION_DATA, none),
    KM_TAG_ENTRY(KM_TAG_ORIGIN, key_origin),
    KM_TAG_ENTRY(KM_TAG_ROOT_OF_TRUST, none),
    KM_TAG_ENTRY(KM_TAG_ASSOCIATED_DATA, none),
    KM_TAG_ENTRY(KM_TAG_NONCE, none),
    KM_TAG_ENTRY(KM_TAG_AUTH_TOKEN, none),
    KM_TAG_ENTRY(KM_TAG_MAC_LENGTH, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_IS_FROM_SOTER, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_UID, none),
    KM_TAG_ENTRY(KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB, none),
};

#undef KM_TAG_ENTRY

struct TypeLabel {
    uint32_t type;
    std::string_view label;
};

constexpr TypeLabel kTypeLabels[] = {
    {KM_INVALID, "invalid"},   {KM_ENUM, "enum"},   {KM_ENUM_REP, "enum_rep"},   {KM_UINT, "uint"},
    {KM_UINT_REP, "uint_rep"}, {KM_ULONG, "ulong"}, {KM_DATE, "date"},           {KM_BOOL, "bool"},
    {KM_BIGNUM, "bignum"},     {KM_BYTES, "bytes"}, {KM_ULONG_REP, "ulong_rep"},
};

#define KM_ERROR_ENTRY(code, message)                                                                                  \
    { code, #code, message }

constexpr ErrorInfo kErrors[] = {
    KM_ERROR_ENTRY(KM_ERROR_OK, "Success."),
    KM_ERROR_ENTRY(KM_ERROR_ROOT_OF_TRUST_ALREADY_SET, "The root of trust has already been set."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_PURPOSE, "The algorithm does not support this purpose."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_PURPOSE, "The key was not authorized for this purpose."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_ALGORITHM, "The algorithm is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_ALGORITHM, "The key's algorithm does not fit the request."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_KEY_SIZE, "The key size is not supported for this algorithm."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_BLOCK_MODE, "The block mode is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_BLOCK_MODE, "The key was not authorized for this block mode."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_MAC_LENGTH, "The MAC or tag length is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_PADDING_MODE, "The padding mode is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_PADDING_MODE, "The key was not authorized for this padding mode."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_DIGEST, "The digest is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_DIGEST, "The key was not authorized for this digest."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_EXPIRATION_TIME, "The expiration time is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_USER_ID, "The user identifier is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_AUTHORIZATION_TIMEOUT, "The authorization timeout is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_KEY_FORMAT, "The key format is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INCOMPATIBLE_KEY_FORMAT, "The key format does not fit the key."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_KEY_ENCRYPTION_ALGORITHM, "The key encryption algorithm is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_KEY_VERIFICATION_ALGORITHM, "The key verification algorithm is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_INPUT_LENGTH, "The input length is not valid for this operation."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_EXPORT_OPTIONS_INVALID, "The export options are not valid."),
    KM_ERROR_ENTRY(KM_ERROR_DELEGATION_NOT_ALLOWED, "Delegation is not allowed."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_NOT_YET_VALID, "The key is not valid yet."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_EXPIRED, "The key has expired."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_USER_NOT_AUTHENTICATED, "The user has not authenticated for this key."),
    KM_ERROR_ENTRY(KM_ERROR_OUTPUT_PARAMETER_NULL, "An output parameter is missing."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_OPERATION_HANDLE, "The operation handle is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_INSUFFICIENT_BUFFER_SPACE, "The output buffer is too small."),
    KM_ERROR_ENTRY(KM_ERROR_VERIFICATION_FAILED, "The signature or MAC does not verify."),
    KM_ERROR_ENTRY(KM_ERROR_TOO_MANY_OPERATIONS, "Too many operations are in progress."),
    KM_ERROR_ENTRY(KM_ERROR_UNEXPECTED_NULL_POINTER, "A required argument is missing."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_KEY_BLOB, "The key blob is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_IMPORTED_KEY_NOT_ENCRYPTED, "The imported key is not encrypted."),
    KM_ERROR_ENTRY(KM_ERROR_IMPORTED_KEY_DECRYPTION_FAILED, "The imported key could not be decrypted."),
    KM_ERROR_ENTRY(KM_ERROR_IMPORTED_KEY_NOT_SIGNED, "The imported key is not signed."),
    KM_ERROR_ENTRY(KM_ERROR_IMPORTED_KEY_VERIFICATION_FAILED, "The imported key's signature does not verify."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_ARGUMENT, "An argument is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_TAG, "A tag is not supported here."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_TAG, "A tag is not valid here."),
    KM_ERROR_ENTRY(KM_ERROR_MEMORY_ALLOCATION_FAILED, "The secure side ran out of memory."),
    KM_ERROR_ENTRY(KM_ERROR_IMPORT_PARAMETER_MISMATCH, "The import parameters do not match the key material."),
    KM_ERROR_ENTRY(KM_ERROR_SECURE_HW_ACCESS_DENIED, "The secure hardware refused access."),
    KM_ERROR_ENTRY(KM_ERROR_OPERATION_CANCELLED, "The operation was cancelled."),
    KM_ERROR_ENTRY(KM_ERROR_CONCURRENT_ACCESS_CONFLICT, "Another caller is using the same resource."),
    KM_ERROR_ENTRY(KM_ERROR_SECURE_HW_BUSY, "The secure hardware is busy."),
    KM_ERROR_ENTRY(KM_ERROR_SECURE_HW_COMMUNICATION_FAILED, "Communication with the secure hardware failed."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_EC_FIELD, "The elliptic curve field is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_MISSING_NONCE, "The operation needs a nonce."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_NONCE, "The nonce is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_MISSING_MAC_LENGTH, "The operation needs a MAC length."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_RATE_LIMIT_EXCEEDED, "The key was used again too soon."),
    KM_ERROR_ENTRY(KM_ERROR_CALLER_NONCE_PROHIBITED, "The key does not allow a caller-provided nonce."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_MAX_OPS_EXCEEDED, "The key has reached its maximum uses."),
    KM_ERROR_ENTRY(KM_ERROR_INVALID_MAC_LENGTH, "The MAC length is not valid."),
    KM_ERROR_ENTRY(KM_ERROR_MISSING_MIN_MAC_LENGTH, "The key needs a minimum MAC length."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH, "The minimum MAC length is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_KDF, "The key derivation function is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_UNSUPPORTED_EC_CURVE, "The elliptic curve is not supported."),
    KM_ERROR_ENTRY(KM_ERROR_KEY_REQUIRES_UPGRADE, "The key blob must be upgraded first."),
    KM_ERROR_ENTRY(KM_ERROR_UNIMPLEMENTED, "The request is not implemented."),
    KM_ERROR_ENTRY(KM_ERROR_VERSION_MISMATCH, "The client and the secure side disagree on the version."),
    KM_ERROR_ENTRY(KM_ERROR_UNKNOWN_ERROR, "An unknown error occurred."),
};

#undef KM_ERROR_ENTRY

#define TEE_RESULT_ENTRY(result)                                                                                       \
    { result, #result }

constexpr TeeResultName kTeeResults[] = {
    TEE_RESULT_ENTRY(TEE_SUCCESS),
    TEE_RESULT_ENTRY(TEE_ERROR_CORRUPT_OBJECT),
    TEE_RESULT_ENTRY(TEE_ERROR_CORRUPT_OBJECT_2),
    TEE_RESULT_ENTRY(TEE_ERROR_STORAGE_NOT_AVAILABLE),
    TEE_RESULT_ENTRY(TEE_ERROR_STORAGE_NOT_AVAILABLE_2),
    TEE_RESULT_ENTRY(TEE_ERROR_GENERIC),
    TEE_RESULT_ENTRY(TEE_ERROR_ACCESS_DENIED),
    TEE_RESULT_ENTRY(TEE_ERROR_CANCEL),
    TEE_RESULT_ENTRY(TEE_ERROR_ACCESS_CONFLICT),
    TEE_RESULT_ENTRY(TEE_ERROR_EXCESS_DATA),
    TEE_RESULT_ENTRY(TEE_ERROR_BAD_FORMAT),
    TEE_RESULT_ENTRY(TEE_ERROR_BAD_PARAMETERS),
    TEE_RESULT_ENTRY(TEE_ERROR_BAD_STATE),
    TEE_RESULT_ENTRY(TEE_ERROR_ITEM_NOT_FOUND),
    TEE_RESULT_ENTRY(TEE_ERROR_NOT_IMPLEMENTED),
    TEE_RESULT_ENTRY(TEE_ERROR_NOT_SUPPORTED),
    TEE_RESULT_ENTRY(TEE_ERROR_NO_DATA),
    TEE_RESULT_ENTRY(TEE_ERROR_OUT_OF_MEMORY),
    TEE_RESULT_ENTRY(TEE_ERROR_BUSY),
    TEE_RESULT_ENTRY(TEE_ERROR_COMMUNICATION),
    TEE_RESULT_ENTRY(TEE_ERROR_SECURITY),
    TEE_RESULT_ENTRY(TEE_ERROR_SHORT_BUFFER),
    TEE_RESULT_ENTRY(TEE_ERROR_EXTERNAL_CANCEL),
    TEE_RESULT_ENTRY(TEE_ERROR_OVERFLOW),
    TEE_RESULT_ENTRY(TEE_ERROR_TARGET_DEAD),
    TEE_RESULT_ENTRY(TEE_ERROR_STORAGE_NO_SPACE),
    TEE_RESULT_ENTRY(TEE_ERROR_MAC_INVALID),
    TEE_RESULT_ENTRY(TEE_ERROR_SIGNATURE_INVALID),
    TEE_RESULT_ENTRY(TEE_ERROR_TIME_NOT_SET),
    TEE_RESULT_ENTRY(TEE_ERROR_TIME_NEEDS_RESET),
};

#undef TEE_RESULT_ENTRY

// The form names are compared in: lower case, '-' read as '_'.
std::string fold(std::string_view text) {
    std::string s(text);
    for (char &c : s) {
        if (c >= 'A' && c <= 'Z')
            c = static_cast<char>(c - 'A' + 'a');
        else if (c == '-')
            c = '_';
    }
    return s;
}

std::string_view strip_prefix(std::string_view folded, std::string_view prefix) {
    if (folded.substr(0, prefix.size()) == prefix)
        folded.remove_prefix(prefix.size());
    return folded;
}

} // namespace

std::optional<uint64_t> parse_number(std::string_view text) {
    uint64_t base = 10;
    if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
        base = 16;
        text.remove_prefix(2);
    }
    if (text.empty())
        return std::nullopt;
    uint64_t value = 0;
    for (char c : text) {
        uint64_t digit = 0;
        if (c >= '0' && c <= '9')
            digit = static_cast<uint64_t>(c - '0');
        else if (base == 16 && c >= 'a' && c <= 'f')
            digit = static_cast<uint64_t>(c - 'a' + 10);
        else if (base == 16 && c >= 'A' && c <= 'F')
            digit = static_cast<uint64_t>(c - 'A' + 10);
        else
            return std::nullopt;
        if (value > (UINT64_MAX - digit) / base)
            return std::nullopt;
        value = value * base + digit;
    }
    return value;
}

std::span<const Enumeration> enumerations() {
    return kEnumerations;
}

std::string_view enumeration_label(Enumeration e) {
    const EnumTable *t = table_of(e);
    return t ? t->label : std::string_view("none");
}

std::span<const EnumName> enum_names(Enumeration e) {
    const EnumTable *t = table_of(e);
    return t ? t->names : std::span<const EnumName>{};
}

std::span<const EnumAlias> enum_aliases(Enumeration e) {
    const EnumTable *t = table_of(e);
    return t ? t->aliases : std::span<const EnumAlias>{};
}

std::string enum_name(Enumeration e, uint32_t value) {
    for (const EnumName &n : enum_names(e))
        if (n.value == value)
            return std::string(n.name);
    return std::to_string(value);
}

std::optional<uint32_t> parse_enum(Enumeration e, std::string_view text) {
    std::string folded = fold(text);
    for (const EnumName &n : enum_names(e))
        if (n.name == folded)
            return n.value;
    for (const EnumAlias &a : enum_aliases(e))
        if (a.alias == folded)
            return a.value;
    std::optional<uint64_t> number = parse_number(text);
    if (number && *number <= UINT32_MAX)
        return static_cast<uint32_t>(*number);
    return std::nullopt;
}

std::span<const TagInfo> tags() {
    return kTags;
}

const TagInfo *find_tag(uint32_t tag) {
    for (const TagInfo &t : kTags)
        if (t.tag == tag)
            return &t;
    return nullptr;
}

const TagInfo *parse_tag(std::string_view text) {
    std::string folded = fold(text);
    std::string_view bare = strip_prefix(folded, "km_tag_");
    for (const TagInfo &t : kTags)
        if (fold(t.name).substr(7) == bare)
            return &t;
    return nullptr;
}

std::string tag_name(uint32_t tag) {
    if (const TagInfo *t = find_tag(tag))
        return std::string(t->name);
    char buf[16] = {};
    std::snprintf(buf, sizeof buf, "0x%08x", tag);
    return buf;
}

std::string_view tag_type_label(uint32_t type) {
    for (const TypeLabel &t : kTypeLabels)
        if (t.type == type)
            return t.label;
    return "unknown";
}

bool tag_repeatable(uint32_t tag) {
    uint32_t type = tag_type(tag);
    return type == KM_ENUM_REP || type == KM_UINT_REP || type == KM_ULONG_REP;
}

std::span<const ErrorInfo> errors() {
    return kErrors;
}

const ErrorInfo *find_error(int32_t code) {
    for (const ErrorInfo &e : kErrors)
        if (e.code == code)
            return &e;
    return nullptr;
}

std::string error_name(int32_t code) {
    if (const ErrorInfo *e = find_error(code))
        return std::string(e->name);
    return std::to_string(code);
}

std::string_view error_message(int32_t code) {
    if (const ErrorInfo *e = find_error(code))
        return e->message;
    return "The secure side reported an error this client does not know.";
}

std::optional<int32_t> parse_error(std::string_view text) {
    std::string folded = fold(text);
    std::string_view bare = strip_prefix(folded, "km_error_");
    for (const ErrorInfo &e : kErrors)
        if (fold(e.name).substr(9) == bare)
            return e.code;
    // Codes are negative decimals, as the TA logs them.
    bool negative = !text.empty() && text[0] == '-';
    std::string_view digits = negative ? text.substr(1) : text;
    if (digits.empty() || digits.find_first_not_of("0123456789") != std::string_view::npos)
        return std::nullopt;
    std::optional<uint64_t> magnitude = parse_number(digits);
    if (!magnitude)
        return std::nullopt;
    if (negative && *magnitude <= uint64_t{INT32_MAX} + 1)
        return static_cast<int32_t>(-static_cast<int64_t>(*magnitude));
    if (!negative && *magnitude <= INT32_MAX)
        return static_cast<int32_t>(*magnitude);
    return std::nullopt;
}

std::span<const TeeResultName> tee_results() {
    return kTeeResults;
}

std::string tee_result_name(uint32_t result) {
    for (const TeeResultName &r : kTeeResults)
        if (r.result == result)
            return std::string(r.name);
    char buf[16] = {};
    std::snprintf(buf, sizeof buf, "0x%08x", result);
    return buf;
}

std::optional<uint32_t> parse_tee_result(std::string_view text) {
    std::string folded = fold(text);
    for (const TeeResultName &r : kTeeResults)
        if (fold(r.name) == folded)
            return r.result;
    std::optional<uint64_t> number = parse_number(text);
    if (number && *number <= UINT32_MAX)
        return static_cast<uint32_t>(*number);
    return std::nullopt;
}

} // namespace km
