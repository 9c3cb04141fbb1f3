/*
 * capability_query.cpp - commands 1 to 12, answered from the providers'
 * capability lists with the count-then-list protocol.
 */
#include "capability_query.h"

#include "algorithm_provider.h"
#include "ta_log.h"

namespace {

using count_fn = uint32_t (*)();
using list_fn = void (*)(uint32_t *);

// Which pair of slots a query reads, and what a missing list slot logs.
template <typename Table> struct list_query {
    count_fn Table::*count;
    list_fn Table::*list;
    const char *null_message;
};

constexpr list_query<purpose_ops_t> kBlockModes{&purpose_ops_t::block_mode_count, &purpose_ops_t::get_block_modes,
                                                "get_support_block_mode == NULL"};
constexpr list_query<purpose_ops_t> kPaddings{&purpose_ops_t::padding_count, &purpose_ops_t::get_paddings,
                                              "get_support_padding_mode == NULL"};
constexpr list_query<purpose_ops_t> kDigests{&purpose_ops_t::digest_count, &purpose_ops_t::get_digests,
                                             "get_support_digest == NULL"};
constexpr list_query<algorithm_provider_t> kImportFormats{&algorithm_provider_t::import_format_count,
                                                          &algorithm_provider_t::get_import_formats,
                                                          "get_support_import_format == NULL"};
constexpr list_query<algorithm_provider_t> kExportFormats{&algorithm_provider_t::export_format_count,
                                                          &algorithm_provider_t::get_export_formats,
                                                          "get_support_export_format == NULL"};

// The table a query looks at: the purpose table, or the provider itself for formats.
struct purpose_lookup {
    static const purpose_ops_t *find(uint32_t algorithm, uint32_t purpose) {
        return find_purpose_ops(algorithm, purpose);
    }
    static constexpr int32_t kMissing = KM_ERROR_UNSUPPORTED_PURPOSE;
};
struct provider_lookup {
    static const algorithm_provider_t *find(uint32_t algorithm, uint32_t) { return find_algorithm_provider(algorithm); }
    static constexpr int32_t kMissing = KM_ERROR_UNSUPPORTED_ALGORITHM;
};

template <typename Lookup, typename Table>
TEE_Result count_step(const list_query<Table> &q, uint32_t algorithm, uint32_t purpose, int32_t *error,
                      uint32_t *count) {
    *count = 0;
    const Table *t = Lookup::find(algorithm, purpose);
    if (!t || !(t->*q.count)) {
        *error = Lookup::kMissing;
        return TEE_SUCCESS;
    }
    *count = (t->*q.count)();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

template <typename Lookup, typename Table>
TEE_Result list_step(const char *func, const list_query<Table> &q, uint32_t algorithm, uint32_t purpose, uint8_t *out,
                     uint32_t out_size, int32_t *error) {
    uint32_t count = 0;
    count_step<Lookup>(q, algorithm, purpose, error, &count);
    if (*error != KM_ERROR_OK)
        return TEE_SUCCESS;
    if (static_cast<uint64_t>(out_size) != uint64_t{count} * 4) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Output buffer doesn't match");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    const Table *t = Lookup::find(algorithm, purpose);
    if (!(t->*q.list)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "%s", q.null_message);
        return TEE_ERROR_GENERIC;
    }
    (t->*q.list)(reinterpret_cast<uint32_t *>(out));
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

} // namespace

TEE_Result get_support_algo_cnt(uint32_t *count) {
    *count = kAlgorithmProviderCount;
    return TEE_SUCCESS;
}

TEE_Result get_support_algo(uint8_t *out, uint32_t out_size) {
    if (out_size != kAlgorithmProviderCount * 4) {
        KM_ERR("Output buffer doesn't match");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    for (const algorithm_provider_t *p : algorithm_providers) {
        put_u32le(out, p->algorithm);
        out += 4;
    }
    return TEE_SUCCESS;
}

TEE_Result get_support_blk_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count) {
    return count_step<purpose_lookup>(kBlockModes, algorithm, purpose, error, count);
}

TEE_Result get_support_blk_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size, int32_t *error) {
    return list_step<purpose_lookup>(__func__, kBlockModes, algorithm, purpose, out, out_size, error);
}

TEE_Result get_support_padding_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count) {
    return count_step<purpose_lookup>(kPaddings, algorithm, purpose, error, count);
}

TEE_Result get_support_padding_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size,
                                    int32_t *error) {
    return list_step<purpose_lookup>(__func__, kPaddings, algorithm, purpose, out, out_size, error);
}

TEE_Result get_support_digest_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count) {
    return count_step<purpose_lookup>(kDigests, algorithm, purpose, error, count);
}

TEE_Result get_support_digest(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size, int32_t *error) {
    return list_step<purpose_lookup>(__func__, kDigests, algorithm, purpose, out, out_size, error);
}

TEE_Result get_support_import_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count) {
    return count_step<provider_lookup>(kImportFormats, algorithm, 0, error, count);
}

TEE_Result get_support_import_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error) {
    return list_step<provider_lookup>(__func__, kImportFormats, algorithm, 0, out, out_size, error);
}

TEE_Result get_support_export_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count) {
    return count_step<provider_lookup>(kExportFormats, algorithm, 0, error, count);
}

TEE_Result get_support_export_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error) {
    return list_step<provider_lookup>(__func__, kExportFormats, algorithm, 0, out, out_size, error);
}
