/*
 * soter_verify.cpp - `kmctl soter verify export|sign`: a relying server's
 * checks of SOTER outputs, with the soter_verifier library. They need no
 * TEE and no state directory: no Session is ever made here.
 */
#include <cstdint>
#include <cstdio>
#include <iostream>
#include <memory>
#include <string>

#include <nlohmann/json.hpp>
#include <openssl/evp.h>

#include "common.h"
#include "km/key_material.h"
#include "soter/verifier.h"

namespace kmctl {
namespace {

using ordered_json = nlohmann::ordered_json;

struct VerifyOptions {
    std::string in;
    std::string key;
    bool json = false;
    // export only
    std::string pub_key_out;
    // sign only
    std::string challenge_file;
    uint64_t last_counter = 0;
    uint32_t uid = 0;
    std::string cpu_id;
    uint32_t fid = 0;
    CLI::Option *uid_opt = nullptr;
    CLI::Option *cpu_id_opt = nullptr;
    CLI::Option *fid_opt = nullptr;
};

soter::PublicKey read_key(const std::string &path) {
    std::vector<uint8_t> bytes = read_input(path);
    std::string why;
    soter::PublicKey key = soter::load_public_key(bytes, &why);
    if (key.empty())
        usage_error("--key: " + why + "; expected an RSA SubjectPublicKeyInfo, PEM or DER");
    return key;
}

// fingerprint - SHA-256 of the key's DER SubjectPublicKeyInfo in hex, as
// `openssl pkey -pubin -outform DER | sha256sum` prints it.
std::string fingerprint(const soter::PublicKey &key) {
    soter::Bytes der = key.spki_der();
    unsigned char md[EVP_MAX_MD_SIZE] = {};
    unsigned int len = 0;
    if (der.empty() || EVP_Digest(der.data(), der.size(), md, &len, EVP_sha256(), nullptr) != 1)
        return "unknown";
    static const char digits[] = "0123456789abcdef";
    std::string hex;
    for (unsigned int i = 0; i < len; ++i) {
        hex += digits[md[i] >> 4];
        hex += digits[md[i] & 15];
    }
    return hex;
}

ordered_json members_json(const soter::ExportVerdict &v) {
    if (!v.authentic)
        return nullptr;
    ordered_json m = ordered_json::object();
    if (v.document.counter)
        m["counter"] = *v.document.counter;
    if (v.document.uid)
        m["uid"] = *v.document.uid;
    m["pub_key"] = v.document.pub_key_pem;
    return m;
}

ordered_json members_json(const soter::SignVerdict &v) {
    if (!v.authentic)
        return nullptr;
    const soter::SignDocument &d = v.document;
    ordered_json m = ordered_json::object();
    m["raw"] = d.raw;
    if (d.fid)
        m["fid"] = *d.fid;
    m["counter"] = d.counter;
    m["uid"] = d.uid;
    m["tee_n"] = d.tee_n;
    m["tee_v"] = d.tee_v;
    m["fp_n"] = d.fp_n;
    m["fp_v"] = d.fp_v;
    m["cpu_id"] = d.cpu_id;
    return m;
}

// report - the verdict on stdout (JSON with --json); a refusal ends with
// exit 1 and the failed check's name on stderr.
void report(const soter::Verdict &v, const char *output, ordered_json members, const std::string &scheme,
            bool as_json) {
    if (as_json) {
        ordered_json j = ordered_json::object();
        j["verdict"] = v.valid() ? "valid" : "refused";
        j["failed_check"] = v.valid() ? ordered_json(nullptr) : ordered_json(soter::check_name(v.failed));
        j["reason"] = v.valid() ? ordered_json(nullptr) : ordered_json(v.reason);
        j["output"] = output;
        j["scheme"] = v.authentic ? ordered_json(scheme) : ordered_json(nullptr);
        j["members"] = std::move(members);
        // Members are the signer's text, valid UTF-8 once parsed; replace rather than fail regardless.
        std::cout << j.dump(2, ' ', false, ordered_json::error_handler_t::replace) << '\n';
    }
    if (!v.valid())
        throw Failure(kExitRefused, std::string("refused (") + soter::check_name(v.failed) + "): " + v.reason);
}

// Table rows as `kmctl characteristics` prints them: name, then value.
void row(const char *name, const std::string &value) {
    std::printf("%-9s%s\n", name, value.c_str());
}

void verify_export(const VerifyOptions &o) {
    check_one_stdin({{"--in", &o.in}, {"--key", &o.key}});
    soter::PublicKey key = read_key(o.key);
    std::vector<uint8_t> output = read_input(o.in);
    soter::ExportVerdict v = soter::verify_export_output(output, key);
    if (v.valid() && !o.pub_key_out.empty()) {
        soter::Bytes der = v.document.pub_key.spki_der();
        if (der.empty())
            throw Failure(kExitLocal, "cannot encode the exported public key for " + o.pub_key_out);
        write_output(o.pub_key_out, km::pem_encode("PUBLIC KEY", der));
    }
    report(v, "export", members_json(v), soter::scheme_name({}), o.json);
    if (o.json)
        return;
    std::printf("valid: the export document is signed by the key (%s)\n", soter::scheme_name({}).c_str());
    if (v.document.counter)
        row("counter", std::to_string(*v.document.counter));
    if (v.document.uid)
        row("uid", std::to_string(*v.document.uid));
    row("pub_key",
        "RSA-" + std::to_string(v.document.pub_key.bits()) + ", SHA-256 of its DER " + fingerprint(v.document.pub_key));
}

void verify_sign(const VerifyOptions &o) {
    check_one_stdin({{"--in", &o.in}, {"--key", &o.key}, {"--challenge-file", &o.challenge_file}});
    soter::PublicKey key = read_key(o.key);
    soter::SignExpectations expect;
    expect.challenge = read_input(o.challenge_file);
    expect.last_counter = o.last_counter;
    if (o.uid_opt->count())
        expect.uid = o.uid;
    if (o.cpu_id_opt->count())
        expect.cpu_id = o.cpu_id;
    if (o.fid_opt->count())
        expect.fid = o.fid;
    std::vector<uint8_t> output = read_input(o.in);
    soter::SignVerdict v = soter::verify_sign_output(output, key, expect);
    report(v, "sign", members_json(v), soter::scheme_name(v.scheme), o.json);
    if (o.json)
        return;
    const soter::SignDocument &d = v.document;
    std::printf("valid: the signing document is signed by the key (%s) and answers the challenge\n",
                soter::scheme_name(v.scheme).c_str());
    row("raw", std::to_string(d.raw.size()) + " bytes, the challenge");
    if (d.fid)
        row("fid", std::to_string(*d.fid));
    row("counter", std::to_string(d.counter));
    row("uid", std::to_string(d.uid));
    row("tee_n", d.tee_n);
    row("tee_v", d.tee_v);
    row("fp_n", d.fp_n);
    row("fp_v", d.fp_v);
    row("cpu_id", d.cpu_id);
}

void add_common(CLI::App &app, VerifyOptions &o, const char *what, const char *key_what) {
    add_in_option(app, o.in, what, true);
    app.add_option("--key", o.key, key_what)->required()->type_name("PUBKEY");
    app.add_flag("--json", o.json, "Print the verdict and the members as JSON");
}

} // namespace

// add_soter_verify - `kmctl soter verify export|sign` under `kmctl soter`.
Command add_soter_verify(CLI::App &soter) {
    CLI::App *verify = soter.add_subcommand(
        "verify", "Check a SOTER export or signing output as a relying server would (no TEE, no state directory)");
    verify->require_subcommand(1);

    auto e = std::make_shared<VerifyOptions>();
    CLI::App *exp = verify->add_subcommand(
        "export", "Check an export output: its RSASSA-PKCS1-v1_5 SHA-256 signature and its members");
    add_common(*exp, *e, "The export output",
               "The signer's public key, the ATTK's or an application key's (SubjectPublicKeyInfo, PEM or DER)");
    exp->add_option("--pub-key-out", e->pub_key_out, "Write the public key the export carries (PEM), once valid")
        ->type_name("FILE");

    auto s = std::make_shared<VerifyOptions>();
    CLI::App *sig = verify->add_subcommand(
        "sign", "Check a signing output: its signature, the challenge, the counter and the given facts");
    add_common(*sig, *s, "The signing output",
               "The signing key's public key, from a verified export (SubjectPublicKeyInfo, PEM or DER)");
    sig->add_option("--challenge-file", s->challenge_file, "The challenge \"raw\" must equal, byte for byte")
        ->required()
        ->type_name("FILE");
    sig->add_option("--last-counter", s->last_counter, "The last counter seen; the document's must be greater")
        ->type_name("N");
    s->uid_opt = sig->add_option("--uid", s->uid, "The user id \"uid\" must equal")->type_name("N");
    s->cpu_id_opt =
        sig->add_option("--cpu-id", s->cpu_id, "The CPU identifier \"cpu_id\" must equal")->type_name("TEXT");
    s->fid_opt =
        sig->add_option("--fid", s->fid, "The fingerprint id \"fid\" must be present and equal")->type_name("N");

    return {verify, [=] {
                if (exp->parsed())
                    verify_export(*e);
                else if (sig->parsed())
                    verify_sign(*s);
            }};
}

} // namespace kmctl
