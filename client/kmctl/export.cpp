/*
 * export.cpp - `kmctl export`: the public key of an RSA or EC key as an
 * X.509 SubjectPublicKeyInfo (command 20), DER or PEM; for a SOTER key the
 * signed statement the TA makes of it.
 */
#include <memory>

#include "common.h"
#include "keymaster_defs.h"
#include "key_options.h"
#include "km/key_material.h"
#include "soter_statement.h"

namespace kmctl {
namespace {

struct ExportOptions {
    KeyOptions key;
    std::string format = "pem";
    std::string out;
    StatementOutputs statement;
};

} // namespace

Command add_export(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<ExportOptions>();
    CLI::App *app = kmctl.add_subcommand("export", "Write the public key of an RSA or EC key");
    add_key_options(*app, o->key);
    app->add_option("--format", o->format, "pem (default) or der")
        ->transform(CLI::IsMember({"pem", "der"}, CLI::ignore_case))
        ->type_name("FORMAT");
    CLI::Option *out = add_out_option(*app, o->out, "The public key (SOTER key: the signed statement)", true);
    add_statement_options(*app, o->statement, out);
    return {app, [o, out, &options] {
                check_statement_outputs(o->statement, out, "export");
                km::KeyReference key = key_reference(o->key);
                Session session(options);
                km::ParamSet chars = take(session.client().characteristics(key));
                const bool soter = is_soter_key(chars);
                check_statement_key(o->statement, soter);
                km::Bytes exported = take(session.client().export_key(key));
                if (soter) {
                    write_statement(o->out, out, o->statement, exported, false);
                    return;
                }
                const km::Param *algorithm = chars.find(KM_TAG_ALGORITHM);
                std::string why;
                std::optional<km::Bytes> der =
                    km::public_key_der(algorithm ? static_cast<uint32_t>(algorithm->value) : 0, exported, &why);
                if (!der)
                    throw Failure(kExitTeeFailure, km::describe({TEE_ERROR_BAD_FORMAT, 0}) + ": " + why);
                if (o->format == "der")
                    write_output(o->out, *der);
                else
                    write_output(o->out, km::pem_encode("PUBLIC KEY", *der));
            }};
}

} // namespace kmctl
