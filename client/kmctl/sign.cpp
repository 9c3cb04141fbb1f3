/*
 * sign.cpp - `kmctl sign`: a signature or MAC over the input, streamed
 * through begin, update and finish.
 */
#include <memory>

#include "keymaster_defs.h"
#include "operation.h"

namespace kmctl {

Command add_sign(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<OperationOptions>();
    CLI::App *app = kmctl.add_subcommand("sign", "Sign (or MAC) the input with a key");
    add_operation_options(*app, *o, KM_PURPOSE_SIGN);
    add_in_option(*app, o->in, "The message");
    add_out_option(*app, o->out, "The signature", true);
    return {app, [o, &options] {
                check_one_stdin({{"--key", &o->key.blob_path}, {"--in", &o->in}});
                km::ParamSet params = begin_params(*o);
                km::KeyReference key = key_reference(o->key);
                InputStream in(o->in);
                Session session(options);
                complete_params(session.client(), key, params, KM_PURPOSE_SIGN, 0);
                km::Bytes signature;
                km::FinishOutput done = run_operation(session.client(), KM_PURPOSE_SIGN, key, params, {}, in, {},
                                                      [&signature](std::span<const uint8_t> d) {
                                                          signature.insert(signature.end(), d.begin(), d.end());
                                                      });
                signature.insert(signature.end(), done.output.begin(), done.output.end());
                write_output(o->out, signature);
            }};
}

} // namespace kmctl
