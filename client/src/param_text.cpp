/*
 * param_text.cpp - parsing and printing key parameters as text.
 */
#include "km/param_text.h"

#include <cstdio>

#include "keymaster_defs.h"
#include "km/names.h"

namespace km {
namespace {

constexpr uint64_t kMsPerDay = 86400000;

bool leap(int64_t y) {
    return (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
}

int days_in_month(int64_t y, int64_t m) {
    static constexpr int kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    return m == 2 && leap(y) ? 29 : kDays[m - 1];
}

// Days since 1970-01-01 of a proleptic Gregorian date (Howard Hinnant's
// days_from_civil).
int64_t days_from_civil(int64_t y, int64_t m, int64_t d) {
    y -= m <= 2;
    const int64_t era = y / 400;
    const int64_t yoe = y - era * 400;
    const int64_t doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + doe - 719468;
}

void civil_from_days(int64_t z, int64_t *y, int64_t *m, int64_t *d) {
    z += 719468;
    const int64_t era = z / 146097;
    const int64_t doe = z - era * 146097;
    const int64_t yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    const int64_t doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const int64_t mp = (5 * doy + 2) / 153;
    *d = doy - (153 * mp + 2) / 5 + 1;
    *m = mp < 10 ? mp + 3 : mp - 9;
    *y = yoe + era * 400 + (*m <= 2);
}

// Exactly n decimal digits at text[pos]; advances pos.
bool digits(std::string_view text, size_t *pos, size_t n, int64_t *out) {
    if (text.size() - *pos < n)
        return false;
    int64_t v = 0;
    for (size_t i = 0; i < n; ++i) {
        char c = text[*pos + i];
        if (c < '0' || c > '9')
            return false;
        v = v * 10 + (c - '0');
    }
    *pos += n;
    *out = v;
    return true;
}

bool expect(std::string_view text, size_t *pos, char c) {
    if (*pos >= text.size() || text[*pos] != c)
        return false;
    ++*pos;
    return true;
}

int hex_digit(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

// A tag number with type bits that some tag type uses.
std::optional<uint32_t> tag_number(std::string_view text) {
    std::optional<uint64_t> n = parse_number(text);
    if (!n || *n > UINT32_MAX)
        return std::nullopt;
    std::string_view label = tag_type_label(tag_type(static_cast<uint32_t>(*n)));
    if (label == "unknown" || label == "invalid")
        return std::nullopt;
    return static_cast<uint32_t>(*n);
}

} // namespace

std::optional<uint64_t> parse_date(std::string_view text) {
    if (!text.empty() && text.find_first_not_of("0123456789") == std::string_view::npos)
        return parse_number(text);
    size_t pos = 0;
    int64_t y = 0, mo = 0, d = 0, h = 0, mi = 0, s = 0, ms = 0;
    if (!digits(text, &pos, 4, &y) || !expect(text, &pos, '-') || !digits(text, &pos, 2, &mo) ||
        !expect(text, &pos, '-') || !digits(text, &pos, 2, &d))
        return std::nullopt;
    if (pos != text.size()) {
        if (!expect(text, &pos, 'T') || !digits(text, &pos, 2, &h) || !expect(text, &pos, ':') ||
            !digits(text, &pos, 2, &mi) || !expect(text, &pos, ':') || !digits(text, &pos, 2, &s))
            return std::nullopt;
        if (pos < text.size() && text[pos] == '.') {
            ++pos;
            if (!digits(text, &pos, 3, &ms))
                return std::nullopt;
        }
        // UTC only: a local time or an offset would be silently misread.
        if (!expect(text, &pos, 'Z') || pos != text.size())
            return std::nullopt;
    }
    if (y < 1970 || mo < 1 || mo > 12 || d < 1 || d > days_in_month(y, mo) || h > 23 || mi > 59 || s > 59)
        return std::nullopt;
    const int64_t days = days_from_civil(y, mo, d);
    return static_cast<uint64_t>(days) * kMsPerDay + static_cast<uint64_t>(((h * 60 + mi) * 60 + s) * 1000 + ms);
}

std::string format_date(uint64_t ms) {
    // 10000-01-01T00:00:00Z: past it ISO 8601 needs more than four digits.
    constexpr uint64_t kYear10000 = 253402300800000;
    if (ms >= kYear10000)
        return std::to_string(ms);
    int64_t y = 0, mo = 0, d = 0;
    civil_from_days(static_cast<int64_t>(ms / kMsPerDay), &y, &mo, &d);
    const uint64_t in_day = ms % kMsPerDay;
    const uint64_t secs = in_day / 1000;
    char buf[40] = {};
    int n = std::snprintf(buf, sizeof buf, "%04lld-%02lld-%02lldT%02llu:%02llu:%02llu", static_cast<long long>(y),
                          static_cast<long long>(mo), static_cast<long long>(d),
                          static_cast<unsigned long long>(secs / 3600), static_cast<unsigned long long>(secs / 60 % 60),
                          static_cast<unsigned long long>(secs % 60));
    std::string out(buf, static_cast<size_t>(n));
    if (in_day % 1000) {
        std::snprintf(buf, sizeof buf, ".%03llu", static_cast<unsigned long long>(in_day % 1000));
        out += buf;
    }
    return out + "Z";
}

std::optional<Bytes> parse_hex(std::string_view text) {
    if (text.size() % 2)
        return std::nullopt;
    Bytes out;
    out.reserve(text.size() / 2);
    for (size_t i = 0; i < text.size(); i += 2) {
        int hi = hex_digit(text[i]);
        int lo = hex_digit(text[i + 1]);
        if (hi < 0 || lo < 0)
            return std::nullopt;
        out.push_back(static_cast<uint8_t>(hi << 4 | lo));
    }
    return out;
}

std::string to_hex(std::span<const uint8_t> bytes) {
    static constexpr char kDigits[] = "0123456789abcdef";
    std::string out;
    out.reserve(bytes.size() * 2);
    for (uint8_t b : bytes) {
        out += kDigits[b >> 4];
        out += kDigits[b & 15];
    }
    return out;
}

std::optional<Param> parse_param(std::string_view text, std::string *why) {
    const size_t eq = text.find('=');
    const std::string_view name = text.substr(0, eq);
    const bool has_value = eq != std::string_view::npos;
    const std::string_view value = has_value ? text.substr(eq + 1) : std::string_view();

    Param p;
    Enumeration values = Enumeration::none;
    if (const TagInfo *info = parse_tag(name)) {
        p.tag = info->tag;
        values = info->values;
    } else if (std::optional<uint32_t> number = tag_number(name)) {
        p.tag = *number;
    } else {
        *why = "unknown tag '" + std::string(name) + "'";
        return std::nullopt;
    }
    const std::string tag = tag_name(p.tag);
    const uint32_t type = tag_type(p.tag);
    if (type == KM_BOOL) {
        if (has_value) {
            *why = tag + " is a boolean and takes no value";
            return std::nullopt;
        }
        p.value = 1;
        return p;
    }
    if (!has_value) {
        *why = tag + " needs a value: " + tag + "=VALUE";
        return std::nullopt;
    }
    auto bad = [&](std::string_view expected) {
        *why = "bad value '" + std::string(value) + "' for " + tag + ": expected " + std::string(expected);
        return std::nullopt;
    };
    switch (type) {
    case KM_ENUM:
    case KM_ENUM_REP: {
        std::optional<uint32_t> v = parse_enum(values, value);
        if (!v) {
            std::string names;
            for (const EnumName &n : enum_names(values))
                names += (names.empty() ? "" : ", ") + std::string(n.name);
            return bad(names.empty() ? "a number" : "one of " + names + " or a number");
        }
        p.value = *v;
        return p;
    }
    case KM_UINT:
    case KM_UINT_REP: {
        std::optional<uint64_t> v = parse_number(value);
        if (!v || *v > UINT32_MAX)
            return bad("a 32-bit unsigned number");
        p.value = *v;
        return p;
    }
    case KM_ULONG:
    case KM_ULONG_REP: {
        std::optional<uint64_t> v = parse_number(value);
        if (!v)
            return bad("a 64-bit unsigned number");
        p.value = *v;
        return p;
    }
    case KM_DATE: {
        std::optional<uint64_t> v = parse_date(value);
        if (!v)
            return bad("milliseconds since the epoch or an ISO 8601 UTC time such as 2026-01-31T12:00:00Z");
        p.value = *v;
        return p;
    }
    case KM_BYTES:
    case KM_BIGNUM: {
        std::optional<Bytes> v = parse_hex(value);
        if (!v)
            return bad("hex bytes");
        p.bytes = std::move(*v);
        return p;
    }
    default:
        *why = tag + " has a type that takes no value from the command line";
        return std::nullopt;
    }
}

std::string param_value_text(const Param &param) {
    switch (tag_type(param.tag)) {
    case KM_ENUM:
    case KM_ENUM_REP: {
        const TagInfo *info = find_tag(param.tag);
        return enum_name(info ? info->values : Enumeration::none, static_cast<uint32_t>(param.value));
    }
    case KM_DATE:
        return format_date(param.value);
    case KM_BOOL:
        return param.value ? "true" : "false";
    case KM_BYTES:
    case KM_BIGNUM:
        return std::to_string(param.bytes.size()) + (param.bytes.size() == 1 ? " byte" : " bytes");
    default:
        return std::to_string(param.value);
    }
}

std::optional<uint32_t> repeated_single_tag(const ParamSet &set) {
    for (const Param &p : set.params())
        if (!tag_repeatable(p.tag) && set.count(p.tag) > 1)
            return p.tag;
    return std::nullopt;
}

} // namespace km
