/*
 * param_set_fuzz.cpp - the serialized parameter set, read by unmarshal and
 * written back by marshal. Whatever unmarshal accepts:
 * - the normal world's parser reads the same records from the same bytes;
 * - marshal with hidden parameters writes exactly the bytes read, except
 *   the data-pointer slot of byte-string records, which goes out as zero,
 *   in marshal_size bytes, into its own buffer or a caller's of that size,
 *   and a caller's buffer one byte short is refused and forgotten;
 * - without hidden parameters it writes the same records minus those.
 * What unmarshal refuses leaves an empty set and nothing allocated.
 */
#include <cstring>

#include "fuzz_support.h"
#include "marshal.h"

namespace {

constexpr uint32_t kRecord = sizeof(key_param_t);
constexpr uint32_t kSlotStart = 8;
constexpr uint32_t kSlotEnd = 16;

// The serialized records of in (already known to parse), as (offset, data length).
struct Record {
    size_t at;
    uint32_t data_len;
    uint32_t tag;
};
std::vector<Record> records_of(const uint8_t *in, uint32_t count) {
    std::vector<Record> out;
    size_t pos = 4;
    for (uint32_t i = 0; i < count; ++i) {
        Record r{pos, 0, get_u32le(in + pos)};
        if (key_tag_is_blob(r.tag))
            r.data_len = get_u32le(in + pos + 16);
        out.push_back(r);
        pos += kRecord + r.data_len;
    }
    return out;
}

// Whether out holds the records of in (those kept) as marshal must write them.
void check_written(const uint8_t *in, const std::vector<Record> &recs, const uint8_t *out, uint32_t out_len,
                   bool include_hidden) {
    uint32_t kept = 0;
    for (const Record &r : recs)
        kept += include_hidden || !is_hidden_param(r.tag);
    FUZZ_CHECK(out_len >= 4 && get_u32le(out) == kept, "marshal wrote count %u, expected %u",
               out_len >= 4 ? get_u32le(out) : 0, kept);
    size_t pos = 4;
    for (const Record &r : recs) {
        if (!include_hidden && is_hidden_param(r.tag))
            continue;
        const size_t n = kRecord + r.data_len;
        FUZZ_CHECK(pos + n <= out_len, "marshal output ends inside record of tag 0x%08x", r.tag);
        const uint8_t *w = out + pos;
        const uint8_t *src = in + r.at;
        if (key_tag_is_blob(r.tag)) {
            for (uint32_t i = kSlotStart; i < kSlotEnd; ++i)
                FUZZ_CHECK(w[i] == 0, "pointer slot byte %u of tag 0x%08x written as 0x%02x", i, r.tag, w[i]);
            FUZZ_CHECK(std::memcmp(w, src, kSlotStart) == 0 &&
                           std::memcmp(w + kSlotEnd, src + kSlotEnd, n - kSlotEnd) == 0,
                       "record of tag 0x%08x changed by the round trip", r.tag);
        } else {
            FUZZ_CHECK(std::memcmp(w, src, kRecord) == 0, "record of tag 0x%08x changed by the round trip", r.tag);
        }
        pos += n;
    }
    FUZZ_CHECK(pos == out_len, "marshal wrote %u bytes for %zu", out_len, pos);
}

void check_round_trip(const uint8_t *data, size_t consumed, const keymaster_key_param_set_t &set) {
    const std::vector<Record> recs = records_of(data, set.length);
    for (bool hidden : {true, false}) {
        const uint32_t size = marshal_size(&set, hidden);
        uint8_t *buf = nullptr;
        uint32_t len = 0;
        TEE_Result res = marshal(&set, hidden, &buf, &len);
        FUZZ_CHECK(res == TEE_SUCCESS, "marshal of an unmarshalled set failed: 0x%08x", res);
        FUZZ_CHECK(len == size, "marshal wrote %u bytes, marshal_size says %u", len, size);
        if (hidden)
            FUZZ_CHECK(len == consumed, "marshal wrote %u bytes of %zu read", len, consumed);
        check_written(data, recs, buf, len, hidden);

        // The same into a caller's buffer of exactly that size, then one byte short.
        Bytes mine(size + 1, 0xEE);
        uint8_t *at = mine.data();
        uint32_t cap = size;
        res = marshal(&set, hidden, &at, &cap);
        FUZZ_CHECK(res == TEE_SUCCESS && cap == size && at == mine.data() && std::memcmp(mine.data(), buf, size) == 0,
                   "marshal into a caller's buffer differs: 0x%08x", res);
        FUZZ_CHECK(mine[size] == 0xEE, "marshal wrote past the caller's capacity");
        at = mine.data();
        cap = size - 1;
        res = marshal(&set, hidden, &at, &cap);
        FUZZ_CHECK(res == TEE_ERROR_SHORT_BUFFER && at == nullptr && cap == 0,
                   "marshal into a buffer one byte short: 0x%08x", res);
        ta_free(buf);
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    if (size > UINT32_MAX)
        return 0;
    HeapScope heap;
    keymaster_key_param_set_t set{};
    const TEE_Result res = unmarshal(data, static_cast<uint32_t>(size), &set);
    size_t consumed = 0;
    const auto client = km::ParamSet::parse(data, size, &consumed);
    if (res != TEE_SUCCESS) {
        FUZZ_CHECK(set.params == nullptr && set.length == 0, "a refused set is not left empty");
        // Only what the normal world cannot read either, or what does not fit the TA's heap.
        FUZZ_CHECK(!client || res == TEE_ERROR_OUT_OF_MEMORY, "unmarshal refused a readable set: 0x%08x", res);
        return 0;
    }
    FUZZ_CHECK(client.has_value(), "unmarshal accepted a set the normal world cannot read");
    FUZZ_CHECK(client->params().size() == set.length, "unmarshal read %u records, the normal world %zu", set.length,
               client->params().size());
    for (uint32_t i = 0; i < set.length; ++i) {
        const key_param_t &p = set.params[i];
        const km::Param &c = client->params()[i];
        FUZZ_CHECK(p.tag == c.tag, "record %u: tag 0x%08x, the normal world reads 0x%08x", i, p.tag, c.tag);
        if (key_tag_is_blob(p.tag))
            FUZZ_CHECK(p.blob.data && p.blob.data_length == c.bytes.size() &&
                           (c.bytes.empty() || std::memcmp(p.blob.data, c.bytes.data(), c.bytes.size()) == 0),
                       "record %u: byte string differs", i);
    }
    check_round_trip(data, consumed, set);
    key_param_set_release(&set);
    return 0;
}
