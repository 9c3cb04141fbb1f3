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
 * The slot signatures, named once: the tables below hold pointers of these
 * types and each family declares its slot functions with them.
 *
 * create_operation_fn - builds an operation record; null on failure with
 * the reason in *error. update_fn, finish_fn - a record's steps.
 * release_fn - see operation_fns_t. generate_key_fn, import_key_fn - key
 * data in a buffer the caller frees. export_key_fn - public material into
 * out (capacity *out_len). resolve_key_data_fn - a new TEE key object the
 * caller frees, and its size in bits when key_size is given.
 */
using create_operation_fn = operation_t *(const uint8_t *key_data, uint32_t key_data_len,
                                          keymaster_key_param_set_t *key_params, keymaster_key_param_set_t *in_params,
                                          keymaster_key_param_set_t *out_params, int32_t *error);
using update_fn = TEE_Result(operation_t *op, keymaster_key_param_set_t *in_params, const uint8_t *input,
                             uint32_t *input_len, uint8_t *output, uint32_t *output_len, int32_t *error);
using finish_fn = TEE_Result(operation_t *op, keymaster_key_param_set_t *in_params, const uint8_t *signature,
                             uint32_t signature_len, uint8_t **output, uint32_t *output_len,
                             keymaster_key_param_set_t *out_params, int32_t *error);
using release_fn = void(operation_t *op, bool audit);
using generate_key_fn = TEE_Result(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                                   int32_t *error);
using import_key_fn = TEE_Result(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                                 uint8_t **key_data, uint32_t *key_data_len, int32_t *error);
using export_key_fn = TEE_Result(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                                 int32_t *error);
using resolve_key_data_fn = TEE_Result(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                       uint32_t *key_size, int32_t *error);

/*
 * operation_fns_t - the one constant table of an operation record's
 * functions. Every record of a kind points at the same table.
 *
 * update, finish: the provider's steps (null: not offered).
 * release: frees what the record holds (TEE objects and operations,
 * buffers) but neither the record itself nor its key_params. With audit
 * set, each member that a complete record must hold and that is missing
 * is logged once as "Try to free invalid <record_name>".
 */
struct operation_fns_t {
    const char *record_name;
    uint32_t record_size; // bytes of the whole record, header included
    update_fn *update;
    finish_fn *finish;
    release_fn *release;
};

/*
 * operation_t - the leading part of every operation record; the provider's
 * own context follows it in the same allocation. key_params is owned by the
 * record once begin has moved it there.
 */
struct operation_t {
    keymaster_key_param_set_t key_params;
    const operation_fns_t *fns;
};

/*
 * operation_record_alloc - a zero-filled record of fns->record_size bytes
 * pointing at fns; null (logged "Out of memory" in the caller's name) when
 * the heap is exhausted. The record ends only through operation_destroy.
 */
operation_t *operation_record_alloc(const operation_fns_t *fns, const char *func = __builtin_FUNCTION());

/*
 * operation_fns - the table of a record type: its name in log lines, its
 * size, and its three functions.
 */
template <typename Record>
constexpr operation_fns_t operation_fns(const char *record_name, update_fn *update, finish_fn *finish,
                                        release_fn *release) {
    return operation_fns_t{
        .record_name = record_name,
        .record_size = sizeof(Record),
        .update = update,
        .finish = finish,
        .release = release,
    };
}

/*
 * keyed_record_t - the leading part of every provider's record: the
 * header, then the TEE operation and the key object it runs with.
 */
struct keyed_record_t {
    operation_t header;
    TEE_OperationHandle operation;
    TEE_ObjectHandle key;
};

/* operation_record - the provider's view of a record built from its table. */
template <typename Record> Record *operation_record(operation_t *op) {
    // header leads keyed_record_t, so the two addresses are one.
    return static_cast<Record *>(reinterpret_cast<keyed_record_t *>(op));
}

/* How complete a record is when it is destroyed. */
enum class record_state : uint8_t {
    complete, // built by create_operation: missing members are logged
    partial,  // create_operation's own failure path: released quietly
};

/*
 * operation_destroy - the one way an operation record ends: releases its
 * key_params, lets its table release what it holds, wipes and frees the
 * record. A null record logs "Try to free NULL operation_t".
 */
void operation_destroy(operation_t *op, record_state state = record_state::complete);

/*
 * operation_record_create - the frame of a provider's create: a new record
 * of fns's kind, then steps(record), which makes its members and returns
 * true when the record is ready. The record, or null when it cannot be
 * allocated (logged "Out of memory" in func's name) or steps fail (the
 * record and what steps made are released quietly).
 */
template <typename Record, typename Steps>
operation_t *operation_record_create(const operation_fns_t *fns, const char *func, Steps steps) {
    operation_t *header = operation_record_alloc(fns, func);
    if (!header || steps(operation_record<Record>(header)))
        return header;
    operation_destroy(header, record_state::partial);
    return nullptr;
}

/*
 * operation_key_resolved - whether a create's key resolution, which
 * answered res and *error, left it a key in *key; when not, "Resolve key
 * data failed" is logged in func's name.
 */
bool operation_key_resolved(TEE_Result res, const int32_t *error, const TEE_ObjectHandle *key, const char *func,
                            int line = __builtin_LINE());

/*
 * record_release - what a table's release function uses to free one member
 * at a time: each call frees the member when present and clears it; a
 * required member that is missing is logged when auditing.
 */
class record_release {
  public:
    record_release(const operation_t *op, bool audit, const char *func = __builtin_FUNCTION())
        : op_(op), audit_(audit), func_(func) {}
    void object(TEE_ObjectHandle *h, bool required = true);
    void operation(TEE_OperationHandle *h, bool required = true);
    /* buffer - frees *p after wiping len bytes of it. */
    void buffer(uint8_t **p, uint32_t len, bool required = true);
    /* keyed - the key object and the TEE operation of keyed_record_t, both required. */
    void keyed(keyed_record_t *rec) {
        object(&rec->key);
        operation(&rec->operation);
    }

  private:
    void missing(bool required) const;
    const operation_t *op_;
    bool audit_;
    const char *func_;
};

struct purpose_ops_t {
    uint32_t (*block_mode_count)();
    void (*get_block_modes)(uint32_t *out);
    uint32_t (*padding_count)();
    void (*get_paddings)(uint32_t *out);
    uint32_t (*digest_count)();
    void (*get_digests)(uint32_t *out);
    create_operation_fn *create_operation;
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
    generate_key_fn *generate_key;
    import_key_fn *import_key;
    export_key_fn *export_key;
};

constexpr uint32_t kAlgorithmProviderCount = 4;

/* algorithm_providers - RSA, AES, EC, HMAC, in that order. */
extern const algorithm_provider_t *const algorithm_providers[kAlgorithmProviderCount];

extern const algorithm_provider_t rsa_provider;
extern const algorithm_provider_t aes_provider;
extern const algorithm_provider_t ec_provider;
extern const algorithm_provider_t hmac_provider;

/*
 * purposes_of - a provider's get_purpose_ops over its tables listed by
 * purpose value (KM_PURPOSE_ENCRYPT 0 to KM_PURPOSE_VERIFY 3), null for a
 * purpose the provider lacks.
 */
template <const purpose_ops_t *...Tables> const purpose_ops_t *purposes_of(uint32_t purpose) {
    constexpr const purpose_ops_t *tables[] = {Tables...};
    return purpose < sizeof...(Tables) ? tables[purpose] : nullptr;
}

/* find_algorithm_provider - the first provider of that algorithm, or null. */
const algorithm_provider_t *find_algorithm_provider(uint32_t algorithm);

/*
 * find_purpose_ops - the purpose table of the first provider of that
 * algorithm that has get_purpose_ops; null when there is none or the
 * purpose is not supported. With provider given, *provider is that
 * provider (null when no provider of the algorithm has get_purpose_ops),
 * so callers can tell an unknown algorithm from an unknown purpose.
 */
const purpose_ops_t *find_purpose_ops(uint32_t algorithm, uint32_t purpose,
                                      const algorithm_provider_t **provider = nullptr);

/*
 * Capability lists as slot functions: list_count<L> and list_write<L> for a
 * constant array L. Lists go out as little-endian u32s into buffers of any
 * alignment.
 */
template <const auto &L> uint32_t list_count() {
    return static_cast<uint32_t>(sizeof(L) / sizeof(L[0]));
}
template <const auto &L> void list_write(uint32_t *out) {
    auto *p = reinterpret_cast<uint8_t *>(out);
    for (uint32_t v : L) {
        put_u32le(p, v);
        p += 4;
    }
}
inline uint32_t list_count_none() {
    return 0;
}
inline void list_write_none(uint32_t *) {}

/* Parameter getters shared by several tables (0 and *value, or 1 for none). */
uint32_t param_getter_none(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_digest(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_padding(keymaster_key_param_set_t *in_params, uint32_t *value);
uint32_t param_getter_block_mode(keymaster_key_param_set_t *in_params, uint32_t *value);

/* The digests EC and HMAC sign with: MD5 to SHA-512, never none. */
constexpr uint32_t kSigningDigests[] = {KM_DIGEST_MD5,       KM_DIGEST_SHA1,      KM_DIGEST_SHA_2_224,
                                        KM_DIGEST_SHA_2_256, KM_DIGEST_SHA_2_384, KM_DIGEST_SHA_2_512};

/*
 * digest_signing_table - the sign or verify table of EC and HMAC: no block
 * modes or paddings, kSigningDigests, and the single digest of the request
 * as the one value to authorize.
 */
constexpr purpose_ops_t digest_signing_table(create_operation_fn *create) {
    // clang-format off
    return purpose_ops_t{.block_mode_count = list_count_none, .get_block_modes = list_write_none,
        .padding_count = list_count_none, .get_paddings = list_write_none,
        .digest_count = list_count<kSigningDigests>, .get_digests = list_write<kSigningDigests>,
        .create_operation = create,
        .get_padding = param_getter_none, .get_block_mode = param_getter_none, .get_digest = param_getter_digest,
    };
    // clang-format on
}

/*
 * provider_set_origin - refuses a caller-supplied KM_TAG_ORIGIN (*error -38)
 * and appends KM_TAG_ORIGIN = origin. TEE_ERROR_OUT_OF_MEMORY when the set
 * cannot grow. Logs in the calling provider's name.
 */
TEE_Result provider_set_origin(keymaster_key_param_set_t *params, uint32_t origin, int32_t *error,
                               const char *func = __builtin_FUNCTION());

/*
 * provider_key_slot - the frame of a generate or import slot: the outputs
 * cleared, origin recorded (a caller-supplied KM_TAG_ORIGIN refused), then
 * steps(buf, res), which fills buf with the key data and returns true when
 * done, else sets *res or *error. One exit: key_output::settle.
 */
template <typename Steps>
TEE_Result provider_key_slot(keymaster_key_param_set_t *params, uint32_t origin, uint8_t **key_data,
                             uint32_t *key_data_len, int32_t *error, Steps steps,
                             const char *func = __builtin_FUNCTION());

/*
 * provider_import_slot - the frame of an import whose material has a
 * layout of its own: the outputs cleared, then parse(reader) over the
 * material, which logs and returns false when it is cut short
 * (TEE_ERROR_GENERIC), and only then the origin and steps(buf, res,
 * consumed) as in provider_key_slot; consumed is what the parse read.
 */
template <typename Parse, typename Steps>
TEE_Result provider_import_slot(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                                uint8_t **key_data, uint32_t *key_data_len, int32_t *error, Parse parse, Steps steps,
                                const char *func = __builtin_FUNCTION());

/*
 * provider_param - the single parameter of tag that a step needs: the
 * parameter, or null (absent or repeated) with "No or too many <what>"
 * logged in func's name and *error missing_error.
 */
const key_param_t *provider_param(const keymaster_key_param_set_t *params, uint32_t tag, const char *what,
                                  int32_t *error, const char *func, int32_t missing_error = KM_ERROR_INVALID_ARGUMENT,
                                  int line = __builtin_LINE());

/*
 * key_size_rule_t - the key sizes of a family: which sizes valid() takes,
 * and the label that names the family in "Invalid <label> key size %d".
 */
struct key_size_rule_t {
    const char *label;
    bool (*valid)(uint32_t bits);
};

/*
 * provider_generation_size - the key size of a generation: the single
 * KM_TAG_KEY_SIZE, when the rule takes it. True with *bits; false with the
 * refusal logged in func's name: "No or too many KM_TAG_KEY_SIZE or
 * specified" (*error -38) or "Invalid <label> key size %d" (*error -6).
 */
bool provider_generation_size(const keymaster_key_param_set_t *params, const key_size_rule_t &rule, uint32_t *bits,
                              int32_t *error, const char *func);

/*
 * provider_generated_pair - the key data of a fresh key pair of TEE type
 * `type` and key_size bits, generated with the one parameter `param`: u32
 * key_size, then each attribute of ids, in order, as u32 length + its
 * big-endian bytes, each at most max_len bytes, written into buf. A first
 * pass learns the lengths through a wiped scratch buffer, so that buf is
 * allocated exactly. TEE_SUCCESS with *error 0 when written; the TEE's
 * result, TEE_ERROR_OUT_OF_MEMORY for buf, or *error -41 (scratch) and
 * -1000 (a length that changed) otherwise, logged in func's name.
 */
TEE_Result provider_generated_pair(uint32_t type, uint32_t key_size, const TEE_Attribute &param, const uint32_t *ids,
                                   uint32_t count, uint32_t max_len, heap_buf *buf, int32_t *error, const char *func);

/*
 * provider_key_data - lays key data out in buf: count u32 words
 * (little-endian), then body_len bytes copied from body or, with body
 * null, left zero for the caller to fill at buf->get() + 4 * count. A
 * buffer that cannot be had is "Out of memory" logged in func's name and
 * *error oom_error with TEE_SUCCESS, or TEE_ERROR_OUT_OF_MEMORY when
 * oom_error is 0.
 */
TEE_Result provider_key_data(heap_buf *buf, const uint32_t *words, uint32_t count, const uint8_t *body,
                             uint32_t body_len, int32_t oom_error, int32_t *error, const char *func);

/*
 * provider_import_size - the key size an import's material shows (bits),
 * checked: the caller's KM_TAG_KEY_SIZE must equal it ("Key size mismatch
 * (given %d, guessed %d)", *error -44), and is added when there is none
 * (TEE_ERROR_OUT_OF_MEMORY when the set cannot grow); then the rule
 * ("Invalid <label> key size %d", *error -6). TEE_SUCCESS with *error 0
 * when usable.
 */
TEE_Result provider_import_size(keymaster_key_param_set_t *params, uint32_t bits, const key_size_rule_t &rule,
                                int32_t *error, const char *func);

/*
 * secret_key_family_t - what the key slots of a raw secret-key family
 * (AES, HMAC) differ in. Key data: the key size as a u32, then, for a
 * family without one tee_type, each key's TEE type as a u32, then the key
 * bytes. sizes are its key sizes, generate_name and import_name its slots'
 * names in log lines; vet() checks the other parameters for a key of bits
 * (for generation or import), sets the key's TEE type when the family
 * has none, and sets *error or returns the TEE's result when they will
 * not do.
 */
struct secret_key_family_t {
    key_size_rule_t sizes;
    uint32_t tee_type; // 0: each key has its own
    TEE_Result (*vet)(keymaster_key_param_set_t *params, uint32_t bits, bool generating, uint32_t *tee_type,
                      int32_t *error, const char *func);
    const char *generate_name;
    const char *import_name;
};

/*
 * provider_generate_secret / provider_import_secret - the generate and
 * import slots of a secret-key family, within provider_key_slot: the
 * size from KM_TAG_KEY_SIZE (generation) or from the material (import,
 * provider_raw_key_size), vet(), then the key data with a fresh key from
 * the TEE or the material. No memory is TEE_ERROR_OUT_OF_MEMORY in
 * generation and *error -41 in import. Logged in func's name.
 */
TEE_Result provider_generate_secret(const secret_key_family_t &family, keymaster_key_param_set_t *params,
                                    uint8_t **key_data, uint32_t *key_data_len, int32_t *error,
                                    const char *func = __builtin_FUNCTION());
TEE_Result provider_import_secret(const secret_key_family_t &family, keymaster_key_param_set_t *params,
                                  const uint8_t *material, uint32_t material_len, uint8_t **key_data,
                                  uint32_t *key_data_len, int32_t *error, const char *func = __builtin_FUNCTION());

/*
 * secret_generate_key / secret_import_key - the generate and import slots
 * of a secret-key family's provider table: provider_generate_secret and
 * provider_import_secret with the family, logged in the family's names.
 */
template <const secret_key_family_t &Family>
TEE_Result secret_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                               int32_t *error) {
    return provider_generate_secret(Family, params, key_data, key_data_len, error, Family.generate_name);
}
template <const secret_key_family_t &Family>
TEE_Result secret_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                             uint8_t **key_data, uint32_t *key_data_len, int32_t *error) {
    return provider_import_secret(Family, params, material, material_len, key_data, key_data_len, error,
                                  Family.import_name);
}

/*
 * provider_resolve_secret - the family's key data as a new TEE object the
 * caller frees, with *key_size (if given) its bits and *key_type (if
 * given) its TEE type. Key data cut short is "Too short input" and
 * TEE_ERROR_GENERIC; TEE failures are returned; *object is null on any
 * failure. The size is left to the TEE to judge.
 */
TEE_Result provider_resolve_secret(const secret_key_family_t &family, const uint8_t *key_data, uint32_t key_data_len,
                                   TEE_ObjectHandle *object, uint32_t *key_size, uint32_t *key_type, int32_t *error,
                                   const char *func = __builtin_FUNCTION());

/*
 * key_output - the key data a provider's generate or import slot builds.
 * It clears the slot's outputs and error when made; settle() is the slot's
 * one exit: on success the buffer becomes the key data (the caller frees
 * it), otherwise it is wiped and a failure that set neither a result nor
 * an error becomes KM_ERROR_UNKNOWN_ERROR.
 */
class key_output {
  public:
    key_output(uint8_t **key_data, uint32_t *key_data_len, int32_t *error)
        : key_data_(key_data), key_data_len_(key_data_len), error_(error) {
        *key_data = nullptr;
        *key_data_len = 0;
        *error = KM_ERROR_OK;
    }
    /* start - refuses a caller-supplied KM_TAG_ORIGIN and records origin (provider_set_origin). */
    TEE_Result start(keymaster_key_param_set_t *params, uint32_t origin, const char *func = __builtin_FUNCTION()) {
        return provider_set_origin(params, origin, error_, func);
    }
    /* run - start, then steps(&buf, &res) if that went through, then settle. */
    template <typename Steps>
    TEE_Result run(keymaster_key_param_set_t *params, uint32_t origin, Steps steps, const char *func) {
        TEE_Result res = start(params, origin, func);
        const bool done = res == TEE_SUCCESS && *error_ == KM_ERROR_OK && steps(&buf, &res);
        return settle(res, done);
    }
    TEE_Result settle(TEE_Result res, bool done) {
        settle_error(res, done, error_);
        if (done && res == TEE_SUCCESS && *error_ == KM_ERROR_OK) {
            *key_data_len_ = buf.len();
            *key_data_ = buf.release();
        }
        return res;
    }
    heap_buf buf{true};

  private:
    uint8_t **key_data_;
    uint32_t *key_data_len_;
    int32_t *error_;
};

template <typename Steps>
TEE_Result provider_key_slot(keymaster_key_param_set_t *params, uint32_t origin, uint8_t **key_data,
                             uint32_t *key_data_len, int32_t *error, Steps steps, const char *func) {
    key_output out(key_data, key_data_len, error);
    return out.run(params, origin, steps, func);
}

template <typename Parse, typename Steps>
TEE_Result provider_import_slot(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                                uint8_t **key_data, uint32_t *key_data_len, int32_t *error, Parse parse, Steps steps,
                                const char *func) {
    key_output out(key_data, key_data_len, error);
    byte_reader r(material, material_len);
    if (!parse(&r))
        return out.settle(TEE_ERROR_GENERIC, false);
    const uint32_t consumed = material_len - r.remaining();
    return out.run(
        params, KM_ORIGIN_IMPORTED, [&](heap_buf *buf, TEE_Result *res) { return steps(buf, res, consumed); }, func);
}

/* export_key_unsupported - the export slot of providers without an export format. */
export_key_fn export_key_unsupported;

#endif
