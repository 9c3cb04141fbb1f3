/*
 * verify.cpp - `kmctl verify`: checks a signature or MAC over the input.
 * Exit 0 when it holds; a mismatch is the TA's refusal,
 * KM_ERROR_VERIFICATION_FAILED, exit 1.
 */
#include <memory>

#include "keymaster_defs.h"
#include "operation.h"

namespace kmctl {
namespace {

struct VerifyOptions {
    OperationOptions op;
    std::string signature;
};

} // namespace

Command add_verify(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<VerifyOptions>();
    CLI::App *app = kmctl.add_subcommand("verify", "Verify a signature (or MAC) over the input; exit 0 when it holds");
    add_operation_options(*app, o->op, KM_PURPOSE_VERIFY);
    add_in_option(*app, o->op.in, "The message");
    app->add_option("--signature", o->signature, "The signature to check (- for stdin)")->required()->type_name("SIG");
    return {app, [o, &options] {
                check_one_stdin({{"--key", &o->op.key.blob_path}, {"--signature", &o->signature}, {"--in", &o->op.in}});
                km::ParamSet params = begin_params(o->op);
                km::KeyReference key = key_reference(o->op.key);
                km::Bytes signature = read_input(o->signature);
                InputStream in(o->op.in);
                Session session(options);
                // An HMAC verification checks as many bits as the MAC it is given.
                complete_params(session.client(), key, params, KM_PURPOSE_VERIFY, signature.size());
                run_operation(session.client(), KM_PURPOSE_VERIFY, key, params, {}, in, signature,
                              [](std::span<const uint8_t>) {});
            }};
}

} // namespace kmctl
