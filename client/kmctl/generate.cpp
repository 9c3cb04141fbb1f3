/*
 * generate.cpp - `kmctl generate`: a new key, written as a blob (command 13).
 */
#include <memory>

#include "common.h"
#include "param_options.h"

namespace kmctl {
namespace {

struct GenerateOptions {
    NewKeyOptions key;
    std::string out;
};

} // namespace

Command add_generate(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<GenerateOptions>();
    CLI::App *app = kmctl.add_subcommand("generate", "Generate a key in the TA and write its key blob");
    add_new_key_options(*app, o->key);
    add_out_option(*app, o->out, "The key blob", true);
    return {app, [o, &options] {
                uint32_t algorithm = 0;
                km::ParamSet params = key_params(o->key, &algorithm, true);
                Session session(options);
                km::Bytes blob = take(session.client().generate_key(params));
                write_output(o->out, blob);
            }};
}

} // namespace kmctl
