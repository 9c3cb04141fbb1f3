/*
 * key_options.cpp - naming an existing key on the command line.
 */
#include "key_options.h"

#include "common.h"

namespace kmctl {

void add_key_options(CLI::App &app, KeyOptions &key) {
    app.add_option("--key", key.blob_path, "The key blob (- for stdin)")->required()->type_name("BLOB");
    app.add_option("--app-id", key.app_id, "The application id the key was bound to")->type_name("TEXT");
    app.add_option("--app-data", key.app_data, "The application data the key was bound to")->type_name("TEXT");
}

km::KeyReference key_reference(const KeyOptions &key) {
    return {read_input(key.blob_path), text_bytes(key.app_id), text_bytes(key.app_data)};
}

} // namespace kmctl
