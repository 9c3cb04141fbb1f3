/*
 * param_set.cpp - serializing and parsing key parameter sets.
 */
#include "km/param_set.h"

#include <cstring>

namespace km {

namespace {
constexpr size_t kRecord = 24;

void put_u64(uint8_t *p, uint64_t v) {
    for (int i = 0; i < 8; ++i)
        p[i] = static_cast<uint8_t>(v >> (8 * i));
}
uint64_t get_u64(const uint8_t *p) {
    return uint64_t{get_u32(p)} | uint64_t{get_u32(p + 4)} << 32;
}
} // namespace

void put_u32(Bytes &out, uint32_t v) {
    for (int i = 0; i < 4; ++i)
        out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void put_lv(Bytes &out, const Bytes &data) {
    put_u32(out, static_cast<uint32_t>(data.size()));
    out.insert(out.end(), data.begin(), data.end());
}

uint32_t get_u32(const uint8_t *p) {
    return uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
}

ParamSet &ParamSet::add(uint32_t tag, uint64_t value) {
    params_.push_back(Param{tag, value, {}});
    return *this;
}

ParamSet &ParamSet::add_bytes(uint32_t tag, Bytes bytes) {
    params_.push_back(Param{tag, 0, std::move(bytes)});
    return *this;
}

ParamSet &ParamSet::add_bytes(uint32_t tag, const char *text) {
    return add_bytes(tag, Bytes(text, text + std::strlen(text)));
}

Bytes ParamSet::serialize() const {
    Bytes out;
    put_u32(out, static_cast<uint32_t>(params_.size()));
    for (const Param &p : params_) {
        uint8_t rec[kRecord] = {};
        rec[0] = static_cast<uint8_t>(p.tag);
        rec[1] = static_cast<uint8_t>(p.tag >> 8);
        rec[2] = static_cast<uint8_t>(p.tag >> 16);
        rec[3] = static_cast<uint8_t>(p.tag >> 24);
        switch (tag_type(p.tag)) {
        case 0x50000000u: // ULONG
        case 0x60000000u: // DATE
        case 0xA0000000u: // ULONG_REP
            put_u64(rec + 8, p.value);
            break;
        case 0x70000000u: // BOOL
            rec[8] = static_cast<uint8_t>(p.value);
            break;
        case 0x80000000u:
        case 0x90000000u: {
            uint32_t n = static_cast<uint32_t>(p.bytes.size());
            for (int i = 0; i < 4; ++i)
                rec[16 + i] = static_cast<uint8_t>(n >> (8 * i));
            break;
        }
        default: // ENUM, ENUM_REP, UINT, UINT_REP and anything else
            for (int i = 0; i < 4; ++i)
                rec[8 + i] = static_cast<uint8_t>(p.value >> (8 * i));
            break;
        }
        out.insert(out.end(), rec, rec + kRecord);
        if (tag_is_bytes(p.tag))
            out.insert(out.end(), p.bytes.begin(), p.bytes.end());
    }
    return out;
}

std::optional<ParamSet> ParamSet::parse(const uint8_t *data, size_t len, size_t *consumed) {
    if (len < 4)
        return std::nullopt;
    uint32_t count = get_u32(data);
    size_t pos = 4;
    ParamSet set;
    for (uint32_t i = 0; i < count; ++i) {
        if (len - pos < kRecord)
            return std::nullopt;
        const uint8_t *rec = data + pos;
        pos += kRecord;
        Param p;
        p.tag = get_u32(rec);
        switch (tag_type(p.tag)) {
        case 0x50000000u:
        case 0x60000000u:
        case 0xA0000000u:
            p.value = get_u64(rec + 8);
            break;
        case 0x70000000u:
            p.value = rec[8];
            break;
        case 0x80000000u:
        case 0x90000000u: {
            uint32_t n = get_u32(rec + 16);
            if (len - pos < n)
                return std::nullopt;
            p.bytes.assign(data + pos, data + pos + n);
            pos += n;
            break;
        }
        default:
            p.value = get_u32(rec + 8);
            break;
        }
        set.params_.push_back(std::move(p));
    }
    if (consumed)
        *consumed = pos;
    return set;
}

size_t ParamSet::count(uint32_t tag) const {
    size_t n = 0;
    for (const Param &p : params_)
        n += p.tag == tag;
    return n;
}

const Param *ParamSet::find(uint32_t tag) const {
    for (const Param &p : params_)
        if (p.tag == tag)
            return &p;
    return nullptr;
}

} // namespace km
