/*
 * tlv_box_fuzz.cpp - the TLV box against a model of its format. A buffer
 * parses exactly when it is a whole run of entries; the box then answers
 * every type with its first occurrence (by pointer, by copy with the
 * capacity rules, as a fixed-width value, as a nested box), refuses
 * changes, and a box written from the same entries serializes them newest
 * first and parses back to them.
 */
#include <cstring>
#include <map>

#include "fuzz_support.h"
#include "tlv_box.h"

namespace {

struct BoxFree {
    void operator()(tlv_box *b) const { tlv_box_destroy(b); }
};
using Box = std::unique_ptr<tlv_box, BoxFree>;

// The model: the entries of a whole run, first occurrence per type; false
// when an entry's header or value runs past the end.
bool model_parse(const Bytes &buf, std::map<uint16_t, Bytes> *entries, std::vector<uint16_t> *order) {
    size_t pos = 0;
    while (pos < buf.size()) {
        if (buf.size() - pos < 4)
            return false;
        const uint16_t type = static_cast<uint16_t>(buf[pos] | buf[pos + 1] << 8);
        const size_t len = static_cast<size_t>(buf[pos + 2] | buf[pos + 3] << 8);
        pos += 4;
        if (buf.size() - pos < len)
            return false;
        if (!entries->count(type)) {
            (*entries)[type] = Bytes(buf.begin() + static_cast<long>(pos), buf.begin() + static_cast<long>(pos + len));
            order->push_back(type);
        }
        pos += len;
    }
    return true;
}

void check_lookups(const tlv_box *box, const std::map<uint16_t, Bytes> &entries, FuzzInput &in) {
    for (const auto &[type, value] : entries) {
        const uint8_t *p = nullptr;
        uint32_t len = 0;
        FUZZ_CHECK(tlv_box_get_bytes_ptr(box, type, &p, &len) == 0 && len == value.size() &&
                       (len == 0 || std::memcmp(p, value.data(), len) == 0),
                   "type 0x%04x: value differs", type);
        // A capacity one short fails and leaves the destination alone.
        Bytes dest(value.size() + 3, 0x5A);
        int32_t cap = static_cast<int32_t>(value.size()) - 1;
        if (cap >= 0) {
            FUZZ_CHECK(tlv_box_get_bytes(box, type, dest.data(), &cap) == -1, "type 0x%04x: short capacity taken",
                       type);
            for (uint8_t b : dest)
                FUZZ_CHECK(b == 0x5A, "type 0x%04x: a refused copy wrote", type);
        }
        cap = static_cast<int32_t>(dest.size());
        FUZZ_CHECK(tlv_box_get_bytes(box, type, dest.data(), &cap) == 0 && cap == static_cast<int32_t>(value.size()),
                   "type 0x%04x: copy refused", type);
        FUZZ_CHECK((value.empty() || std::memcmp(dest.data(), value.data(), value.size()) == 0) &&
                       dest[value.size()] == 0 && dest[value.size() + 2] == 0,
                   "type 0x%04x: copy or zero fill wrong", type);
        int32_t i32 = 0;
        const int got = tlv_box_get_value(box, type, &i32);
        FUZZ_CHECK(got == (value.size() >= 4 ? 0 : -1), "type 0x%04x: int get of %zu bytes gave %d", type, value.size(),
                   got);
        if (got == 0)
            FUZZ_CHECK(std::memcmp(&i32, value.data(), 4) == 0, "type 0x%04x: int differs", type);
    }
    // A type the input names: absent ones fail every get.
    const uint16_t other = in.u16();
    if (!entries.count(other)) {
        const uint8_t *p = nullptr;
        uint32_t len = 0;
        uint8_t c = 0;
        FUZZ_CHECK(tlv_box_get_bytes_ptr(box, other, &p, &len) == -1 &&
                       tlv_box_get_value(box, other, reinterpret_cast<char *>(&c)) == -1,
                   "absent type 0x%04x found", other);
    }
    // One value read as a nested box, parsed by the same rules.
    if (!entries.empty()) {
        auto it = entries.begin();
        std::advance(it, in.below(static_cast<uint32_t>(entries.size())));
        std::map<uint16_t, Bytes> inner;
        std::vector<uint16_t> inner_order;
        const bool whole = model_parse(it->second, &inner, &inner_order);
        tlv_box *nested = nullptr;
        const int got = tlv_box_get_object(box, it->first, &nested);
        Box owned(nested);
        FUZZ_CHECK((got == 0) == whole, "type 0x%04x: nested box %d, model %d", it->first, got, whole);
    }
}

// A box put together from the entries serializes them newest first and parses back.
void check_writer(const std::map<uint16_t, Bytes> &entries, const std::vector<uint16_t> &order) {
    Box box(tlv_box_create());
    FUZZ_CHECK(box != nullptr, "tlv_box_create failed");
    uint32_t size = 0;
    for (uint16_t type : order) {
        const Bytes &v = entries.at(type);
        FUZZ_CHECK(tlv_box_put_bytes(box.get(), type, v.data(), static_cast<uint32_t>(v.size())) == 0,
                   "put of type 0x%04x refused", type);
        size += 4 + static_cast<uint32_t>(v.size());
    }
    if (!order.empty()) {
        const uint8_t one = 1;
        FUZZ_CHECK(tlv_box_put_bytes(box.get(), order.front(), &one, 1) == -1, "a duplicate type was put");
    }
    FUZZ_CHECK(tlv_box_get_size(box.get()) == size, "serialized size %u, expected %u", tlv_box_get_size(box.get()),
               size);
    FUZZ_CHECK(tlv_box_serialize(box.get()) == 0, "serialize failed");
    Bytes expected;
    for (auto it = order.rbegin(); it != order.rend(); ++it) {
        const Bytes &v = entries.at(*it);
        expected.push_back(static_cast<uint8_t>(*it));
        expected.push_back(static_cast<uint8_t>(*it >> 8));
        expected.push_back(static_cast<uint8_t>(v.size()));
        expected.push_back(static_cast<uint8_t>(v.size() >> 8));
        expected.insert(expected.end(), v.begin(), v.end());
    }
    const uint8_t *buf = tlv_box_get_buffer(box.get());
    FUZZ_CHECK(tlv_box_get_size(box.get()) == expected.size() &&
                   (expected.empty() || std::memcmp(buf, expected.data(), expected.size()) == 0),
               "serialized entries differ");
    FUZZ_CHECK(tlv_box_serialize(box.get()) == -1, "a box serialized twice");
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    HeapScope heap;
    FuzzInput in(data, size);
    const Bytes control = in.bytes(4);
    const Bytes buf = in.rest();
    FuzzInput choices(control.data(), control.size());

    std::map<uint16_t, Bytes> entries;
    std::vector<uint16_t> order;
    const bool whole = model_parse(buf, &entries, &order);
    Box box(tlv_box_parse(buf.empty() ? nullptr : buf.data(), static_cast<uint32_t>(buf.size())));
    FUZZ_CHECK((box != nullptr) == whole, "parse %s a buffer the model %s", box ? "took" : "refused",
               whole ? "takes" : "refuses");
    if (!box)
        return 0;
    FUZZ_CHECK(tlv_box_get_size(box.get()) == buf.size() &&
                   (buf.empty() || std::memcmp(tlv_box_get_buffer(box.get()), buf.data(), buf.size()) == 0),
               "a parsed box does not keep its buffer");
    const uint8_t one = 1;
    FUZZ_CHECK(tlv_box_put_bytes(box.get(), 0x1234, &one, 1) == -1 && tlv_box_serialize(box.get()) == -1,
               "a parsed box is not frozen");
    check_lookups(box.get(), entries, choices);
    check_writer(entries, order);
    return 0;
}
