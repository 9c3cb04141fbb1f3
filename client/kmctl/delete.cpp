/*
 * delete.cpp - `kmctl delete`: retire one key blob (command 21) or all of
 * them (command 22).
 */
#include <memory>

#include "common.h"

namespace kmctl {
namespace {

struct DeleteOptions {
    std::string key;
    bool all = false;
};

} // namespace

Command add_delete(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<DeleteOptions>();
    CLI::App *app = kmctl.add_subcommand("delete", "Delete a key (--key BLOB) or every key (--all)");
    CLI::Option *key = app->add_option("--key", o->key, "The key blob to delete (- for stdin)")->type_name("BLOB");
    CLI::Option *all = app->add_flag("--all", o->all, "Delete every key");
    key->excludes(all);
    all->excludes(key);
    return {app, [o, &options] {
                if (!o->all && o->key.empty())
                    usage_error("delete needs --key BLOB or --all");
                if (o->all) {
                    Session session(options);
                    check(session.client().delete_all_keys());
                    return;
                }
                km::Bytes blob = read_input(o->key);
                Session session(options);
                check(session.client().delete_key(blob));
            }};
}

} // namespace kmctl
