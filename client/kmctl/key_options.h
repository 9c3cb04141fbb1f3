/*
 * key_options.h - the options that name an existing key: --key BLOB and
 * the --app-id and --app-data it was bound to.
 */
#ifndef KMCTL_KEY_OPTIONS_H
#define KMCTL_KEY_OPTIONS_H

#include <string>

#include <CLI/CLI.hpp>

#include "km/client.h"

namespace kmctl {

struct KeyOptions {
    std::string blob_path;
    std::string app_id;
    std::string app_data;
};

// add_key_options - --key BLOB (required), --app-id TEXT, --app-data TEXT.
void add_key_options(CLI::App &app, KeyOptions &key);

// key_reference - the blob read from its file ("-" for stdin) with the
// application id and data. Throws Failure (local) when it cannot be read.
km::KeyReference key_reference(const KeyOptions &key);

} // namespace kmctl

#endif
