/*
 * ta_session.cpp - the benchmark's TEE, session and operation driver.
 */
#include "ta_session.h"

#include <cstdio>
#include <cstdlib>
#include <system_error>

#include "keymaster_defs.h"
#include "ta_entry.h"

namespace bench {
namespace {

// (u32 length, data, u32 length, serialized parameters): the request of
// begin, update and finish alike.
Bytes two_fields(const Bytes &first, const Bytes &params) {
    Bytes out;
    out.reserve(8 + first.size() + params.size());
    km::put_lv(out, first);
    km::put_lv(out, params);
    return out;
}

std::string hex32(uint32_t v) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "0x%08x", v);
    return buf;
}

} // namespace

TaFailure::TaFailure(const std::string &what, const Reply &r)
    : std::runtime_error(what + " failed: TEE result " + hex32(r.res) + ", Keymaster error " +
                         std::to_string(r.error)) {}

TaSession::TaSession() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "km-bench-XXXXXX").string();
    if (!mkdtemp(tmpl.data()))
        throw std::system_error(errno, std::generic_category(), "cannot create a state directory");
    state_dir_ = tmpl;
    tee_host::Config config;
    config.state_dir = state_dir_;
    config.trace_level = 0;
    tee_ = std::make_unique<tee_host::Tee>(config);
    tee_->install_ta(&keymaster_ta_header);
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session_);
    if (res != TEE_SUCCESS) {
        tee_.reset();
        std::error_code ec;
        std::filesystem::remove_all(state_dir_, ec);
        throw TaFailure("open_session", Reply{res, 0, 0, 0});
    }
}

TaSession::~TaSession() {
    tee_->close_session(session_);
    tee_.reset();
    std::error_code ec;
    std::filesystem::remove_all(state_dir_, ec);
}

Reply TaSession::invoke(uint32_t command, uint32_t a, const Bytes &in, Bytes &out) {
    return call_with([&](uint32_t types, TEE_Param *p) { return tee_->invoke(session_, command, types, p); }, a, in,
                     out);
}

Bytes TaSession::import_key(const km::ParamSet &params, const Bytes &material) {
    Bytes in;
    km::put_lv(in, params.serialize());
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(4096 + material.size());
    Reply r = invoke(KM_CMD_IMPORT_KEY, 0, in, out);
    if (!r.ok() || r.out_len < 4)
        throw TaFailure("import_key", r);
    uint32_t blob_len = km::get_u32(out.data());
    if (4 + size_t{blob_len} > r.out_len)
        throw TaFailure("import_key (response layout)", r);
    return Bytes(out.begin() + 4, out.begin() + 4 + blob_len);
}

TaOperation::TaOperation(TaSession &ta, uint32_t purpose, const Bytes &blob, const km::ParamSet &begin_params,
                         const Bytes &input, const Bytes &signature, size_t output_capacity)
    : ta_(ta), purpose_(purpose), input_(input) {
    const Bytes no_params = km::ParamSet().serialize();
    begin_request_ = two_fields(blob, begin_params.serialize());
    update_request_ = two_fields(input, no_params);
    finish_request_ = two_fields(signature, no_params);
    // Room for whatever an update may return (ciphers) or finish produce.
    response_.resize(output_capacity + input.size());
    output_.reserve(response_.size());
}

void TaOperation::update_all(uint32_t handle) {
    Reply r = ta_.invoke(KM_CMD_UPDATE, handle, update_request_, response_);
    if (!r.ok())
        throw TaFailure("update", r);
    output_.insert(output_.end(), response_.begin(), response_.begin() + r.out_len);
    // Operations that buffer may take less than offered: send the rest.
    size_t taken = r.b;
    while (taken < input_.size()) {
        Bytes rest(input_.begin() + static_cast<std::ptrdiff_t>(taken), input_.end());
        r = ta_.invoke(KM_CMD_UPDATE, handle, two_fields(rest, km::ParamSet().serialize()), response_);
        if (!r.ok())
            throw TaFailure("update", r);
        if (r.b == 0)
            throw TaFailure("update (no input taken)", r);
        output_.insert(output_.end(), response_.begin(), response_.begin() + r.out_len);
        taken += r.b;
    }
}

const Bytes &TaOperation::run() {
    output_.clear();
    Reply r = ta_.invoke(KM_CMD_BEGIN, purpose_, begin_request_, response_);
    if (!r.ok())
        throw TaFailure("begin", r);
    const uint32_t handle = r.b;
    // A failed update ends the operation in the TA, so nothing to abort.
    if (!input_.empty())
        update_all(handle);
    r = ta_.invoke(KM_CMD_FINISH, handle, finish_request_, response_);
    if (!r.ok() || r.out_len < 8)
        throw TaFailure("finish", r);
    uint32_t len = km::get_u32(response_.data());
    if (4 + size_t{len} > r.out_len)
        throw TaFailure("finish (response layout)", r);
    output_.insert(output_.end(), response_.begin() + 4, response_.begin() + 4 + len);
    return output_;
}

} // namespace bench
