/*
 * embedded_tee.h - a transport to a Keymaster TA running in this process
 * on the emulated TEE.
 */
#ifndef KM_EMBEDDED_TEE_H
#define KM_EMBEDDED_TEE_H

#include <cstdint>
#include <filesystem>
#include <memory>

#include "km/transport.h"

namespace tee_host {
class Tee;
}

namespace km {

class EmbeddedTee final : public Transport {
  public:
    // EmbeddedTee - starts the emulated TEE with its persistent state in
    // state_dir (created when missing) and platform trace lines up to
    // trace_level on stderr, and installs the Keymaster TA. The emulation
    // allows one TEE per process: a second live EmbeddedTee aborts.
    EmbeddedTee(const std::filesystem::path &state_dir, int trace_level);
    // ~EmbeddedTee - closes the session and stops the TEE.
    ~EmbeddedTee() override;
    EmbeddedTee(const EmbeddedTee &) = delete;
    EmbeddedTee &operator=(const EmbeddedTee &) = delete;

    // open - opens a session as a normal-world client.
    TEE_Result open() override;
    TEE_Result invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) override;
    void close() override;
    TEE_Result notify_fid(uint32_t fid) override;

    // tee - the emulated TEE itself, for callers that drive the platform.
    tee_host::Tee &tee() { return *tee_; }

  private:
    std::unique_ptr<tee_host::Tee> tee_;
    uint32_t session_ = 0; // 0: no session open
};

} // namespace km

#endif
