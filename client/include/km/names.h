/*
 * names.h - names for the values that cross the TA boundary: Keymaster
 * enumerations, tags, Keymaster errors and TEE results.
 *
 * Printing never fails: a value without a name prints as a number.
 * Parsing is case-insensitive, treats '-' like '_', and accepts numbers
 * where a value is expected, so that anything printed parses back.
 */
#ifndef KM_NAMES_H
#define KM_NAMES_H

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace km {

// The enumerations of keymaster_defs.h that have names.
enum class Enumeration {
    none, // the value is a plain number
    algorithm,
    purpose,
    block_mode,
    padding,
    digest,
    key_format,
    key_origin,
};

struct EnumName {
    uint32_t value;
    std::string_view name; // lower case, without the KM_..._ prefix
};

struct EnumAlias {
    std::string_view alias;
    uint32_t value;
};

// enumerations - every Enumeration except none, in declaration order.
std::span<const Enumeration> enumerations();

// enumeration_label - "algorithm", "block_mode"...; "none" for none.
std::string_view enumeration_label(Enumeration e);

// enum_names - the canonical names of an enumeration in value order; empty for none.
std::span<const EnumName> enum_names(Enumeration e);

// enum_aliases - the short input forms accepted besides the canonical names.
std::span<const EnumAlias> enum_aliases(Enumeration e);

// enum_name - the canonical name of value, or its decimal form when it has none.
std::string enum_name(Enumeration e, uint32_t value);

// parse_enum - a canonical name, an alias or a number (decimal or 0x hex)
// to its value. Numbers are taken even without a name, so that a caller can
// hand the TA values it does not know. nullopt for anything else.
std::optional<uint32_t> parse_enum(Enumeration e, std::string_view text);

struct TagInfo {
    uint32_t tag;
    std::string_view name; // "KM_TAG_PURPOSE"
    Enumeration values;    // the names an enumerated tag takes; none otherwise
};

// tags - every tag of keymaster_defs.h except KM_TAG_INVALID, in the order
// keymaster_defs.h declares them.
std::span<const TagInfo> tags();

// find_tag - the entry of a tag value, or null when the tag has no name.
const TagInfo *find_tag(uint32_t tag);

// parse_tag - the entry named by text: "KM_TAG_PURPOSE", "purpose",
// "PURPOSE", "key-size"... Null when no tag has that name.
const TagInfo *parse_tag(std::string_view text);

// tag_name - "KM_TAG_PURPOSE", or "0x20000001" for a tag without a name.
std::string tag_name(uint32_t tag);

// tag_type - the type bits of a tag (KM_ENUM, KM_UINT... of keymaster_defs.h).
constexpr uint32_t tag_type(uint32_t tag) {
    return tag & 0xF0000000u;
}

// tag_type_label - "enum", "enum_rep", "uint", "uint_rep", "ulong",
// "ulong_rep", "date", "bool", "bignum", "bytes", "invalid"; "unknown" for
// type bits no tag uses.
std::string_view tag_type_label(uint32_t type);

// tag_repeatable - whether a key may carry the tag more than once.
bool tag_repeatable(uint32_t tag);

struct ErrorInfo {
    int32_t code;
    std::string_view name;    // "KM_ERROR_INCOMPATIBLE_DIGEST"
    std::string_view message; // one short sentence
};

// errors - every Keymaster error code, KM_ERROR_OK first, then descending.
std::span<const ErrorInfo> errors();

// find_error - the entry of a code, or null.
const ErrorInfo *find_error(int32_t code);

// error_name - "KM_ERROR_INCOMPATIBLE_DIGEST", or the decimal code.
std::string error_name(int32_t code);

// error_message - the code's sentence, or a generic one for unknown codes.
std::string_view error_message(int32_t code);

// parse_error - a name (with or without KM_ERROR_, any case) or a decimal code.
std::optional<int32_t> parse_error(std::string_view text);

struct TeeResultName {
    uint32_t result;
    std::string_view name; // "TEE_ERROR_BAD_PARAMETERS"
};

// tee_results - every TEE result the platform defines, TEE_SUCCESS first.
std::span<const TeeResultName> tee_results();

// tee_result_name - "TEE_ERROR_BAD_PARAMETERS", or "0x%08x" for others.
std::string tee_result_name(uint32_t result);

// parse_tee_result - a name (any case) or a number (decimal or 0x hex).
std::optional<uint32_t> parse_tee_result(std::string_view text);

// parse_number - a whole decimal or 0x-prefixed hex number that fits in 64
// bits; nullopt for anything else, signs included.
std::optional<uint64_t> parse_number(std::string_view text);

} // namespace km

#endif
