/*
 * operation.cpp - the options and the streaming pipeline of sign, verify,
 * encrypt and decrypt.
 */
#include "operation.h"

#include <algorithm>
#include <iostream>
#include <memory>

#include "keymaster_defs.h"
#include "km/names.h"
#include "km/param_text.h"
#include "param_options.h"

namespace kmctl {
namespace {

// The paddings that make sense for a purpose, by algorithm.
std::vector<uint32_t> paddings_for(uint32_t algorithm, uint32_t purpose) {
    if (algorithm == KM_ALGORITHM_AES)
        return {KM_PAD_NONE, KM_PAD_PKCS7};
    if (algorithm != KM_ALGORITHM_RSA)
        return {};
    if (purpose == KM_PURPOSE_SIGN || purpose == KM_PURPOSE_VERIFY)
        return {KM_PAD_NONE, KM_PAD_RSA_PSS, KM_PAD_RSA_PKCS1_1_5_SIGN};
    return {KM_PAD_NONE, KM_PAD_RSA_OAEP, KM_PAD_RSA_PKCS1_1_5_ENCRYPT};
}

std::vector<uint32_t> key_values(const km::ParamSet &chars, uint32_t tag, const std::vector<uint32_t> &applicable) {
    std::vector<uint32_t> out;
    for (const km::Param &p : chars.params()) {
        const uint32_t v = static_cast<uint32_t>(p.value);
        if (p.tag == tag &&
            (applicable.empty() || std::find(applicable.begin(), applicable.end(), v) != applicable.end()))
            out.push_back(v);
    }
    return out;
}

// Adds the key's one value for tag when the command gave none; with
// several to choose from, the user must, and is told which option to add.
void default_from_key(km::ParamSet &params, const km::ParamSet &chars, uint32_t tag, km::Enumeration e,
                      const std::vector<uint32_t> &applicable, const std::string &command, const std::string &option) {
    if (params.find(tag))
        return;
    std::vector<uint32_t> allowed = key_values(chars, tag, applicable);
    if (allowed.size() == 1) {
        params.add(tag, allowed.front());
        return;
    }
    std::string names;
    for (uint32_t v : allowed)
        names += (names.empty() ? "" : ", ") + km::enum_name(e, v);
    usage_error(command + " needs " + option +
                (allowed.empty() ? std::string(": the key allows none for this use") : ": the key allows " + names));
}

const char *command_name(uint32_t purpose) {
    switch (purpose) {
    case KM_PURPOSE_SIGN:
        return "sign";
    case KM_PURPOSE_VERIFY:
        return "verify";
    case KM_PURPOSE_ENCRYPT:
        return "encrypt";
    default:
        return "decrypt";
    }
}

} // namespace

void add_operation_options(CLI::App &app, OperationOptions &o, uint32_t purpose) {
    const bool signing = purpose == KM_PURPOSE_SIGN || purpose == KM_PURPOSE_VERIFY;
    add_key_options(app, o.key);
    app.add_option("--digest", o.digest,
                   "Digest: none, md5, sha1, sha224, sha256, sha384, sha512 (default: the key's only one)")
        ->type_name("DIGEST");
    app.add_option("--padding", o.padding,
                   signing ? "Padding: rsa_pss, rsa_pkcs1_1_5_sign or none (default: the key's only one)"
                           : "Padding: rsa_oaep, rsa_pkcs1_1_5_encrypt, pkcs7 or none (default: the key's only one)")
        ->type_name("PADDING");
    app.add_option("--mac-length", o.mac_length,
                   signing ? "HMAC length in bits, a multiple of 8 (default: the digest's length)"
                           : "GCM tag length in bits, a multiple of 8 (default: the key's minimum, else 128)")
        ->type_name("BITS");
    if (!signing) {
        app.add_option("--block-mode", o.block_mode, "Block mode: ecb, cbc, ctr, gcm (default: the key's only one)")
            ->type_name("MODE");
        app.add_option("--nonce", o.nonce, "Nonce or IV, in hex (KM_TAG_NONCE)")->type_name("HEX");
        app.add_option("--aad", o.aad, "Associated data for GCM, read from this file")->type_name("FILE");
    }
    app.add_option("--param", o.params, "Any operation parameter, NAME[=VALUE]; repeatable")
        ->allow_extra_args(false)
        ->type_name("NAME[=VALUE]");
}

km::ParamSet begin_params(const OperationOptions &o) {
    km::ParamSet set;
    if (!o.digest.empty())
        add_tag_value(set, "--digest", "KM_TAG_DIGEST", o.digest);
    if (!o.padding.empty())
        add_tag_value(set, "--padding", "KM_TAG_PADDING", o.padding);
    if (!o.block_mode.empty())
        add_tag_value(set, "--block-mode", "KM_TAG_BLOCK_MODE", o.block_mode);
    if (!o.mac_length.empty()) {
        add_tag_value(set, "--mac-length", "KM_TAG_MAC_LENGTH", o.mac_length);
        const uint64_t bits = set.find(KM_TAG_MAC_LENGTH)->value;
        if (bits == 0 || bits % 8 != 0)
            usage_error("--mac-length: a whole number of bytes in bits, a multiple of 8, not " + std::to_string(bits));
    }
    if (!o.nonce.empty())
        add_tag_value(set, "--nonce", "KM_TAG_NONCE", o.nonce);
    if (!o.key.app_id.empty())
        set.add_bytes(KM_TAG_APPLICATION_ID, text_bytes(o.key.app_id));
    if (!o.key.app_data.empty())
        set.add_bytes(KM_TAG_APPLICATION_DATA, text_bytes(o.key.app_data));
    for (const std::string &p : o.params)
        add_param_text(set, "--param", p);
    check_single_tags(set);
    return set;
}

void complete_params(km::Client &client, const km::KeyReference &key, km::ParamSet &params, uint32_t purpose,
                     size_t signature_bytes) {
    km::ParamSet chars = take(client.characteristics(key));
    const km::Param *alg_param = chars.find(KM_TAG_ALGORITHM);
    const uint32_t algorithm = alg_param ? static_cast<uint32_t>(alg_param->value) : 0;
    const std::string command = command_name(purpose);

    if (algorithm == KM_ALGORITHM_HMAC) {
        const km::Param *d = params.find(KM_TAG_DIGEST);
        if (!d)
            d = chars.find(KM_TAG_DIGEST);
        const uint32_t full = d ? digest_bits(static_cast<uint32_t>(d->value)) : 0;
        const km::Param *given = params.find(KM_TAG_MAC_LENGTH);
        if (given && full != 0 && given->value > full)
            usage_error("--mac-length: at most the digest's " + std::to_string(full) + " bits");
        // A MAC longer than the digest cannot be one the key made.
        if (purpose == KM_PURPOSE_VERIFY && full != 0 && signature_bytes * 8 > full)
            throw Failure(kExitRefused, km::describe({TEE_SUCCESS, KM_ERROR_VERIFICATION_FAILED}));
        if (!given && full != 0)
            params.add(KM_TAG_MAC_LENGTH,
                       purpose == KM_PURPOSE_VERIFY ? static_cast<uint32_t>(signature_bytes * 8) : full);
        return;
    }
    if (algorithm == KM_ALGORITHM_AES) {
        default_from_key(params, chars, KM_TAG_BLOCK_MODE, km::Enumeration::block_mode, {}, command, "--block-mode");
        default_from_key(params, chars, KM_TAG_PADDING, km::Enumeration::padding, paddings_for(algorithm, purpose),
                         command, "--padding");
        const km::Param *mode = params.find(KM_TAG_BLOCK_MODE);
        if (mode && mode->value == KM_MODE_GCM && !params.find(KM_TAG_MAC_LENGTH)) {
            const km::Param *min = chars.find(KM_TAG_MIN_MAC_LENGTH);
            params.add(KM_TAG_MAC_LENGTH, min ? static_cast<uint32_t>(min->value) : 128u);
        }
        return;
    }
    if (algorithm != KM_ALGORITHM_RSA && algorithm != KM_ALGORITHM_EC)
        return;
    const bool public_op = purpose == KM_PURPOSE_ENCRYPT || purpose == KM_PURPOSE_VERIFY;
    if (algorithm == KM_ALGORITHM_RSA) {
        const km::Param *given = params.find(KM_TAG_PADDING);
        // Public-key operations are not bound by the key's paddings; warn when
        // the result is something the key's own decryption will refuse.
        if (given && purpose == KM_PURPOSE_ENCRYPT &&
            key_values(chars, KM_TAG_PADDING, {static_cast<uint32_t>(given->value)}).empty())
            std::cerr << "kmctl: warning: the key's decryption refuses padding "
                      << km::enum_name(km::Enumeration::padding, static_cast<uint32_t>(given->value))
                      << "; this ciphertext will not decrypt with this key\n";
        if (!(public_op && given))
            default_from_key(params, chars, KM_TAG_PADDING, km::Enumeration::padding, paddings_for(algorithm, purpose),
                             command, "--padding");
    }
    const km::Param *padding = params.find(KM_TAG_PADDING);
    const bool needs_digest = algorithm == KM_ALGORITHM_EC ||
                              (padding && (padding->value == KM_PAD_RSA_PSS || padding->value == KM_PAD_RSA_OAEP ||
                                           padding->value == KM_PAD_RSA_PKCS1_1_5_SIGN));
    if (needs_digest && !(public_op && params.find(KM_TAG_DIGEST)))
        default_from_key(params, chars, KM_TAG_DIGEST, km::Enumeration::digest, {}, command, "--digest");
}

km::FinishOutput run_operation(km::Client &client, uint32_t purpose, const km::KeyReference &key,
                               const km::ParamSet &params, const km::ParamSet &first_update, InputStream &input,
                               std::span<const uint8_t> signature, const km::OutputSink &sink,
                               km::ParamSet *begin_out) {
    km::Operation op = take(client.begin(purpose, key.blob, params));
    if (begin_out)
        *begin_out = op.out_params;
    return take(client.stream(
        op.handle, [&input](uint8_t *buf, size_t n) { return input.read(buf, n); }, sink, first_update, signature));
}

Command add_cipher_command(CLI::App &kmctl, const GlobalOptions &options, uint32_t purpose, const std::string &name,
                           const std::string &help) {
    struct CipherOptions {
        OperationOptions op;
        std::string nonce_out;
    };
    auto o = std::make_shared<CipherOptions>();
    CLI::App *app = kmctl.add_subcommand(name, help);
    add_operation_options(*app, o->op, purpose);
    add_in_option(*app, o->op.in, "The input");
    add_out_option(*app, o->op.out, "The output", true);
    if (purpose == KM_PURPOSE_ENCRYPT)
        app->add_option("--nonce-out", o->nonce_out, "Write the nonce the TA chose here, in hex")->type_name("FILE");
    return {app, [o, &options, purpose] {
                check_one_stdin({{"--key", &o->op.key.blob_path}, {"--aad", &o->op.aad}, {"--in", &o->op.in}});
                km::ParamSet params = begin_params(o->op);
                km::ParamSet first_update;
                if (!o->op.aad.empty())
                    first_update.add_bytes(KM_TAG_ASSOCIATED_DATA, read_input(o->op.aad));
                km::KeyReference key = key_reference(o->op.key);
                InputStream in(o->op.in);
                OutputStream out(o->op.out);
                Session session(options);
                complete_params(session.client(), key, params, purpose, 0);
                km::ParamSet begun;
                km::FinishOutput done = run_operation(
                    session.client(), purpose, key, params, first_update, in, {},
                    [&out](std::span<const uint8_t> data) { out.write(data); }, &begun);
                out.write(done.output);
                out.commit();
                const km::Param *nonce = begun.find(KM_TAG_NONCE);
                if (!nonce)
                    return;
                std::string hex = km::to_hex(nonce->bytes);
                if (!o->nonce_out.empty())
                    write_output(o->nonce_out, hex + "\n");
                else if (o->op.nonce.empty())
                    std::cerr << "nonce: " << hex << " (decrypt needs it: --nonce " << hex << ")\n";
            }};
}

} // namespace kmctl
