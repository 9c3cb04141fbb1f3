/*
 * client.h - typed calls to the Keymaster TA over a transport.
 *
 * Every call ends one of three ways, told apart by its Status: the TEE
 * failed the command (tee != TEE_SUCCESS), the TA refused it with a
 * Keymaster error (tee == TEE_SUCCESS, km != 0), or it succeeded. An
 * answer of the wrong shape counts as a TEE failure, TEE_ERROR_BAD_FORMAT.
 */
#ifndef KM_CLIENT_H
#define KM_CLIENT_H

#include <cstdint>
#include <string>
#include <vector>

#include "km/transport.h"
#include "tee_api_defines.h"

namespace km {

struct Status {
    TEE_Result tee = TEE_SUCCESS;
    int32_t km = 0; // a keymaster_error_t; meaningful only when tee is TEE_SUCCESS

    bool ok() const { return tee == TEE_SUCCESS && km == 0; }
    bool tee_failed() const { return tee != TEE_SUCCESS; }
    bool refused() const { return tee == TEE_SUCCESS && km != 0; }
};

// describe - one line for a failed status: "KM_ERROR_NAME (-N): sentence"
// for a refusal, "TEE_ERROR_NAME (0x........)" for a TEE failure, "ok" otherwise.
std::string describe(const Status &status);

// Result - a status and, when it is ok, the value.
template <typename T> struct Result {
    Status status;
    T value{};

    bool ok() const { return status.ok(); }
};

using ValueList = std::vector<uint32_t>;

class Client {
public:
    // Client - calls through transport, which the caller opens before the
    // first call and keeps alive as long as the client.
    explicit Client(Transport &transport) : transport_(transport) {}

    // algorithms - the algorithms the TA supports, in its order (commands 1, 2).
    Result<ValueList> algorithms();
    // block_modes, paddings, digests - what an algorithm supports for a
    // purpose (commands 3-8). An unsupported purpose or algorithm is a
    // refusal, KM_ERROR_UNSUPPORTED_PURPOSE.
    Result<ValueList> block_modes(uint32_t algorithm, uint32_t purpose);
    Result<ValueList> paddings(uint32_t algorithm, uint32_t purpose);
    Result<ValueList> digests(uint32_t algorithm, uint32_t purpose);
    // import_formats, export_formats - the key formats an algorithm takes
    // in and gives out (commands 9-12); KM_ERROR_UNSUPPORTED_ALGORITHM for
    // an algorithm the TA lacks.
    Result<ValueList> import_formats(uint32_t algorithm);
    Result<ValueList> export_formats(uint32_t algorithm);

private:
    // Runs a count command then its list command with a buffer of exactly
    // four bytes per entry.
    Result<ValueList> count_then_list(uint32_t count_cmd, uint32_t list_cmd, uint32_t algorithm, uint32_t purpose);

    Transport &transport_;
};

} // namespace km

#endif
