/*
 * soter_statement.cpp - writing a SOTER key's signed statements.
 */
#include "soter_statement.h"

#include "common.h"
#include "keymaster_defs.h"
#include "soter/verifier.h"

namespace kmctl {

void add_statement_options(CLI::App &app, StatementOutputs &s, CLI::Option *out) {
    CLI::Option *json =
        app.add_option("--json-out", s.json_out,
                       "SOTER key: write the statement's signed JSON document here (a signing document keeps its NUL)")
            ->type_name("FILE");
    CLI::Option *sig =
        app.add_option("--signature-out", s.signature_out, "SOTER key: write the statement's signature here")
            ->type_name("FILE");
    json->needs(sig);
    sig->needs(json);
    // With the split, the whole statement need not go anywhere.
    out->required(false);
}

bool is_soter_key(const km::ParamSet &chars) {
    return chars.find(KM_TAG_SOTER_IS_FROM_SOTER) != nullptr;
}

void check_statement_outputs(const StatementOutputs &s, CLI::Option *out, const std::string &command) {
    if (!s.split() && out->count() == 0)
        usage_error(command + " needs --out (or, for a SOTER key, --json-out and --signature-out)");
}

void check_statement_key(const StatementOutputs &s, bool soter) {
    if (s.split() && !soter)
        usage_error("--json-out and --signature-out split a SOTER statement; this key is not a SOTER key");
}

void write_statement(const std::string &out_path, CLI::Option *out, const StatementOutputs &s, const km::Bytes &output,
                     bool signing) {
    if (out->count() > 0)
        write_output(out_path, output);
    if (!s.split())
        return;
    soter::Split parts = signing ? soter::split_sign_output(output) : soter::split_export_output(output);
    if (!parts.ok())
        throw Failure(kExitTeeFailure, km::describe({TEE_ERROR_BAD_FORMAT, 0}) + ": " + parts.reason);
    // The signed bytes exactly, so that any RSA tool can check the signature.
    write_output(s.json_out, parts.document);
    write_output(s.signature_out, parts.signature);
}

void report_fid(km::Client &client, uint32_t fid) {
    check(client.soter_load_attk());
    km::Status s = client.notify_fid(fid);
    if (s.tee == TEE_ERROR_ITEM_NOT_FOUND)
        throw Failure(kExitRefused, "the device has no fingerprint TA: it is not provisioned");
    check(s);
}

} // namespace kmctl
