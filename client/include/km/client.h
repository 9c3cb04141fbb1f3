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

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include "km/param_set.h"
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

// KeyReference - a key blob with the application id and data it was bound
// to at creation; empty fields when it was bound to none.
struct KeyReference {
    Bytes blob;
    Bytes app_id;
    Bytes app_data;
};

// ImportedKey - what an import returns: the new blob and its characteristics.
struct ImportedKey {
    Bytes blob;
    ParamSet characteristics;
};

// Operation - a begun operation: its handle and the parameters begin
// returned (a nonce the TA chose, for instance).
struct Operation {
    uint32_t handle = 0;
    ParamSet out_params;
};

// UpdateOutput - how much input an update consumed and what it produced.
struct UpdateOutput {
    uint32_t consumed = 0;
    Bytes output;
};

// FinishOutput - the last output of an operation and its output parameters.
struct FinishOutput {
    Bytes output;
    ParamSet out_params;
};

// Response capacities. Blobs and finish outputs have no size query, so the
// buffers are generous and the result is trimmed to what the TA wrote.
constexpr size_t kBlobCapacity = 16 * 1024;
constexpr size_t kImportCapacity = kBlobCapacity + 8 * 1024; // blob and characteristics
constexpr size_t kExportCapacity = 16 * 1024;
constexpr size_t kBeginCapacity = 4 * 1024;
constexpr size_t kUpdateSlack = 64; // update output room beyond the input length
constexpr size_t kFinishCapacity = 64 * 1024;
// Input goes to update in pieces of at most this size.
constexpr size_t kStreamChunk = 64 * 1024;

// InputSource - puts up to n bytes at buf and returns how many; fewer than
// n only at the end of the input. It may throw.
using InputSource = std::function<size_t(uint8_t *buf, size_t n)>;
// OutputSink - takes output as it comes. It may throw.
using OutputSink = std::function<void(std::span<const uint8_t>)>;

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

    // generate_key - a new key with these parameters (command 13); the value
    // is its blob.
    Result<Bytes> generate_key(const ParamSet &params);
    // import_key - a key made from material (command 19): raw bytes for HMAC
    // and AES, the layouts of key_material.h for RSA and EC.
    Result<ImportedKey> import_key(const ParamSet &params, std::span<const uint8_t> material);
    // characteristics_size - the serialized size of a key's characteristics
    // (command 14). A wrong application id or data is KM_ERROR_INVALID_KEY_BLOB.
    Result<uint32_t> characteristics_size(const KeyReference &key);
    // characteristics - a key's characteristics (commands 14 then 15, with
    // a buffer of exactly the announced size). Hidden tags are never included.
    Result<ParamSet> characteristics(const KeyReference &key);
    // export_key - the key's public part as the TA exports it (command 20).
    Result<Bytes> export_key(const KeyReference &key);
    // delete_key, delete_all_keys - commands 21 and 22.
    Status delete_key(std::span<const uint8_t> blob);
    Status delete_all_keys();

    // begin - starts an operation for purpose (command 16). The TA keeps the
    // operation until finish, abort or a failed update ends it; a caller that
    // gives up between those calls abort.
    Result<Operation> begin(uint32_t purpose, std::span<const uint8_t> blob, const ParamSet &params);
    // update - feeds input (command 17). The TA may consume less than all
    // of it; the caller passes the rest again. A refusal ends the operation.
    Result<UpdateOutput> update(uint32_t handle, std::span<const uint8_t> input, const ParamSet &params = {});
    // finish - ends the operation (command 18), with the signature to check
    // when verifying. It always ends the operation, whatever the outcome.
    Result<FinishOutput> finish(uint32_t handle, std::span<const uint8_t> signature = {}, const ParamSet &params = {},
                                size_t capacity = kFinishCapacity);
    // stream - everything source gives, fed to a begun operation through
    // update in pieces of at most chunk bytes (what the TA did not consume
    // goes again with the next piece), each update's output to sink, then
    // finish with signature. first_update's parameters go with the first
    // update only, which is sent even for an empty input when they are not
    // empty. Whatever the outcome, a refusal, a TEE failure or an exception
    // from source or sink (rethrown), the operation is ended on return. A
    // TA that stops consuming input is TEE_ERROR_BAD_FORMAT.
    Result<FinishOutput> stream(uint32_t handle, const InputSource &source, const OutputSink &sink,
                                const ParamSet &first_update = {}, std::span<const uint8_t> signature = {},
                                size_t chunk = kStreamChunk);
    // abort - ends the operation without output (command 23);
    // KM_ERROR_INVALID_OPERATION_HANDLE when it is already gone.
    Status abort(uint32_t handle);

    // SOTER commands. Their codes are the TA's own, not all Keymaster
    // errors: a refusal carries the raw code in status.km.
    // soter_load_attk - command 0xFF00: the TA loads its SOTER state from
    // the provisioning TA; refused with -1000 when that fails.
    Status soter_load_attk();
    // soter_verify_attk - command 0xFF01: the TA's verdict as the value, 0
    // when the provisioning TA's key loads, -1 when it has none, -2 for any
    // other failure; status reports only TEE failures.
    Result<int32_t> soter_verify_attk();
    // soter_export_attk - command 0xFF02: the ATTK public key as PEM text
    // (without the NUL the TA counts). Refusals: -38 no buffer, -1 the
    // SOTER state does not load, -1000 the export failed.
    Result<std::string> soter_export_attk();
    // soter_device_id - command 0xFF03: the device identifier bytes.
    Result<Bytes> soter_device_id();
    // notify_fid - the fingerprint TA beside the Keymaster TA reports that
    // fingerprint fid matched (it sends command 0xFF04 itself). The
    // Keymaster TA takes it only once its SOTER state is loaded (see
    // soter_load_attk); a refusal is a TEE result: TEE_ERROR_ACCESS_DENIED
    // (not loaded), TEE_ERROR_ITEM_NOT_FOUND (no fingerprint TA: the device
    // is not provisioned), TEE_ERROR_NOT_SUPPORTED (this transport reaches none).
    Status notify_fid(uint32_t fid);

  private:
    // Runs a count command then its list command with a buffer of exactly
    // four bytes per entry.
    Result<ValueList> count_then_list(uint32_t count_cmd, uint32_t list_cmd, uint32_t algorithm, uint32_t purpose);

    Transport &transport_;
};

} // namespace km

#endif
