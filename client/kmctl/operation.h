/*
 * operation.h - what sign, verify, encrypt and decrypt share: their
 * options, the begin parameters those make, and the begin / update /
 * finish pipeline that streams the input through the TA.
 */
#ifndef KMCTL_OPERATION_H
#define KMCTL_OPERATION_H

#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "common.h"
#include "key_options.h"
#include "km/client.h"

namespace kmctl {

struct OperationOptions {
    KeyOptions key;
    std::string digest;
    std::string padding;
    std::string block_mode;
    std::string mac_length;
    std::string nonce; // hex
    std::string aad;   // a file
    std::vector<std::string> params;
    std::string in;
    std::string out;
};

// add_operation_options - --key, --app-id, --app-data, --digest,
// --padding, --mac-length, --param, --in and --out; with_cipher adds
// --block-mode, --nonce and --aad.
void add_operation_options(CLI::App &app, OperationOptions &o, bool with_cipher);

// begin_params - the begin parameters the options give, application id
// and data included. Throws Failure (usage) for a bad value.
km::ParamSet begin_params(const OperationOptions &o);

// add_default_mac_length - for an HMAC key, whose operations need
// KM_TAG_MAC_LENGTH, adds bits (or, when bits is 0, the full length of the
// key's digest) unless params already carry one. Other keys are left
// alone. Reads the key's characteristics; throws Failure as check does.
void add_default_mac_length(km::Client &client, const km::KeyReference &key, km::ParamSet &params, uint32_t bits);

// run_operation - begin for purpose, then the whole input streamed
// through the operation (km::Client::stream): first_update's parameters
// (associated data) with the first update, every update's output to sink,
// finish with signature. Returns the finish output; *begin_out (if given)
// receives begin's output parameters. The operation never outlives the
// call. Throws Failure.
km::FinishOutput run_operation(km::Client &client, uint32_t purpose, const km::KeyReference &key,
                               const km::ParamSet &params, const km::ParamSet &first_update, InputStream &input,
                               std::span<const uint8_t> signature, const km::OutputSink &sink,
                               km::ParamSet *begin_out = nullptr);

// add_cipher_command - encrypt or decrypt: the pipeline with its output
// streamed to --out, associated data from --aad, and the nonce the TA
// chose (when it chose one) written to --nonce-out or reported on stderr.
Command add_cipher_command(CLI::App &kmctl, const GlobalOptions &options, uint32_t purpose, const std::string &name,
                           const std::string &help);

} // namespace kmctl

#endif
