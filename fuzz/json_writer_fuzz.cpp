/*
 * json_writer_fuzz.cpp - UTF-8 validation and the JSON writer against
 * models of their own. utf8_is_valid agrees with the Unicode table of
 * well-formed byte sequences; a document built by a run of sets refuses
 * exactly the invalid names and values (and new names past the member
 * limit), keeps the order names were first set, and renders byte for byte
 * as the writer's rules say, numbers as "%lld" or "%f" would.
 */
#include <cmath>
#include <cstdio>
#include <cstring>
#include <string>

#include "fuzz_support.h"
#include "json_writer.h"

namespace {

// Well-formed UTF-8 by the Unicode standard's table of byte ranges.
bool utf8_model(const uint8_t *p, size_t n) {
    size_t i = 0;
    auto in = [&](size_t k, uint8_t lo, uint8_t hi) { return i + k < n && p[i + k] >= lo && p[i + k] <= hi; };
    while (i < n) {
        const uint8_t b = p[i];
        size_t len = 0;
        if (b <= 0x7F)
            len = 1;
        else if (b >= 0xC2 && b <= 0xDF)
            len = in(1, 0x80, 0xBF) ? 2 : 0;
        else if (b == 0xE0)
            len = in(1, 0xA0, 0xBF) && in(2, 0x80, 0xBF) ? 3 : 0;
        else if ((b >= 0xE1 && b <= 0xEC) || b == 0xEE || b == 0xEF)
            len = in(1, 0x80, 0xBF) && in(2, 0x80, 0xBF) ? 3 : 0;
        else if (b == 0xED)
            len = in(1, 0x80, 0x9F) && in(2, 0x80, 0xBF) ? 3 : 0;
        else if (b == 0xF0)
            len = in(1, 0x90, 0xBF) && in(2, 0x80, 0xBF) && in(3, 0x80, 0xBF) ? 4 : 0;
        else if (b >= 0xF1 && b <= 0xF3)
            len = in(1, 0x80, 0xBF) && in(2, 0x80, 0xBF) && in(3, 0x80, 0xBF) ? 4 : 0;
        else if (b == 0xF4)
            len = in(1, 0x80, 0x8F) && in(2, 0x80, 0xBF) && in(3, 0x80, 0xBF) ? 4 : 0;
        if (len == 0)
            return false;
        i += len;
    }
    return true;
}

void render_string(std::string *out, const std::string &s) {
    *out += '"';
    for (char c : s) {
        switch (c) {
        case '"':
            *out += "\\\"";
            break;
        case '\\':
            *out += "\\\\";
            break;
        case '/':
            *out += "\\/";
            break;
        case '\b':
            *out += "\\b";
            break;
        case '\f':
            *out += "\\f";
            break;
        case '\n':
            *out += "\\n";
            break;
        case '\r':
            *out += "\\r";
            break;
        case '\t':
            *out += "\\t";
            break;
        default:
            *out += c;
        }
    }
    *out += '"';
}

std::string render_number(double v) {
    char buf[400];
    if (std::trunc(v) == v) {
        if (std::fabs(v) < 9223372036854775808.0)
            std::snprintf(buf, sizeof buf, "%lld", static_cast<long long>(v));
        else
            std::snprintf(buf, sizeof buf, "%.0f", v); // exact in glibc
    } else {
        std::snprintf(buf, sizeof buf, "%f", v);
    }
    return buf;
}

struct Member {
    std::string name;
    bool is_string;
    std::string text;
    double number;
};

// A NUL-terminated text from the input: up to 24 bytes, cut at the first NUL.
std::string text(FuzzInput &in) {
    Bytes b = in.bytes(in.below(25));
    std::string s(b.begin(), b.end());
    return s.substr(0, s.find('\0'));
}

// Names from a small pool (so members are set again) or from the input.
std::string name(FuzzInput &in) {
    static const char *const pool[] = {"raw", "fid", "counter", "uid", "pub_key", "a/b", "\xc3\xa9", ""};
    const uint8_t pick = in.u8();
    if (pick < 0xC0)
        return pool[pick % 8];
    return text(in);
}

double number(FuzzInput &in) {
    switch (in.below(4)) {
    case 0:
        return static_cast<double>(static_cast<int32_t>(in.u32()));
    case 1:
        return static_cast<double>(in.u32()) / 1024.0;
    default: {
        const uint64_t bits = in.u64();
        double v = 0;
        std::memcpy(&v, &bits, sizeof v);
        return v;
    }
    }
}

void check_document(FuzzInput &in) {
    json_doc *doc = json_doc_create();
    FUZZ_CHECK(doc != nullptr, "json_doc_create failed");
    std::vector<Member> model;
    while (!in.empty()) {
        const uint8_t op = in.u8();
        const std::string n = name(in);
        Member m{n, (op & 1) == 0, {}, 0};
        int got = 0;
        bool valid = utf8_model(reinterpret_cast<const uint8_t *>(n.data()), n.size());
        if (m.is_string) {
            m.text = text(in);
            valid = valid && utf8_model(reinterpret_cast<const uint8_t *>(m.text.data()), m.text.size());
            got = json_doc_set_string(doc, n.c_str(), m.text.c_str());
        } else {
            m.number = number(in);
            valid = valid && std::isfinite(m.number);
            got = json_doc_set_number(doc, n.c_str(), m.number);
        }
        auto it = model.begin();
        while (it != model.end() && it->name != n)
            ++it;
        if (valid && it == model.end() && model.size() == kJsonMaxMembers)
            valid = false;
        FUZZ_CHECK(got == (valid ? 0 : -1), "set of member %s gave %d",
                   to_hex(reinterpret_cast<const uint8_t *>(n.data()), n.size()).c_str(), got);
        if (valid) {
            if (it == model.end())
                model.push_back(m);
            else
                *it = m;
        }
    }
    std::string expected = "{";
    for (size_t i = 0; i < model.size(); ++i) {
        if (i)
            expected += ',';
        render_string(&expected, model[i].name);
        expected += ':';
        if (model[i].is_string)
            render_string(&expected, model[i].text);
        else
            expected += render_number(model[i].number);
    }
    expected += '}';
    char *rendered = json_doc_render(doc);
    FUZZ_CHECK(rendered != nullptr, "render failed");
    FUZZ_CHECK(expected == rendered, "rendered %s, expected %s", rendered, expected.c_str());
    json_doc_free_text(rendered);
    json_doc_free(doc);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    if (size > UINT32_MAX)
        return 0;
    HeapScope heap;
    if (size && (data[0] & 1)) {
        const bool valid = utf8_is_valid(data + 1, static_cast<uint32_t>(size - 1)) == 1;
        FUZZ_CHECK(valid == utf8_model(data + 1, size - 1), "utf8_is_valid says %d for %s", valid,
                   to_hex(data + 1, size - 1).c_str());
        return 0;
    }
    FuzzInput in(data, size);
    in.u8();
    check_document(in);
    return 0;
}
