/*
 * param_set.h - key parameter sets as the normal world builds and reads
 * them: u32 count, then 24-byte little-endian records, each byte string
 * followed at once by its data.
 */
#ifndef KM_PARAM_SET_H
#define KM_PARAM_SET_H

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

#include "km/names.h"

namespace km {

using Bytes = std::vector<uint8_t>;

struct Param {
    uint32_t tag = 0;
    uint64_t value = 0; // enumerations, integers, dates, booleans
    Bytes bytes;        // byte strings and big numbers
};

inline bool tag_is_bytes(uint32_t tag) {
    return tag_type(tag) == 0x80000000u || tag_type(tag) == 0x90000000u;
}

class ParamSet {
  public:
    ParamSet &add(uint32_t tag, uint64_t value);
    ParamSet &add_bool(uint32_t tag) { return add(tag, 1); }
    ParamSet &add_bytes(uint32_t tag, Bytes bytes);
    ParamSet &add_bytes(uint32_t tag, const char *text);

    // serialize - the wire form.
    Bytes serialize() const;
    // parse - reads a serialized set; nullopt when it is truncated.
    // *consumed (if given) receives the bytes read.
    static std::optional<ParamSet> parse(const uint8_t *data, size_t len, size_t *consumed = nullptr);

    const std::vector<Param> &params() const { return params_; }
    size_t count(uint32_t tag) const;
    // find - the first parameter with that tag, or null.
    const Param *find(uint32_t tag) const;

  private:
    std::vector<Param> params_;
};

// Little-endian helpers for the normal world's request and response layouts.
void put_u32(Bytes &out, uint32_t v);
void put_lv(Bytes &out, const Bytes &data); // u32 length then data
uint32_t get_u32(const uint8_t *p);

} // namespace km

#endif
