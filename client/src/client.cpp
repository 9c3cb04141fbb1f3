/*
 * client.cpp - the capability queries (commands 1 to 12), the key commands
 * and the operation commands.
 */
#include "km/client.h"

#include <cstddef>
#include <cstdio>
#include <optional>

#include "km/names.h"
#include "ta_entry.h"

namespace km {
namespace {

constexpr uint32_t kValueOnly =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
constexpr uint32_t kValueAndOutput =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);
constexpr uint32_t kValueAndInput =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
constexpr uint32_t kRequestResponse = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_MEMREF_INPUT,
                                                      TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);

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

// One command of the key and operation families: a in params[0].a,
// request in params[1] (when given), response room in params[2] (when
// capacity > 0). On a TEE success, km is the Keymaster error in a.
struct Exchange {
    Status status;
    uint32_t b = 0;
    Bytes response; // trimmed to what the TA wrote; empty unless ok
};

Exchange exchange(Transport &transport, uint32_t cmd, uint32_t a, const Bytes *request, size_t capacity) {
    Exchange x;
    // The wire carries 32-bit sizes.
    if ((request && request->size() > UINT32_MAX) || capacity > UINT32_MAX) {
        x.status.tee = TEE_ERROR_BAD_PARAMETERS;
        return x;
    }
    Bytes in = request ? *request : Bytes{};
    Bytes out(capacity, 0);
    TEE_Param params[4] = {};
    params[0].value.a = a;
    uint32_t types = kValueOnly;
    if (request) {
        params[1].memref.buffer = in.data();
        params[1].memref.size = static_cast<uint32_t>(in.size());
        types = capacity ? kRequestResponse : kValueAndInput;
    } else if (capacity) {
        types = kValueAndOutput;
    }
    if (capacity) {
        params[2].memref.buffer = out.data();
        params[2].memref.size = static_cast<uint32_t>(out.size());
    }
    x.status.tee = transport.invoke(cmd, types, params);
    if (x.status.tee_failed())
        return x;
    x.status.km = static_cast<int32_t>(params[0].value.a);
    x.b = params[0].value.b;
    if (x.status.refused())
        return x;
    if (capacity) {
        if (params[2].memref.size > capacity) {
            x.status.tee = TEE_ERROR_BAD_FORMAT;
            return x;
        }
        out.resize(params[2].memref.size);
        x.response = std::move(out);
    }
    return x;
}

Bytes key_reference(const KeyReference &key) {
    Bytes out;
    put_lv(out, key.blob);
    put_lv(out, key.app_id);
    put_lv(out, key.app_data);
    return out;
}

Bytes span_bytes(std::span<const uint8_t> s) {
    return Bytes(s.begin(), s.end());
}

// Reads a u32 length and that many bytes at *pos; false when they do not fit.
bool take_lv(const Bytes &in, size_t *pos, Bytes *field) {
    if (in.size() - *pos < 4)
        return false;
    uint32_t n = get_u32(in.data() + *pos);
    *pos += 4;
    if (in.size() - *pos < n)
        return false;
    field->assign(in.begin() + static_cast<std::ptrdiff_t>(*pos), in.begin() + static_cast<std::ptrdiff_t>(*pos + n));
    *pos += n;
    return true;
}

// A whole buffer holding exactly one serialized parameter set.
bool parse_whole_set(const Bytes &in, ParamSet *set) {
    size_t used = 0;
    std::optional<ParamSet> parsed = ParamSet::parse(in.data(), in.size(), &used);
    if (!parsed || used != in.size())
        return false;
    *set = std::move(*parsed);
    return true;
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

Result<Bytes> Client::generate_key(const ParamSet &params) {
    Bytes request = params.serialize();
    Exchange x = exchange(transport_, KM_CMD_GENERATE_KEY, 0, &request, kBlobCapacity);
    return {x.status, std::move(x.response)};
}

Result<ImportedKey> Client::import_key(const ParamSet &params, std::span<const uint8_t> material) {
    Bytes request;
    put_lv(request, params.serialize());
    request.insert(request.end(), material.begin(), material.end());
    Exchange x = exchange(transport_, KM_CMD_IMPORT_KEY, 0, &request, kImportCapacity);
    Result<ImportedKey> r{x.status, {}};
    if (!r.ok())
        return r;
    size_t pos = 0;
    Bytes chars;
    if (!take_lv(x.response, &pos, &r.value.blob) || !take_lv(x.response, &pos, &chars) || pos != x.response.size() ||
        !parse_whole_set(chars, &r.value.characteristics)) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        r.value = {};
    }
    return r;
}

Result<uint32_t> Client::characteristics_size(const KeyReference &key) {
    Bytes request = key_reference(key);
    Exchange x = exchange(transport_, KM_CMD_GET_KEY_CHARACTER_SIZE, 0, &request, 0);
    return {x.status, x.status.ok() ? x.b : 0};
}

Result<ParamSet> Client::characteristics(const KeyReference &key) {
    Result<uint32_t> size = characteristics_size(key);
    Result<ParamSet> r{size.status, {}};
    if (!r.ok())
        return r;
    // Smaller than an empty set, or absurd for a parameter list: garbled.
    if (size.value < 4 || size.value > kBlobCapacity) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        return r;
    }
    Bytes request = key_reference(key);
    Exchange x = exchange(transport_, KM_CMD_GET_KEY_CHARACTER, 0, &request, size.value);
    r.status = x.status;
    if (r.ok() && !parse_whole_set(x.response, &r.value))
        r.status.tee = TEE_ERROR_BAD_FORMAT;
    return r;
}

Result<Bytes> Client::export_key(const KeyReference &key) {
    Bytes request = key_reference(key);
    Exchange x = exchange(transport_, KM_CMD_EXPORT_KEY, 0, &request, kExportCapacity);
    return {x.status, std::move(x.response)};
}

Status Client::delete_key(std::span<const uint8_t> blob) {
    Bytes request = span_bytes(blob);
    return exchange(transport_, KM_CMD_DELETE_KEY, 0, &request, 0).status;
}

Status Client::delete_all_keys() {
    return exchange(transport_, KM_CMD_DELETE_ALL_KEY, 0, nullptr, 0).status;
}

Result<Operation> Client::begin(uint32_t purpose, std::span<const uint8_t> blob, const ParamSet &params) {
    Bytes request;
    put_lv(request, span_bytes(blob));
    put_lv(request, params.serialize());
    Exchange x = exchange(transport_, KM_CMD_BEGIN, purpose, &request, kBeginCapacity);
    Result<Operation> r{x.status, {}};
    if (!r.ok())
        return r;
    r.value.handle = x.b;
    if (x.b == 0 || !parse_whole_set(x.response, &r.value.out_params)) {
        // The operation may be live in the TA; a handle is all it takes to end it.
        if (x.b != 0)
            abort(x.b);
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        r.value = {};
    }
    return r;
}

Result<UpdateOutput> Client::update(uint32_t handle, std::span<const uint8_t> input, const ParamSet &params) {
    Bytes request;
    put_lv(request, span_bytes(input));
    put_lv(request, params.serialize());
    Exchange x = exchange(transport_, KM_CMD_UPDATE, handle, &request, input.size() + kUpdateSlack);
    Result<UpdateOutput> r{x.status, {}};
    if (!r.ok())
        return r;
    if (x.b > input.size()) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        return r;
    }
    r.value.consumed = x.b;
    r.value.output = std::move(x.response);
    return r;
}

Result<FinishOutput> Client::finish(uint32_t handle, std::span<const uint8_t> signature, const ParamSet &params,
                                    size_t capacity) {
    Bytes request;
    put_lv(request, span_bytes(signature));
    put_lv(request, params.serialize());
    Exchange x = exchange(transport_, KM_CMD_FINISH, handle, &request, capacity);
    Result<FinishOutput> r{x.status, {}};
    if (!r.ok())
        return r;
    size_t pos = 0;
    Bytes out_params;
    if (!take_lv(x.response, &pos, &r.value.output) || !take_lv(x.response, &pos, &out_params) ||
        pos != x.response.size() || !parse_whole_set(out_params, &r.value.out_params)) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        r.value = {};
    }
    return r;
}

Result<FinishOutput> Client::stream(uint32_t handle, const InputSource &source, const OutputSink &sink,
                                    const ParamSet &first_update, std::span<const uint8_t> signature, size_t chunk) {
    Result<FinishOutput> r;
    Bytes pending;
    bool eof = false;
    bool first = true;
    try {
        for (;;) {
            if (!eof && pending.size() < chunk) {
                const size_t have = pending.size();
                pending.resize(chunk);
                const size_t got = source(pending.data() + have, chunk - have);
                pending.resize(have + got);
                eof = got < chunk - have;
            }
            // Associated data goes in an update even when there is no input.
            if (pending.empty() && !(first && !first_update.params().empty()))
                break;
            Result<UpdateOutput> up = update(handle, pending, first ? first_update : ParamSet{});
            if (up.status.refused()) {
                r.status = up.status; // the TA ended the operation itself
                return r;
            }
            if (!up.ok()) {
                abort(handle);
                r.status = up.status;
                return r;
            }
            first = false;
            sink(up.value.output);
            // Nothing taken from a full piece, or from the last one: no progress is possible.
            if (up.value.consumed == 0 && !pending.empty() && (eof || pending.size() >= chunk)) {
                abort(handle);
                r.status.tee = TEE_ERROR_BAD_FORMAT;
                return r;
            }
            pending.erase(pending.begin(), pending.begin() + static_cast<std::ptrdiff_t>(up.value.consumed));
            if (eof && pending.empty())
                break;
        }
    } catch (...) {
        abort(handle);
        throw;
    }
    return finish(handle, signature);
}

Status Client::abort(uint32_t handle) {
    return exchange(transport_, KM_CMD_ABORT, handle, nullptr, 0).status;
}

namespace {

constexpr uint32_t kSoterOutput = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_OUTPUT, TEE_PARAM_TYPE_NONE,
                                                  TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);
// Room for a PEM public key of up to 4096 bits and for any device identifier.
constexpr size_t kSoterCapacity = 2048;

// A SOTER command with an output buffer in params[2]; the TA's code in status.km.
Exchange soter_output(Transport &transport, uint32_t cmd) {
    Exchange x;
    Bytes out(kSoterCapacity, 0);
    TEE_Param params[4] = {};
    params[2].memref.buffer = out.data();
    params[2].memref.size = static_cast<uint32_t>(out.size());
    x.status.tee = transport.invoke(cmd, kSoterOutput, params);
    if (x.status.tee_failed())
        return x;
    x.status.km = static_cast<int32_t>(params[0].value.a);
    if (x.status.refused())
        return x;
    if (params[2].memref.size > out.size()) {
        x.status.tee = TEE_ERROR_BAD_FORMAT;
        return x;
    }
    out.resize(params[2].memref.size);
    x.response = std::move(out);
    return x;
}

} // namespace

Status Client::notify_fid(uint32_t fid) {
    return Status{transport_.notify_fid(fid), 0};
}

Status Client::soter_load_attk() {
    return exchange(transport_, KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, 0, nullptr, 0).status;
}

Result<int32_t> Client::soter_verify_attk() {
    Exchange x = exchange(transport_, KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR, 0, nullptr, 0);
    Result<int32_t> r;
    r.status.tee = x.status.tee;
    r.value = x.status.km;
    return r;
}

Result<std::string> Client::soter_export_attk() {
    Exchange x = soter_output(transport_, KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY);
    Result<std::string> r{x.status, {}};
    if (!r.ok())
        return r;
    // The TA counts the text's NUL; a text without one is garbled.
    if (x.response.empty() || x.response.back() != 0) {
        r.status.tee = TEE_ERROR_BAD_FORMAT;
        return r;
    }
    r.value.assign(x.response.begin(), x.response.end() - 1);
    return r;
}

Result<Bytes> Client::soter_device_id() {
    Exchange x = soter_output(transport_, KM_CMD_SOTER_GET_DEVICE_ID);
    return {x.status, std::move(x.response)};
}

} // namespace km
