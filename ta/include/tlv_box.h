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

/* Typed puts: the value's bytes in native order (strings with their NUL). */
int tlv_box_put_char(tlv_box *box, uint16_t type, char value);
int tlv_box_put_short(tlv_box *box, uint16_t type, int16_t value);
int tlv_box_put_int(tlv_box *box, uint16_t type, int32_t value);
int tlv_box_put_long(tlv_box *box, uint16_t type, int32_t value);
int tlv_box_put_longlong(tlv_box *box, uint16_t type, int64_t value);
int tlv_box_put_float(tlv_box *box, uint16_t type, float value);
int tlv_box_put_double(tlv_box *box, uint16_t type, double value);
int tlv_box_put_string(tlv_box *box, uint16_t type, const char *value);
int tlv_box_put_bytes(tlv_box *box, uint16_t type, const uint8_t *value, uint32_t length);
/* tlv_box_put_object - the nested box's serialized bytes; -1 unless it was serialized first. */
int tlv_box_put_object(tlv_box *box, uint16_t type, const tlv_box *object);

/*
 * Typed gets: a fixed-width get copies exactly its width and fails (-1)
 * when the type is absent or its stored value is shorter than the width.
 * tlv_box_get_string is tlv_box_get_bytes on a char buffer.
 */
int tlv_box_get_char(const tlv_box *box, uint16_t type, char *value);
int tlv_box_get_short(const tlv_box *box, uint16_t type, int16_t *value);
int tlv_box_get_int(const tlv_box *box, uint16_t type, int32_t *value);
int tlv_box_get_long(const tlv_box *box, uint16_t type, int32_t *value);
int tlv_box_get_longlong(const tlv_box *box, uint16_t type, int64_t *value);
int tlv_box_get_float(const tlv_box *box, uint16_t type, float *value);
int tlv_box_get_double(const tlv_box *box, uint16_t type, double *value);
int tlv_box_get_string(const tlv_box *box, uint16_t type, char *value, int32_t *length);

#endif
