/*
 * algorithm_provider.h - the tables through which the command layer reaches
 * an algorithm: one provider per algorithm, one purpose table per purpose,
 * and the operation record every provider builds at begin.
 */
#ifndef ALGORITHM_PROVIDER_H
#define ALGORITHM_PROVIDER_H

#include <cstring>

#include "byte_io.h"
#include "keymaster_defs.h"

struct operation_t;

/*
 * operation_t - the leading part of every operation record; the provider's
 * own context follows it in the same allocation. key_params is owned by the
 * record and released by the command layer before free.
 */
struct operation_t {
    keymaster_key_param_set_t key_params;
    void (*free)(operation_t *op);
    TEE_Result (*update)(operation_t *op, keymaster_key_param_set_t *in_params, const uint8_t *input,
                         uint32_t *input_len, uint8_t *output, uint32_t *output_len, int32_t *error);
    TEE_Result (*finish)(operation_t *op, keymaster_key_param_set_t *in_params, const uint8_t *signature,
                         uint32_t signature_len, uint8_t **output, uint32_t *output_len,
                         keymaster_key_param_set_t *out_params, int32_t *error);
};

/*
 * operation_fns_t - the functions a provider's operation records carry,
 * and the record name their log lines use.
 */
struct operation_fns_t {
    void (*free)(operation_t *op);
    decltype(operation_t::update) update;
    decltype(operation_t::finish) finish;
    const char *record_name;
};

/* operation_record_alloc - a zero-filled record of size bytes with its functions set; null when out of memory. */
operation_t *operation_record_alloc(uint32_t size, const operation_fns_t *fns);

struct purpose_ops_t {
    uint32_t (*block_mode_count)();
    void (*get_block_modes)(uint32_t *out);
    uint32_t (*padding_count)();
    void (*get_paddings)(uint32_t *out);
    uint32_t (*digest_count)();
    void (*get_digests)(uint32_t *out);
    operation_t *(*create_operation)(const uint8_t *key_data, uint32_t key_data_len,
                                     keymaster_key_param_set_t *key_params, keymaster_key_param_set_t *in_params,
                                     keymaster_key_param_set_t *out_params, int32_t *error);
    uint32_t (*get_padding)(keymaster_key_param_set_t *in_params, uint32_t *value);
    uint32_t (*get_block_mode)(keymaster_key_param_set_t *in_params, uint32_t *value);
    uint32_t (*get_digest)(keymaster_key_param_set_t *in_params, uint32_t *value);
};

struct algorithm_provider_t {
    uint32_t algorithm;
    const char *name;
    const purpose_ops_t *(*get_purpose_ops)(uint32_t purpose);
    uint32_t (*import_format_count)();
    void (*get_import_formats)(uint32_t *out);
    uint32_t (*export_format_count)();
    void (*get_export_formats)(uint32_t *out);
    TEE_Result (*generate_key)(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                               int32_t *error);
    TEE_Result (*import_key)(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                             uint8_t **key_data, uint32_t *key_data_len, int32_t *error);
    TEE_Result (*export_key)(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                             int32_t *error);
};

constexpr uint32_t kAlgorithmProviderCount = 4;

/* algorithm_providers - RSA, AES, EC, HMAC, in that order. */
extern const algorithm_provider_t *const algorithm_providers[kAlgorithmProviderCount];

extern const algorithm_provider_t rsa_provider;
extern const algorithm_provider_t aes_provider;
extern const algorithm_provider_t ec_provider;
extern const algorithm_provider_t hmac_provider;

/* find_algorithm_provider - the first provider of that algorithm, or null. */
const algorithm_provider_t *find_algorithm_provider(uint32_t algorithm);

/*
 * find_purpose_ops - the purpose table of the first provider of that
 * algorithm that has get_purpose_ops; null when there is none or the
 * purpose is not supported.
 */
const purpose_ops_t *find_purpose_ops(uint32_t algorithm, uint32_t purpose);

/*
 * Capability lists as slot functions: list_count<L> and list_write<L> for a
 * constant array L. Lists go out as little-endian u32s into buffers of any
 * alignment.
 */
template <const auto &L> uint32_t list_count() { return static_cast<uint32_t>(sizeof(L) / sizeof(L[0])); }
template <const auto &L> void list_write(uint32_t *out) {
    auto *p = reinterpret_cast<uint8_t *>(out);
    for (uint32_t v : L) {
        put_u32le(p, v);
        p += 4;
    }
}
inline uint32_t list_count_none() { return 0; }
inline void list_write_none(uint32_t *) {}

/* Parameter getters shared by several tables (0 and *value, or 1 for none). */
uint32_t param_getter_none(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_digest(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_padding(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_block_mode(keymaster_key_param_set_t *in_params, uint32_t *value);

/*
 * provider_set_origin - refuses a caller-supplied KM_TAG_ORIGIN (*error -38)
 * and appends KM_TAG_ORIGIN = origin. TEE_ERROR_OUT_OF_MEMORY when the set
 * cannot grow. Logs in the calling provider's name.
 */
TEE_Result provider_set_origin(keymaster_key_param_set_t *params, uint32_t origin, int32_t *error,
                               const char *func = __builtin_FUNCTION());

/*
 * provider_settle_key - the common exit of the key functions: on success
 * hands *buf over as the key data; otherwise a failure that set neither a
 * result nor an error becomes KM_ERROR_UNKNOWN_ERROR.
 */
TEE_Result provider_settle_key(TEE_Result res, bool done, int32_t *error, heap_buf *buf, uint8_t **key_data,
                               uint32_t *key_data_len);

/* export_key_unsupported - the export slot of providers without an export format. */
TEE_Result export_key_unsupported(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                                  int32_t *error);

#endif
