/*
 * main.cpp - kmctl: parses the command line and runs the chosen subcommand.
 */
#include <iostream>
#include <new>
#include <string>
#include <vector>

#include "common.h"

namespace kmctl {
// add_soter - `kmctl soter` and its subcommands (soter.cpp).
Command add_soter(CLI::App &kmctl, const GlobalOptions &options);
} // namespace kmctl

int main(int argc, char **argv) {
    CLI::App app("Drive the Keymaster TA, on a TEE in this process or through kmd (--socket).", "kmctl");
    kmctl::GlobalOptions options;
    kmctl::add_global_options(app, options);
    app.set_version_flag("--version", "kmctl " KM_VERSION, "Print kmctl's version and exit");
    app.require_subcommand(1);
    // Global options may also follow the subcommand.
    app.fallthrough();

    std::vector<kmctl::Command> commands = {
        kmctl::add_info(app, options),    kmctl::add_generate(app, options),
        kmctl::add_import(app, options),  kmctl::add_characteristics(app, options),
        kmctl::add_delete(app, options),  kmctl::add_export(app, options),
        kmctl::add_sign(app, options),    kmctl::add_verify(app, options),
        kmctl::add_encrypt(app, options), kmctl::add_decrypt(app, options),
    };
    commands.push_back(kmctl::add_soter(app, options));
    commands.push_back(kmctl::add_demo(app, options));

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError &e) {
        // A misspelt command would otherwise read "A subcommand is required".
        std::vector<std::string> rest = app.remaining();
        if (e.get_name() == "RequiredError" && app.get_subcommands().empty() && !rest.empty()) {
            std::cerr << "Unknown command: " << rest.front() << "\nRun with --help for more information.\n";
            return kmctl::kExitUsage;
        }
        // --help arrives here too, with exit code 0.
        return app.exit(e) == 0 ? kmctl::kExitOk : kmctl::kExitUsage;
    }

    for (const kmctl::Command &c : commands) {
        if (!c.app->parsed())
            continue;
        try {
            c.run();
            return kmctl::kExitOk;
        } catch (const kmctl::Failure &f) {
            std::cerr << f.what() << '\n';
            return f.code();
        } catch (const std::bad_alloc &) {
            std::cerr << "kmctl: out of memory\n";
            return kmctl::kExitLocal;
        } catch (const std::exception &e) {
            std::cerr << "kmctl: " << e.what() << '\n';
            return kmctl::kExitLocal;
        }
    }
    return kmctl::kExitUsage;
}
