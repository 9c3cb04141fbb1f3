/*
 * soter_key.h - SOTER key material: the provisioning-TA client, the ATTK
 * record and the SOTER property set loaded from it, and the conversions of
 * key material into TEE key objects and PEM public keys.
 */
#ifndef SOTER_KEY_H
#define SOTER_KEY_H

#include <cstdint>

#include <tee_internal_api.h>

#include "tlv_box.h"

/* vlb - an owned buffer and its length; none and 0 when empty. */
struct vlb {
    uint8_t *buf;
    uint32_t len;
};

/* soter_key_pair - the ATTK, unsigned big-endian; prime1.len == 0 marks an n, e, d only key. */
struct soter_key_pair {
    vlb modulus;          // tag 17
    vlb private_exponent; // tag 19
    vlb public_exponent;  // tag 18
    vlb prime1;           // tag 20
    vlb prime2;           // tag 21
    vlb exponent1;        // tag 22
    vlb exponent2;        // tag 23
    vlb coefficient;      // tag 24
};

/*
 * soter_prop_set - the device facts of the SOTER documents. Every text
 * buffer holds one byte more than its length, always zero, so each is a
 * NUL-terminated string whatever the provisioning TA sent.
 */
struct soter_prop_set {
    vlb fp_sensor_name;     // tag 0x1835
    vlb fp_sensor_version;  // tag 0x1836
    uint8_t fp_ta_uuid[16]; // tag 0x1837, in the TEE's in-memory UUID layout
    vlb cpu_id;             // property (0x1734, 0x173A), at most 64 bytes
    vlb tee_name;           // "gpd.tee.trustedos.manufacturer", at most 63 characters
    vlb tee_version;        // "gpd.tee.trustedos.implementation.version", likewise
};

/* soter_provisioning_ta_uuid - the provisioning TA this build talks to. */
extern const TEE_UUID soter_provisioning_ta_uuid;

/* The property request (first, second) that answers the device identifier. */
constexpr uint16_t kOrvelPropDeviceIdFirst = 0x1934;
constexpr uint16_t kOrvelPropDeviceIdSecond = 0x1936;

/*
 * retrieve_key_from_orvel / retrieve_data_from_orvel - commands 2 and 5 into
 * buf (size bytes); on success *used_length is what the provisioning TA
 * wrote. TEE_ERROR_SHORT_BUFFER without buf, TEE_ERROR_BAD_PARAMETERS
 * without used_length, else the session's or the command's result.
 */
TEE_Result retrieve_key_from_orvel(uint8_t *buf, uint32_t size, uint32_t *used_length);
TEE_Result retrieve_data_from_orvel(uint8_t *buf, uint32_t size, uint32_t *used_length);

/*
 * retrieve_property_from_orvel - command 12 with the 4-byte request; output
 * is the answer buffer and *output_length its capacity in and, on success
 * only, the answer's length out.
 */
TEE_Result retrieve_property_from_orvel(const uint8_t *request, uint8_t *output, uint32_t *output_length);

/* retrieve_orvel_property - retrieve_property_from_orvel with the request (first, second). */
TEE_Result retrieve_orvel_property(uint16_t first, uint16_t second, uint8_t *output, uint32_t *output_length);

/* init_soter_key - loads the ATTK into key (which must be empty); on failure key is left empty. */
TEE_Result init_soter_key(soter_key_pair *key);

/* parse_buf_fill_key - fills key from a key answer; on failure key is left empty. */
TEE_Result parse_buf_fill_key(soter_key_pair *key, const uint8_t *buf, uint32_t length);

/* init_vlb_with_tag - a copy of the tag's value into field; TEE_ERROR_BAD_PARAMETERS when absent. */
TEE_Result init_vlb_with_tag(vlb *field, const tlv_box *box, uint16_t tag);

/* init_soter_prop_set - loads the property set; on failure props is left empty. */
TEE_Result init_soter_prop_set(soter_prop_set *props);

/* free_soter_key, free_soter_prop_set - wipe and free every buffer; every field becomes none and 0. */
void free_soter_key(soter_key_pair *key);
void free_soter_prop_set(soter_prop_set *props);

/*
 * convert_key_to_object - a new TEE RSA key-pair object (3 or 8 attributes)
 * made from key, which the caller frees; null (logged) on failure.
 * *key_size is set to 2048 in every case.
 */
TEE_ObjectHandle convert_key_to_object(const soter_key_pair *key, uint32_t *key_size);

/* resolve_key_from_data - the RSA key object of a key's key data, which the caller frees, or null. */
TEE_ObjectHandle resolve_key_from_data(const uint8_t *key_data, uint32_t key_data_len, uint32_t *key_size);

/* retrieve_key_from_pobj - opens a key blob and resolves its key data as an RSA key; the object or null. */
TEE_ObjectHandle retrieve_key_from_pobj(const uint8_t *blob, uint32_t blob_len, uint32_t *key_size);

/*
 * export_rsa_public_key - the key's public half as PEM text in dest
 * (capacity bytes); *out_len counts the NUL. The result of the first
 * failing step, or TEE_SUCCESS.
 */
TEE_Result export_rsa_public_key(TEE_ObjectHandle key, uint32_t key_size, uint8_t *dest, uint32_t capacity,
                                 uint32_t *out_len);

#endif
