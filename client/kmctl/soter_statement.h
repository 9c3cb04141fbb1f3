/*
 * soter_statement.h - what export and sign do with a SOTER key's output:
 * the signed statement as the TA made it, or split into its JSON document
 * and its signature.
 */
#ifndef KMCTL_SOTER_STATEMENT_H
#define KMCTL_SOTER_STATEMENT_H

#include <string>

#include <CLI/CLI.hpp>

#include "km/client.h"

namespace kmctl {

struct StatementOutputs {
    std::string json_out;
    std::string signature_out;

    bool split() const { return !json_out.empty() || !signature_out.empty(); }
};

// add_statement_options - --json-out FILE and --signature-out FILE, given
// together; out (--out) is then not needed.
void add_statement_options(CLI::App &app, StatementOutputs &s, CLI::Option *out);

// is_soter_key - whether the key's characteristics mark it a SOTER key.
bool is_soter_key(const km::ParamSet &chars);

// check_statement_outputs - refuses (usage) a command line that sends the
// output nowhere; before any TEE starts.
void check_statement_outputs(const StatementOutputs &s, CLI::Option *out, const std::string &command);

// check_statement_key - refuses (usage) a split for a key that is not a SOTER key.
void check_statement_key(const StatementOutputs &s, bool soter);

// write_statement - the output as it came to --out, and/or its signed
// document (a signing document with its NUL) to --json-out and its
// signature to --signature-out. A malformed output is a TEE failure.
void write_statement(const std::string &out_path, CLI::Option *out, const StatementOutputs &s, const km::Bytes &output,
                     bool signing);

// report_fid - has the fingerprint TA report fingerprint fid. The Keymaster
// TA listens to it only once its SOTER state is loaded, so that comes
// first. Throws Failure: refused when the device is not provisioned.
void report_fid(km::Client &client, uint32_t fid);

} // namespace kmctl

#endif
