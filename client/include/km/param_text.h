/*
 * param_text.h - key parameters as people type and read them:
 * "NAME[=VALUE]" assignments, dates, hex byte strings, printed values.
 */
#ifndef KM_PARAM_TEXT_H
#define KM_PARAM_TEXT_H

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "km/param_set.h"

namespace km {

// parse_param - one "NAME[=VALUE]" assignment to a parameter. NAME is a tag
// name as parse_tag reads it ("KM_TAG_DIGEST", "digest", "min-mac-length")
// or a tag number whose type bits are known. VALUE by the tag's type:
// enumerations by name or number, integers in decimal or 0x hex, dates as
// milliseconds since the epoch or ISO 8601 UTC, byte strings as hex (empty
// allowed). Booleans take no value: their presence sets them.
// nullopt, with a one-line reason in *why, for an unknown name, a missing
// or malformed value, or a value given to a boolean.
std::optional<Param> parse_param(std::string_view text, std::string *why);

// parse_date - milliseconds since 1970-01-01T00:00:00Z from a decimal
// number or from "YYYY-MM-DD", "YYYY-MM-DDTHH:MM:SSZ" or
// "YYYY-MM-DDTHH:MM:SS.fffZ" (UTC only, years 1970 to 9999). nullopt for
// anything else, impossible dates included.
std::optional<uint64_t> parse_date(std::string_view text);

// format_date - "2026-01-31T12:00:00Z", with ".fff" before the Z when the
// milliseconds are not whole seconds; the plain number past year 9999, so
// that the text always parses back.
std::string format_date(uint64_t ms);

// parse_hex - bytes from an even number of hex digits, either case;
// nullopt for anything else.
std::optional<Bytes> parse_hex(std::string_view text);

// to_hex - lower-case hex of bytes.
std::string to_hex(std::span<const uint8_t> bytes);

// param_value_text - a parameter's value for people: enumerations by name,
// dates in ISO 8601, booleans "true", byte strings as "N bytes" (never
// their content, which may be secret).
std::string param_value_text(const Param &param);

// repeated_single_tag - the first tag that a key may carry only once but
// that set holds more than once; nullopt when there is none.
std::optional<uint32_t> repeated_single_tag(const ParamSet &set);

} // namespace km

#endif
