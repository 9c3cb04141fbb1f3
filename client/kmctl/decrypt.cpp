/*
 * decrypt.cpp - `kmctl decrypt`: the input decrypted with a key, streamed.
 */
#include "keymaster_defs.h"
#include "operation.h"

namespace kmctl {

Command add_decrypt(CLI::App &kmctl, const GlobalOptions &options) {
    return add_cipher_command(kmctl, options, KM_PURPOSE_DECRYPT, "decrypt", "Decrypt the input with a key");
}

} // namespace kmctl
