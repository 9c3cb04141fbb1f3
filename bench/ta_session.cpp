/*
 * ta_session.cpp - the benchmark's TEE, session and operation driver.
 */
#include "ta_session.h"

#include <cstdio>
#include <cstdlib>
#include <system_error>

#include "keymaster_defs.h"
#include "km/key_material.h"
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

TempDir::TempDir(const std::string &prefix, const std::filesystem::path &parent) {
    const std::filesystem::path where = parent.empty() ? std::filesystem::temp_directory_path() : parent;
    std::string tmpl = (where / (prefix + "-XXXXXX")).string();
    if (!mkdtemp(tmpl.data()))
        throw std::system_error(errno, std::generic_category(), "cannot create a directory in " + tmpl);
    path_ = tmpl;
}

TempDir::~TempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
}

TaSession::TaSession() : state_dir_("km-bench") {
    tee_host::Config config;
    config.state_dir = state_dir_.path();
    config.trace_level = 0;
    tee_ = std::make_unique<tee_host::Tee>(config);
    tee_->install_ta(&keymaster_ta_header);
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session_);
    if (res != TEE_SUCCESS) {
        tee_.reset();
        throw TaFailure("open_session", Reply{res, 0, 0, 0});
    }
}

TaSession::~TaSession() {
    tee_->close_session(session_);
    tee_.reset();
}

Reply TaSession::invoke(uint32_t command, uint32_t a, const Bytes &in, Bytes &out) {
    return call_with([&](uint32_t types, TEE_Param *p) { return tee_->invoke(session_, command, types, p); }, a, in,
                     out);
}

Bytes TaSession::import_private_key(const km::ParamSet &params, uint32_t algorithm, const Bytes &key_file) {
    std::string why;
    const bool rsa = algorithm == KM_ALGORITHM_RSA;
    auto material = rsa ? km::rsa_import_material(key_file, &why) : km::ec_import_material(key_file, &why);
    if (!material)
        throw std::runtime_error(std::string(rsa ? "RSA" : "EC") + " import material: " + why);
    return import_key(params, *material);
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

void TaSession::abort(uint32_t handle) {
    TEE_Param p[4] = {};
    p[0].value.a = handle;
    Reply r;
    r.res = tee_->invoke(session_, KM_CMD_ABORT, TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, 0, 0, 0), p);
    r.error = static_cast<int32_t>(p[0].value.a);
    if (!r.ok())
        throw TaFailure("abort", r);
}

TaOperation::TaOperation(TaSession &ta, uint32_t purpose, const Bytes &blob, const km::ParamSet &begin_params,
                         const Bytes &input, const Bytes &signature, size_t output_capacity)
    : TaOperation(ta, purpose, std::vector<Bytes>{blob}, begin_params, input, signature, output_capacity) {}

TaOperation::TaOperation(TaSession &ta, uint32_t purpose, const std::vector<Bytes> &blobs,
                         const km::ParamSet &begin_params, const Bytes &input, const Bytes &signature,
                         size_t output_capacity)
    : ta_(ta), purpose_(purpose), input_(input) {
    if (blobs.empty())
        throw std::invalid_argument("TaOperation needs a key blob");
    const Bytes no_params = km::ParamSet().serialize();
    const Bytes begin_params_bytes = begin_params.serialize();
    begin_requests_.reserve(blobs.size());
    for (const Bytes &blob : blobs)
        begin_requests_.push_back(two_fields(blob, begin_params_bytes));
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

uint32_t TaOperation::begin() {
    const Bytes &request = begin_requests_[next_];
    next_ = next_ + 1 == begin_requests_.size() ? 0 : next_ + 1;
    Reply r = ta_.invoke(KM_CMD_BEGIN, purpose_, request, response_);
    if (!r.ok())
        throw TaFailure("begin", r);
    return r.b;
}

const Bytes &TaOperation::run() {
    output_.clear();
    const uint32_t handle = begin();
    // A failed update ends the operation in the TA, so nothing to abort.
    if (!input_.empty())
        update_all(handle);
    Reply r = ta_.invoke(KM_CMD_FINISH, handle, finish_request_, response_);
    if (!r.ok() || r.out_len < 8)
        throw TaFailure("finish", r);
    uint32_t len = km::get_u32(response_.data());
    if (4 + size_t{len} > r.out_len)
        throw TaFailure("finish (response layout)", r);
    output_.insert(output_.end(), response_.begin() + 4, response_.begin() + 4 + len);
    return output_;
}

} // namespace bench
