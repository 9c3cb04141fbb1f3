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
// --padding, --mac-length and --param, their help naming only what applies
// to the purpose; encrypt and decrypt add --block-mode, --nonce and --aad.
void add_operation_options(CLI::App &app, OperationOptions &o, uint32_t purpose);

// begin_params - the begin parameters the options give, application id
// and data included. Throws Failure (usage) for a bad value.
km::ParamSet begin_params(const OperationOptions &o);

// complete_params - reads the key's characteristics and completes the
// begin parameters: an HMAC MAC length (the digest's, or for verify the
// given MAC's), refusing one longer than the digest (usage; for verify a
// MAC that long is KM_ERROR_VERIFICATION_FAILED); the key's only block
// mode, padding and digest where the command gave none, refusing (usage,
// naming the option) when the key has several; a GCM tag length. RSA
// public-key operations keep what was given, encrypt warning on stderr
// when the key's decryption refuses its padding. Throws Failure.
void complete_params(km::Client &client, const km::KeyReference &key, km::ParamSet &params, uint32_t purpose,
                     size_t signature_bytes);

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
