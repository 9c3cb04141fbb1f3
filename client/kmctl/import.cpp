/*
 * import.cpp - `kmctl import`: a key the user holds, sealed into a blob
 * (command 19). HMAC and AES keys are raw bytes; RSA and EC keys are
 * PKCS#8, converted here to the TA's import material.
 */
#include <memory>

#include "common.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "param_options.h"

namespace kmctl {
namespace {

struct ImportOptions {
    NewKeyOptions key;
    std::string in;
    std::string out;
};

km::Bytes material_for(uint32_t algorithm, const km::Bytes &key) {
    std::string why;
    std::optional<km::Bytes> material;
    if (algorithm == KM_ALGORITHM_RSA)
        material = km::rsa_import_material(key, &why);
    else if (algorithm == KM_ALGORITHM_EC)
        material = km::ec_import_material(key, &why);
    else
        return key; // raw symmetric key bytes go as they are
    if (!material)
        usage_error("--in: " + why);
    return std::move(*material);
}

} // namespace

Command add_import(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<ImportOptions>();
    CLI::App *app = kmctl.add_subcommand(
        "import", "Import a key (raw bytes for HMAC and AES, PKCS#8 PEM or DER for RSA and EC) and write its key blob");
    add_new_key_options(*app, o->key);
    add_in_option(*app, o->in, "The key to import", true);
    add_out_option(*app, o->out, "The key blob", true);
    return {app, [o, &options] {
                uint32_t algorithm = 0;
                km::ParamSet params = key_params(o->key, &algorithm, false);
                km::Bytes file = read_input(o->in);
                km::Bytes material = material_for(algorithm, file);
                wipe(file);
                Session session(options);
                km::Result<km::ImportedKey> imported = session.client().import_key(params, material);
                wipe(material);
                km::ImportedKey key = take(std::move(imported));
                write_output(o->out, key.blob);
            }};
}

} // namespace kmctl
