/*
 * client.cpp - the count-then-list capability queries, commands 1 to 12.
 */
#include "km/client.h"

#include <cstdio>

#include "km/names.h"
#include "ta_entry.h"

namespace km {
namespace {

constexpr uint32_t kValueOnly =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
constexpr uint32_t kValueAndOutput =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);

// More entries than any capability list can hold means a garbled answer;
// refusing it keeps a bad count from becoming a huge allocation.
constexpr uint32_t kMaxEntries = 1024;

ValueList decode_u32le(const std::vector<uint8_t> &bytes) {
    ValueList out(bytes.size() / 4, 0);
    for (size_t i = 0; i < out.size(); ++i) {
        const uint8_t *p = &bytes[4 * i];
        out[i] = uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
    }
    return out;
}

// Fetches `count` entries with list command `cmd`. Command 2 leaves
// params[0] alone; the others report a Keymaster error in its a.
Result<ValueList> fetch_list(Transport &transport, uint32_t cmd, uint32_t a, uint32_t b, uint32_t count,
                             bool reports_error) {
    Result<ValueList> r;
    if (count > kMaxEntries) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        return r;
    }
    if (count == 0)
        return r; // nothing to fetch
    std::vector<uint8_t> buffer(size_t{count} * 4, 0);
    TEE_Param params[4] = {};
    params[0].value.a = a;
    params[0].value.b = b;
    params[2].memref.buffer = buffer.data();
    params[2].memref.size = static_cast<uint32_t>(buffer.size());
    r.status.tee = transport.invoke(cmd, kValueAndOutput, params);
    if (r.status.tee_failed())
        return r;
    if (reports_error)
        r.status.km = static_cast<int32_t>(params[0].value.a);
    if (r.status.refused())
        return r;
    if (params[2].memref.size != buffer.size()) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        return r;
    }
    r.value = decode_u32le(buffer);
    return r;
}

} // namespace

std::string describe(const Status &status) {
    if (status.tee_failed()) {
        char hex[16] = {};
        std::snprintf(hex, sizeof hex, "0x%08x", status.tee);
        return tee_result_name(status.tee) + " (" + hex + ")";
    }
    if (status.refused())
        return error_name(status.km) + " (" + std::to_string(status.km) + "): " + std::string(error_message(status.km));
    return "ok";
}

Result<ValueList> Client::algorithms() {
    Result<ValueList> r;
    TEE_Param params[4] = {};
    r.status.tee = transport_.invoke(KM_CMD_GET_SUPPORT_ALGO_CNT, kValueOnly, params);
    if (r.status.tee_failed())
        return r;
    return fetch_list(transport_, KM_CMD_GET_SUPPORT_ALGO, 0, 0, params[0].value.a, false);
}

Result<ValueList> Client::count_then_list(uint32_t count_cmd, uint32_t list_cmd, uint32_t algorithm, uint32_t purpose) {
    Result<ValueList> r;
    TEE_Param params[4] = {};
    params[0].value.a = algorithm;
    params[0].value.b = purpose;
    r.status.tee = transport_.invoke(count_cmd, kValueOnly, params);
    if (r.status.tee_failed())
        return r;
    r.status.km = static_cast<int32_t>(params[0].value.a);
    if (r.status.refused())
        return r;
    return fetch_list(transport_, list_cmd, algorithm, purpose, params[0].value.b, true);
}

Result<ValueList> Client::block_modes(uint32_t algorithm, uint32_t purpose) {
    return count_then_list(KM_CMD_GET_SUPPORT_BLK_MODE_CNT, KM_CMD_GET_SUPPORT_BLK_MODE, algorithm, purpose);
}

Result<ValueList> Client::paddings(uint32_t algorithm, uint32_t purpose) {
    return count_then_list(KM_CMD_GET_SUPPORT_PADDING_MODE_CNT, KM_CMD_GET_SUPPORT_PADDING_MODE, algorithm, purpose);
}

Result<ValueList> Client::digests(uint32_t algorithm, uint32_t purpose) {
    return count_then_list(KM_CMD_GET_SUPPORT_DIGEST_CNT, KM_CMD_GET_SUPPORT_DIGEST, algorithm, purpose);
}

Result<ValueList> Client::import_formats(uint32_t algorithm) {
    return count_then_list(KM_CMD_GET_SUPPORT_IMPORT_FORMAT_CNT, KM_CMD_GET_SUPPORT_IMPORT_FORMAT, algorithm, 0);
}

Result<ValueList> Client::export_formats(uint32_t algorithm) {
    return count_then_list(KM_CMD_GET_SUPPORT_EXPORT_FORMAT_CNT, KM_CMD_GET_SUPPORT_EXPORT_FORMAT, algorithm, 0);
}

} // namespace km
