/*
 * encrypt.cpp - `kmctl encrypt`: the input encrypted with a key, streamed.
 */
#include "keymaster_defs.h"
#include "operation.h"

namespace kmctl {

Command add_encrypt(CLI::App &kmctl, const GlobalOptions &options) {
    return add_cipher_command(kmctl, options, KM_PURPOSE_ENCRYPT, "encrypt", "Encrypt the input with a key");
}

} // namespace kmctl
