/*
 * json_writer.cpp - the SOTER documents' JSON writer and the UTF-8 check.
 */
#include "json_writer.h"

#include <cstring>

#include "ta_heap.h"
#include "ta_log.h"

enum json_kind_t : uint8_t { JSON_STRING = 1, JSON_NUMBER = 2 };

struct json_member_t {
    char *name;
    json_kind_t kind;
    char *string;
    double number;
};

namespace {

// --- UTF-8 ------------------------------------------------------------------------

// Length of the sequence a lead byte starts, 0 for a byte that cannot lead.
uint32_t utf8_sequence_length(uint8_t lead) {
    if (lead <= 0x7F)
        return 1;
    if (lead >= 0xC2 && lead <= 0xDF)
        return 2;
    if (lead >= 0xE0 && lead <= 0xEF)
        return 3;
    if (lead >= 0xF0 && lead <= 0xF4)
        return 4;
    return 0;
}

// --- Strings ----------------------------------------------------------------------

char *copy_text(const char *text, uint32_t len) {
    if (len == UINT32_MAX)
        return nullptr;
    auto *copy = static_cast<char *>(ta_malloc(len + 1));
    if (copy && len)
        std::memcpy(copy, text, len);
    return copy;
}

// A C string's length, refused (false) when it would not fit 32 bits.
bool text_length(const char *text, uint32_t *len) {
    size_t n = std::strlen(text);
    if (n >= UINT32_MAX)
        return false;
    *len = static_cast<uint32_t>(n);
    return true;
}

bool valid_text(const char *text, uint32_t *len) {
    return text && text_length(text, len) && utf8_is_valid(reinterpret_cast<const uint8_t *>(text), *len);
}

// --- Output -----------------------------------------------------------------------

// sink - counts bytes, and writes them too when it has a buffer.
struct sink {
    char *buf;
    uint32_t cap;
    uint32_t pos;
    bool failed;

    void put(char c) {
        if (failed)
            return;
        if (pos == UINT32_MAX || (buf && pos >= cap)) {
            failed = true;
            return;
        }
        if (buf)
            buf[pos] = c;
        ++pos;
    }
    void put(const char *s, uint32_t n) {
        for (uint32_t i = 0; i < n; ++i)
            put(s[i]);
    }
};

void render_string(sink *out, const char *s) {
    out->put('"');
    for (const char *p = s; *p; ++p) {
        char esc = 0;
        switch (*p) {
        case '"':
            esc = '"';
            break;
        case '\\':
            esc = '\\';
            break;
        case '/':
            esc = '/';
            break;
        case '\b':
            esc = 'b';
            break;
        case '\f':
            esc = 'f';
            break;
        case '\n':
            esc = 'n';
            break;
        case '\r':
            esc = 'r';
            break;
        case '\t':
            esc = 't';
            break;
        default:
            break;
        }
        if (esc) {
            out->put('\\');
            out->put(esc);
        } else {
            out->put(*p);
        }
    }
    out->put('"');
}

// --- Numbers ----------------------------------------------------------------------
//
// A finite double is m * 2^e with m below 2^53. Rendering it exactly needs
// integers up to 2^1024 (and m * 10^6 for the fraction), so a small
// fixed-size big integer does the arithmetic; no libc formatting exists in
// the TA, and this gives the bytes "%lld" and "%f" would.

struct big_uint {
    static constexpr uint32_t kLimbs = 36; // 1152 bits
    uint32_t limb[kLimbs];
    uint32_t used; // limbs in use; the top one is nonzero unless used == 0

    void set(uint64_t v) {
        std::memset(limb, 0, sizeof limb);
        limb[0] = static_cast<uint32_t>(v);
        limb[1] = static_cast<uint32_t>(v >> 32);
        used = 2;
        trim();
    }
    void trim() {
        while (used && limb[used - 1] == 0)
            --used;
    }
    bool zero() const { return used == 0; }
    void mul_small(uint32_t f) {
        uint64_t carry = 0;
        for (uint32_t i = 0; i < used; ++i) {
            uint64_t t = uint64_t{limb[i]} * f + carry;
            limb[i] = static_cast<uint32_t>(t);
            carry = t >> 32;
        }
        if (carry && used < kLimbs)
            limb[used++] = static_cast<uint32_t>(carry);
    }
    void add_one() {
        for (uint32_t i = 0; i < kLimbs; ++i) {
            if (++limb[i] != 0) {
                if (i >= used)
                    used = i + 1;
                return;
            }
        }
    }
    bool bit(uint32_t n) const { return n / 32 < used && (limb[n / 32] >> (n % 32)) & 1u; }
    // any_below - whether any of the n lowest bits is set.
    bool any_below(uint32_t n) const {
        for (uint32_t i = 0; i < n; ++i)
            if (bit(i))
                return true;
        return false;
    }
    void shift_left(uint32_t n) {
        uint32_t words = n / 32;
        uint32_t bits = n % 32;
        for (int32_t i = static_cast<int32_t>(kLimbs) - 1; i >= 0; --i) {
            int32_t src = i - static_cast<int32_t>(words);
            uint32_t hi = src >= 0 ? limb[src] << bits : 0;
            uint32_t lo = (bits && src >= 1) ? limb[src - 1] >> (32 - bits) : 0;
            limb[i] = hi | lo;
        }
        used = kLimbs;
        trim();
    }
    void shift_right(uint32_t n) {
        uint32_t words = n / 32;
        uint32_t bits = n % 32;
        for (uint32_t i = 0; i < kLimbs; ++i) {
            uint32_t src = i + words;
            uint32_t lo = src < kLimbs ? limb[src] >> bits : 0;
            uint32_t hi = (bits && src + 1 < kLimbs) ? limb[src + 1] << (32 - bits) : 0;
            limb[i] = lo | hi;
        }
        trim();
    }
    uint32_t divmod_small(uint32_t d) {
        uint64_t rem = 0;
        for (int32_t i = static_cast<int32_t>(used) - 1; i >= 0; --i) {
            uint64_t cur = rem << 32 | limb[i];
            limb[i] = static_cast<uint32_t>(cur / d);
            rem = cur % d;
        }
        trim();
        return static_cast<uint32_t>(rem);
    }
};

// Decimal digits of v, most significant first, at least min_digits long
// (zero-padded); v is consumed. Returns the count written into digits.
uint32_t decimal_digits(big_uint *v, char *digits, uint32_t cap, uint32_t min_digits) {
    char reversed[360] = {};
    uint32_t n = 0;
    while ((!v->zero() || n < min_digits || n == 0) && n < sizeof reversed)
        reversed[n++] = static_cast<char>('0' + v->divmod_small(10));
    if (n > cap)
        return 0;
    for (uint32_t i = 0; i < n; ++i)
        digits[i] = reversed[n - 1 - i];
    return n;
}

// Formats a finite number; false for infinity and NaN.
bool render_number(sink *out, double value) {
    uint64_t bits = 0;
    std::memcpy(&bits, &value, sizeof bits);
    bool negative = bits >> 63;
    uint32_t exponent = static_cast<uint32_t>(bits >> 52) & 0x7FF;
    uint64_t mantissa = bits & ((uint64_t{1} << 52) - 1);
    if (exponent == 0x7FF)
        return false;
    int32_t e = -1074;
    if (exponent != 0) {
        mantissa |= uint64_t{1} << 52;
        e = static_cast<int32_t>(exponent) - 1075;
    }
    big_uint v{};
    v.set(mantissa);
    char digits[360] = {};
    uint32_t n = 0;
    bool integral =
        e >= 0 || (static_cast<uint32_t>(-e) >= 53 ? mantissa == 0 : !v.any_below(static_cast<uint32_t>(-e)));
    if (integral) {
        if (e >= 0)
            v.shift_left(static_cast<uint32_t>(e));
        else
            v.shift_right(static_cast<uint32_t>(-e));
        // -0.0 equals the integer 0 and renders as "0".
        if (negative && !v.zero())
            out->put('-');
        n = decimal_digits(&v, digits, sizeof digits, 1);
        if (n == 0)
            return false;
        out->put(digits, n);
        return true;
    }
    // value * 10^6 rounded to the nearest integer, ties to even.
    uint32_t k = static_cast<uint32_t>(-e);
    v.mul_small(1000000);
    bool half_bit = v.bit(k - 1);
    bool below_half = v.any_below(k - 1);
    v.shift_right(k);
    if (half_bit && (below_half || v.bit(0)))
        v.add_one();
    if (negative)
        out->put('-');
    n = decimal_digits(&v, digits, sizeof digits, 7);
    if (n < 7)
        return false;
    out->put(digits, n - 6);
    out->put('.');
    out->put(digits + n - 6, 6);
    return true;
}

bool render_doc(sink *out, const json_doc *doc) {
    out->put('{');
    for (uint32_t i = 0; i < doc->count; ++i) {
        const json_member_t &m = doc->members[i];
        if (i)
            out->put(',');
        render_string(out, m.name);
        out->put(':');
        if (m.kind == JSON_STRING)
            render_string(out, m.string);
        else if (!render_number(out, m.number))
            return false;
    }
    out->put('}');
    return !out->failed;
}

// Whether two NUL-terminated names are the same (no strcmp in a TEE's C library).
bool same_name(const char *a, const char *b) {
    while (*a && *a == *b) {
        ++a;
        ++b;
    }
    return *a == *b;
}

// Finds the member or appends a new one named name; null when full or out of memory.
json_member_t *member_for(json_doc *doc, const char *name, uint32_t name_len) {
    for (uint32_t i = 0; i < doc->count; ++i)
        if (same_name(doc->members[i].name, name))
            return &doc->members[i];
    if (doc->count == doc->capacity) {
        if (doc->capacity >= kJsonMaxMembers)
            return nullptr;
        uint32_t grown = doc->capacity * 2 > 15 ? doc->capacity * 2 : 15;
        if (grown > kJsonMaxMembers)
            grown = kJsonMaxMembers;
        auto *members = static_cast<json_member_t *>(ta_malloc(grown * sizeof(json_member_t)));
        if (!members)
            return nullptr;
        if (doc->count)
            std::memcpy(members, doc->members, doc->count * sizeof(json_member_t));
        ta_free(doc->members);
        doc->members = members;
        doc->capacity = grown;
    }
    char *copy = copy_text(name, name_len);
    if (!copy)
        return nullptr;
    json_member_t *m = &doc->members[doc->count++];
    m->name = copy;
    m->kind = JSON_NUMBER;
    m->string = nullptr;
    m->number = 0;
    return m;
}

// Sets a member to a string (when text is given) or a number.
int set_member(json_doc *doc, const char *name, const char *text, double number) {
    uint32_t name_len = 0;
    uint32_t text_len = 0;
    if (!doc || !valid_text(name, &name_len))
        return -1;
    char *copy = nullptr;
    if (text) {
        if (!valid_text(text, &text_len))
            return -1;
        copy = copy_text(text, text_len);
        if (!copy)
            return -1;
    }
    json_member_t *m = member_for(doc, name, name_len);
    if (!m) {
        ta_free(copy);
        return -1;
    }
    ta_free(m->string);
    m->kind = text ? JSON_STRING : JSON_NUMBER;
    m->string = copy;
    m->number = text ? 0 : number;
    return 0;
}

bool finite(double value) {
    uint64_t bits = 0;
    std::memcpy(&bits, &value, sizeof bits);
    return ((bits >> 52) & 0x7FF) != 0x7FF;
}

} // namespace

int utf8_is_valid(const uint8_t *buf, uint32_t length) {
    if (!buf && length)
        return 0;
    uint32_t i = 0;
    while (i < length) {
        uint32_t n = utf8_sequence_length(buf[i]);
        if (n == 0 || n > length - i)
            return 0;
        uint32_t cp = n == 1 ? buf[i] : buf[i] & (0x7Fu >> n);
        for (uint32_t j = 1; j < n; ++j) {
            if ((buf[i + j] & 0xC0) != 0x80)
                return 0;
            cp = cp << 6 | (buf[i + j] & 0x3F);
        }
        if ((n == 3 && cp < 0x800) || (n == 4 && cp < 0x10000) || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
            return 0;
        i += n;
    }
    return 1;
}

json_doc *json_doc_create() {
    return static_cast<json_doc *>(ta_malloc(sizeof(json_doc)));
}

int json_doc_set_string(json_doc *doc, const char *name, const char *value) {
    if (!value)
        return -1;
    return set_member(doc, name, value, 0);
}

int json_doc_set_number(json_doc *doc, const char *name, double value) {
    if (!finite(value))
        return -1;
    return set_member(doc, name, nullptr, value);
}

char *json_doc_render(const json_doc *doc) {
    if (!doc)
        return nullptr;
    sink measure{nullptr, 0, 0, false};
    if (!render_doc(&measure, doc) || measure.pos == UINT32_MAX)
        return nullptr;
    uint32_t size = measure.pos + 1;
    auto *text = static_cast<char *>(ta_malloc(size));
    if (!text)
        return nullptr;
    sink out{text, measure.pos, 0, false};
    if (!render_doc(&out, doc) || out.pos != measure.pos) {
        ta_free(text);
        return nullptr;
    }
    text[out.pos] = '\0';
    return text;
}

void json_doc_free_text(char *text) {
    ta_free(text);
}

void json_doc_free(json_doc *doc) {
    if (!doc)
        return;
    for (uint32_t i = 0; i < doc->count; ++i) {
        ta_free(doc->members[i].name);
        ta_free(doc->members[i].string);
    }
    ta_free(doc->members);
    ta_free(doc);
}
