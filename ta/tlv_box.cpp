/*
 * tlv_box.cpp - the TLV box: parsing the provisioning TA's answers and
 * writing boxes of the same format.
 */
#include "tlv_box.h"

#include "byte_io.h"
#include "ta_heap.h"
#include "ta_log.h"

namespace {

void entry_release(void *value) {
    auto *entry = static_cast<tlv_entry_t *>(value);
    if (!entry)
        return;
    ta_free_wiped(entry->value, entry->length);
    ta_free(entry);
}

const tlv_entry_t *find_entry(const tlv_box *box, uint16_t type) {
    void *value = nullptr;
    if (!box || key_list_get(box->entries, type, &value) != 0)
        return nullptr;
    return static_cast<const tlv_entry_t *>(value);
}

} // namespace

tlv_box *tlv_box_create() {
    auto *box = ta_new<tlv_box>();
    if (!box)
        return nullptr;
    box->entries = key_list_create(entry_release);
    if (!box->entries) {
        ta_free(box);
        return nullptr;
    }
    box->serialized = nullptr;
    box->serialized_size = 0;
    return box;
}

tlv_box *tlv_box_parse(const uint8_t *buffer, uint32_t length) {
    if (!buffer && length)
        return nullptr;
    tlv_box *box = tlv_box_create();
    if (!box)
        return nullptr;
    auto *copy = static_cast<uint8_t *>(ta_malloc_logged(length));
    if (!copy) {
        tlv_box_destroy(box);
        return nullptr;
    }
    if (length)
        std::memcpy(copy, buffer, length);
    byte_reader in(copy, length);
    while (in.remaining() > 0) {
        const uint8_t *header = nullptr;
        const uint8_t *value = nullptr;
        if (!in.read_bytes(4, &header)) {
            KM_ERR("Truncated TLV entry header");
            ta_free_wiped(copy, length);
            tlv_box_destroy(box);
            return nullptr;
        }
        uint16_t type = static_cast<uint16_t>(header[0] | header[1] << 8);
        uint16_t value_len = static_cast<uint16_t>(header[2] | header[3] << 8);
        if (!in.read_bytes(value_len, &value)) {
            KM_ERR("Truncated TLV entry 0x%x", type);
            ta_free_wiped(copy, length);
            tlv_box_destroy(box);
            return nullptr;
        }
        // A repeated type is refused by the list: the first occurrence wins,
        // and a failed allocation loses that entry only.
        (void)tlv_box_putobject(box, type, value, value_len);
    }
    box->serialized = copy;
    box->serialized_size = length;
    return box;
}

int tlv_box_destroy(tlv_box *box) {
    if (!box)
        return 0;
    key_list_destroy(box->entries);
    ta_free_wiped(box->serialized, box->serialized_size);
    ta_free(box);
    return 0;
}

int tlv_box_putobject(tlv_box *box, uint16_t type, const void *value, uint32_t length) {
    if (!box || box->serialized || length > kTlvMaxValue || (!value && length))
        return -1;
    if (box->serialized_size > UINT32_MAX - 4 - length)
        return -1;
    auto *entry = ta_new<tlv_entry_t>();
    if (!entry)
        return -1;
    entry->type = type;
    entry->length = static_cast<uint16_t>(length);
    entry->value = static_cast<uint8_t *>(ta_malloc_logged(length));
    if (!entry->value) {
        ta_free(entry);
        return -1;
    }
    if (length)
        std::memcpy(entry->value, value, length);
    if (key_list_add(box->entries, type, entry) != 0) {
        entry_release(entry);
        return -1;
    }
    box->serialized_size += length + 4;
    return 0;
}

int tlv_box_serialize(tlv_box *box) {
    if (!box || box->serialized)
        return -1;
    auto *out = static_cast<uint8_t *>(ta_malloc_logged(box->serialized_size));
    if (!out)
        return -1;
    byte_writer w(out, box->serialized_size);
    for (key_list_node_t *node = box->entries->head; node; node = node->next) {
        const auto *entry = static_cast<const tlv_entry_t *>(node->value);
        uint8_t *at = nullptr;
        if (!w.reserve(4, &at) || !w.write_bytes(entry->value, entry->length)) {
            ta_free_wiped(out, box->serialized_size);
            return -1;
        }
        at[0] = static_cast<uint8_t>(entry->type);
        at[1] = static_cast<uint8_t>(entry->type >> 8);
        at[2] = static_cast<uint8_t>(entry->length);
        at[3] = static_cast<uint8_t>(entry->length >> 8);
    }
    box->serialized = out;
    return 0;
}

const uint8_t *tlv_box_get_buffer(const tlv_box *box) {
    return box ? box->serialized : nullptr;
}
uint32_t tlv_box_get_size(const tlv_box *box) {
    return box ? box->serialized_size : 0;
}

int tlv_box_get_bytes(const tlv_box *box, uint16_t type, uint8_t *dest, int32_t *length) {
    const tlv_entry_t *entry = find_entry(box, type);
    if (!entry || !length || !dest)
        return -1;
    if (*length < static_cast<int32_t>(entry->length))
        return -1;
    std::memset(dest, 0, static_cast<uint32_t>(*length));
    *length = entry->length;
    if (entry->length)
        std::memcpy(dest, entry->value, entry->length);
    return 0;
}

int tlv_box_get_bytes_ptr(const tlv_box *box, uint16_t type, const uint8_t **value, uint32_t *length) {
    const tlv_entry_t *entry = find_entry(box, type);
    if (!entry || !value || !length)
        return -1;
    *value = entry->value;
    *length = entry->length;
    return 0;
}

int tlv_box_get_object(const tlv_box *box, uint16_t type, tlv_box **object) {
    const tlv_entry_t *entry = find_entry(box, type);
    if (!entry || !object)
        return -1;
    *object = tlv_box_parse(entry->value, entry->length);
    return *object ? 0 : -1;
}

int tlv_box_put_string(tlv_box *box, uint16_t type, const char *value) {
    if (!value)
        return -1;
    size_t len = std::strlen(value);
    if (len >= kTlvMaxValue)
        return -1;
    return tlv_box_putobject(box, type, value, static_cast<uint32_t>(len + 1));
}

int tlv_box_put_bytes(tlv_box *box, uint16_t type, const uint8_t *value, uint32_t length) {
    return tlv_box_putobject(box, type, value, length);
}

int tlv_box_put_object(tlv_box *box, uint16_t type, const tlv_box *object) {
    if (!object || !object->serialized)
        return -1;
    return tlv_box_putobject(box, type, object->serialized, object->serialized_size);
}

int tlv_box_get_string(const tlv_box *box, uint16_t type, char *value, int32_t *length) {
    return tlv_box_get_bytes(box, type, reinterpret_cast<uint8_t *>(value), length);
}
