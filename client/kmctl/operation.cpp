/*
 * operation.cpp - the options and the streaming pipeline of sign, verify,
 * encrypt and decrypt.
 */
#include "operation.h"

#include <iostream>
#include <memory>

#include "keymaster_defs.h"
#include "km/param_text.h"
#include "param_options.h"

namespace kmctl {
namespace {

uint32_t digest_bits(uint32_t digest) {
    switch (digest) {
    case KM_DIGEST_MD5:
        return 128;
    case KM_DIGEST_SHA1:
        return 160;
    case KM_DIGEST_SHA_2_224:
        return 224;
    case KM_DIGEST_SHA_2_256:
        return 256;
    case KM_DIGEST_SHA_2_384:
        return 384;
    case KM_DIGEST_SHA_2_512:
        return 512;
    default:
        return 0;
    }
}

} // namespace

void add_operation_options(CLI::App &app, OperationOptions &o, bool with_cipher) {
    add_key_options(app, o.key);
    app.add_option("--digest", o.digest, "Digest: none, md5, sha1, sha224, sha256, sha384, sha512")
        ->type_name("DIGEST");
    app.add_option("--padding", o.padding,
                   "Padding: none, rsa_oaep, rsa_pss, rsa_pkcs1_1_5_encrypt, rsa_pkcs1_1_5_sign, pkcs7")
        ->type_name("PADDING");
    app.add_option("--mac-length", o.mac_length, "MAC or GCM tag length in bits")->type_name("BITS");
    if (with_cipher) {
        app.add_option("--block-mode", o.block_mode, "Block mode: ecb, cbc, ctr, gcm")->type_name("MODE");
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
    if (!o.mac_length.empty())
        add_tag_value(set, "--mac-length", "KM_TAG_MAC_LENGTH", o.mac_length);
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

void add_default_mac_length(km::Client &client, const km::KeyReference &key, km::ParamSet &params, uint32_t bits) {
    if (params.find(KM_TAG_MAC_LENGTH))
        return;
    km::ParamSet chars = take(client.characteristics(key));
    const km::Param *algorithm = chars.find(KM_TAG_ALGORITHM);
    if (!algorithm || algorithm->value != KM_ALGORITHM_HMAC)
        return;
    if (bits == 0) {
        const km::Param *digest = chars.find(KM_TAG_DIGEST);
        bits = digest ? digest_bits(static_cast<uint32_t>(digest->value)) : 0;
    }
    // Without a length to offer, the TA's own refusal says what is missing.
    if (bits != 0)
        params.add(KM_TAG_MAC_LENGTH, bits);
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
    add_operation_options(*app, o->op, true);
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
