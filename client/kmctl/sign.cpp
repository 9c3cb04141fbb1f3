/*
 * sign.cpp - `kmctl sign`: a signature or MAC over the input, streamed
 * through begin, update and finish; for a SOTER key the signed statement
 * made around the input.
 */
#include <memory>

#include "keymaster_defs.h"
#include "operation.h"
#include "soter_statement.h"

namespace kmctl {
namespace {

struct SignOptions {
    OperationOptions op;
    StatementOutputs statement;
    std::optional<uint32_t> fid;
};

} // namespace

Command add_sign(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<SignOptions>();
    CLI::App *app = kmctl.add_subcommand("sign", "Sign (or MAC) the input with a key");
    add_operation_options(*app, o->op, KM_PURPOSE_SIGN);
    add_in_option(*app, o->op.in, "The message");
    CLI::Option *out = add_out_option(*app, o->op.out, "The signature (SOTER key: the signed statement)", true);
    add_statement_options(*app, o->statement, out);
    app->add_option("--fid", o->fid,
                    "SOTER key: the fingerprint TA reports fingerprint N just before the operation begins")
        ->type_name("N");
    return {app, [o, out, &options] {
                check_one_stdin({{"--key", &o->op.key.blob_path}, {"--in", &o->op.in}});
                check_statement_outputs(o->statement, out, "sign");
                km::ParamSet params = begin_params(o->op);
                km::KeyReference key = key_reference(o->op.key);
                InputStream in(o->op.in);
                Session session(options);
                const bool soter = is_soter_key(take(session.client().characteristics(key)));
                check_statement_key(o->statement, soter);
                if (o->fid && !soter)
                    usage_error("--fid: the fingerprint goes into SOTER statements; this key is not a SOTER key");
                complete_params(session.client(), key, params, KM_PURPOSE_SIGN, 0);
                if (o->fid)
                    report_fid(session.client(), *o->fid);
                km::Bytes signature;
                km::FinishOutput done = run_operation(session.client(), KM_PURPOSE_SIGN, key, params, {}, in, {},
                                                      [&signature](std::span<const uint8_t> d) {
                                                          signature.insert(signature.end(), d.begin(), d.end());
                                                      });
                signature.insert(signature.end(), done.output.begin(), done.output.end());
                if (soter)
                    write_statement(o->op.out, out, o->statement, signature, true);
                else
                    write_output(o->op.out, signature);
            }};
}

} // namespace kmctl
