/*
 * transport.h - how a client reaches the Keymaster TA: open a session,
 * invoke commands on it, close it. The embedded TEE is one transport; a
 * daemon connection can be another.
 */
#ifndef KM_TRANSPORT_H
#define KM_TRANSPORT_H

#include <cstdint>

#include "tee_api_defines.h"
#include "tee_api_types.h"

namespace km {

class Transport {
  public:
    virtual ~Transport() = default;

    // open - opens a session to the Keymaster TA. TEE_SUCCESS, or the TEE's
    // reason for refusing. Opening an open transport is TEE_ERROR_BAD_STATE.
    virtual TEE_Result open() = 0;

    // invoke - runs one command with the caller's parameters. The caller
    // owns the memory references; the TA writes outputs in place, as the
    // types word allows. TEE_ERROR_BAD_STATE when no session is open;
    // otherwise the TEE's or the TA's result.
    virtual TEE_Result invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) = 0;

    // close - closes the session; closing a closed transport does nothing.
    virtual void close() = 0;

    // notify_fid - has the fingerprint TA beside the Keymaster TA report
    // that fingerprint fid matched (it sends its notification now).
    // TEE_SUCCESS when the Keymaster TA took it; otherwise the refusal
    // (TEE_ERROR_ITEM_NOT_FOUND: the device has no fingerprint TA;
    // TEE_ERROR_NOT_SUPPORTED: this transport reaches none).
    virtual TEE_Result notify_fid(uint32_t) { return TEE_ERROR_NOT_SUPPORTED; }
};

} // namespace km

#endif
