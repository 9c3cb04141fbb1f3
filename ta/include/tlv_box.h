/*
 * tlv_box.h - the tagged-value container of the provisioning TA's answers:
 * a run of entries, each a u16 type, a u16 length and that many bytes,
 * little-endian, with no header or padding. Every operation returns 0 for
 * success and -1 for failure unless said otherwise.
 *
 * A box is open (entries may be added) until it is serialized; a box made
 * by tlv_box_parse is frozen from birth. Values may hold key material:
 * every buffer of a box is wiped before it is freed.
 */
#ifndef TLV_BOX_H
#define TLV_BOX_H

#include <cstdint>
#include <cstring>
#include <type_traits>

#include "key_list.h"

/* tlv_entry_t - one stored value: a private copy of the caller's bytes. */
struct tlv_entry_t {
    uint16_t type;
    uint16_t length;
    uint8_t *value;
};

struct tlv_box {
    key_list *entries;        // keyed by type; owns each tlv_entry_t
    uint8_t *serialized;      // present once frozen
    uint32_t serialized_size; // sum of 4 + length over the entries, or the parsed length
};

/* The largest value one entry can carry. */
constexpr uint32_t kTlvMaxValue = 0xFFFF;

/* tlv_box_create - a new empty open box, or null (logged) when memory is short. */
tlv_box *tlv_box_create();

/*
 * tlv_box_parse - a new frozen box holding every entry of the buffer, the
 * first occurrence of a repeated type winning. Null when memory is short or
 * when the last entry's header or value runs past the buffer's end (the
 * whole buffer is refused). The caller destroys the box.
 */
tlv_box *tlv_box_parse(const uint8_t *buffer, uint32_t length);

/* tlv_box_destroy - releases every entry, the serialized buffer and the box; null is ignored. Always 0. */
int tlv_box_destroy(tlv_box *box);

/* tlv_box_putobject - adds a copy of the bytes under type; -1 when frozen, duplicate, too long or out of memory. */
int tlv_box_putobject(tlv_box *box, uint16_t type, const void *value, uint32_t length);

/* tlv_box_serialize - renders the entries (newest first) into the box's own buffer and freezes it. */
int tlv_box_serialize(tlv_box *box);

/* tlv_box_get_buffer, tlv_box_get_size - the serialized buffer (null until frozen) and size; the box owns it. */
const uint8_t *tlv_box_get_buffer(const tlv_box *box);
uint32_t tlv_box_get_size(const tlv_box *box);

/*
 * tlv_box_get_bytes - copies the value of type into dest. *length is the
 * capacity in and the value length out. A capacity below the value length
 * fails and leaves dest untouched; otherwise the whole capacity is zeroed
 * before the copy.
 */
int tlv_box_get_bytes(const tlv_box *box, uint16_t type, uint8_t *dest, int32_t *length);

/* tlv_box_get_bytes_ptr - a pointer into the box's copy of the value, valid until the box is destroyed. */
int tlv_box_get_bytes_ptr(const tlv_box *box, uint16_t type, const uint8_t **value, uint32_t *length);

/* tlv_box_get_object - the value parsed as a nested box, which the caller destroys. */
int tlv_box_get_object(const tlv_box *box, uint16_t type, tlv_box **object);

/* Typed puts: strings with their NUL, runs of bytes, nested boxes. */
int tlv_box_put_string(tlv_box *box, uint16_t type, const char *value);
int tlv_box_put_bytes(tlv_box *box, uint16_t type, const uint8_t *value, uint32_t length);
/* tlv_box_put_object - the nested box's serialized bytes; -1 unless it was serialized first. */
int tlv_box_put_object(tlv_box *box, uint16_t type, const tlv_box *object);

/*
 * tlv_box_put_value / tlv_box_get_value - the fixed-width kinds (char,
 * short, int, long as 32 bits, long long, float, double): the value's
 * bytes in native order. A get copies exactly sizeof(T) bytes and fails
 * (-1) when the type is absent or its stored value is shorter.
 */
template <typename T>
requires std::is_arithmetic_v<T>
int tlv_box_put_value(tlv_box *box, uint16_t type, T value) {
    return tlv_box_putobject(box, type, &value, sizeof(T));
}
template <typename T>
requires std::is_arithmetic_v<T>
int tlv_box_get_value(const tlv_box *box, uint16_t type, T *value) {
    const uint8_t *stored = nullptr;
    uint32_t length = 0;
    if (!value || tlv_box_get_bytes_ptr(box, type, &stored, &length) != 0 || length < sizeof(T))
        return -1;
    std::memcpy(value, stored, sizeof(T));
    return 0;
}
/* tlv_box_get_string - tlv_box_get_bytes on a char buffer. */
int tlv_box_get_string(const tlv_box *box, uint16_t type, char *value, int32_t *length);

#endif
