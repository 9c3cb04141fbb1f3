/*
 * embedded_tee.cpp - the in-process transport.
 */
#include "km/embedded_tee.h"

#include "ta_entry.h"
#include "tee_host.h"

namespace km {

EmbeddedTee::EmbeddedTee(const std::filesystem::path &state_dir, int trace_level) {
    tee_host::Config config;
    config.state_dir = state_dir;
    config.trace_level = trace_level;
    tee_ = std::make_unique<tee_host::Tee>(config);
    tee_->install_ta(&keymaster_ta_header);
}

EmbeddedTee::~EmbeddedTee() {
    close();
}

TEE_Result EmbeddedTee::open() {
    if (session_ != 0)
        return TEE_ERROR_BAD_STATE;
    uint32_t session = 0;
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session);
    if (res == TEE_SUCCESS)
        session_ = session;
    return res;
}

TEE_Result EmbeddedTee::invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) {
    if (session_ == 0)
        return TEE_ERROR_BAD_STATE;
    return tee_->invoke(session_, cmd, types, params);
}

TEE_Result EmbeddedTee::notify_fid(uint32_t fid) {
    return tee_host::fingerprint::notify(keymaster_ta_uuid, fid);
}

void EmbeddedTee::close() {
    if (session_ == 0)
        return;
    tee_->close_session(session_);
    session_ = 0;
}

} // namespace km
