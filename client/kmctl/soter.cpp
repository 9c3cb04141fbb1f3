/*
 * soter.cpp - `kmctl soter`: the factory step that provisions the device's
 * SOTER material (the attestation key, ATTK, and the device facts) into
 * the provisioning TA's store, and the SOTER commands 0xFF01 to 0xFF03.
 */
#include <cstdio>
#include <iostream>
#include <memory>
#include <optional>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/decoder.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>

#include "common.h"
#include "soter_statement.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "ta_entry.h"
#include "tee_host.h"

namespace kmctl {

// add_soter_verify - `kmctl soter verify export|sign` (soter_verify.cpp).
Command add_soter_verify(CLI::App &soter);

namespace {

// Defaults of the device facts, for a host that has no fingerprint sensor.
constexpr const char *kDefaultCpuId = "host-cpu-0";
constexpr const char *kDefaultSensorName = "host-fingerprint-sensor";
constexpr const char *kDefaultSensorVersion = "1.0";
constexpr size_t kMaxCpuId = 64;
constexpr int kAttkBits = 2048;

struct ProvisionOptions {
    std::string attk;
    std::string cpu_id = kDefaultCpuId;
    std::string sensor_name = kDefaultSensorName;
    std::string sensor_version = kDefaultSensorVersion;
    std::string fp_ta_uuid;
    bool force = false;
};

struct ExportOptions {
    std::string format = "pem";
    std::string out;
};

struct PkeyFree {
    void operator()(EVP_PKEY *p) const { EVP_PKEY_free(p); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;

std::string uuid_text(const TEE_UUID &u) {
    char buf[40] = {};
    std::snprintf(buf, sizeof buf, "%08x-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x", u.timeLow, u.timeMid,
                  u.timeHiAndVersion, u.clockSeqAndNode[0], u.clockSeqAndNode[1], u.clockSeqAndNode[2],
                  u.clockSeqAndNode[3], u.clockSeqAndNode[4], u.clockSeqAndNode[5], u.clockSeqAndNode[6],
                  u.clockSeqAndNode[7]);
    return buf;
}

std::optional<TEE_UUID> parse_uuid(const std::string &s) {
    unsigned v[11] = {};
    int used = 0;
    if (s.size() != 36 ||
        std::sscanf(s.c_str(), "%8x-%4x-%4x-%2x%2x-%2x%2x%2x%2x%2x%2x%n", &v[0], &v[1], &v[2], &v[3], &v[4], &v[5],
                    &v[6], &v[7], &v[8], &v[9], &v[10], &used) != 11 ||
        used != 36)
        return std::nullopt;
    TEE_UUID u{};
    u.timeLow = v[0];
    u.timeMid = static_cast<uint16_t>(v[1]);
    u.timeHiAndVersion = static_cast<uint16_t>(v[2]);
    for (int i = 0; i < 8; ++i)
        u.clockSeqAndNode[i] = static_cast<uint8_t>(v[3 + i]);
    return u;
}

// The ATTK from a PKCS#8 file, PEM or DER: RSA-2048 only.
Pkey read_attk(const std::string &path) {
    std::vector<uint8_t> file = read_input(path);
    EVP_PKEY *raw = nullptr;
    OSSL_DECODER_CTX *ctx =
        OSSL_DECODER_CTX_new_for_pkey(&raw, nullptr, "PrivateKeyInfo", "RSA", EVP_PKEY_KEYPAIR, nullptr, nullptr);
    const unsigned char *p = file.data();
    size_t left = file.size();
    bool decoded = ctx && OSSL_DECODER_from_data(ctx, &p, &left) == 1 && raw;
    OSSL_DECODER_CTX_free(ctx);
    wipe(file);
    Pkey key(raw);
    if (!decoded || left != 0)
        usage_error("--attk: not an unencrypted PKCS#8 RSA private key");
    if (EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA || EVP_PKEY_get_bits(key.get()) != kAttkBits)
        usage_error("--attk: the ATTK must be an RSA-2048 key, this one is " +
                    std::to_string(EVP_PKEY_get_bits(key.get())) + " bits");
    return key;
}

Pkey generate_attk() {
    EVP_PKEY *raw = EVP_RSA_gen(kAttkBits);
    if (!raw)
        throw Failure(kExitLocal, "cannot generate an RSA-2048 key");
    return Pkey(raw);
}

std::vector<uint8_t> component(const EVP_PKEY *key, const char *name) {
    BIGNUM *bn = nullptr;
    if (EVP_PKEY_get_bn_param(key, name, &bn) != 1)
        return {};
    std::vector<uint8_t> out(static_cast<size_t>(BN_num_bytes(bn)), 0);
    BN_bn2bin(bn, out.data());
    BN_clear_free(bn);
    return out;
}

tee_host::provisioning::FactoryData factory_data(const EVP_PKEY *key, const ProvisionOptions &o) {
    tee_host::provisioning::FactoryData d;
    d.n = component(key, OSSL_PKEY_PARAM_RSA_N);
    d.e = component(key, OSSL_PKEY_PARAM_RSA_E);
    d.d = component(key, OSSL_PKEY_PARAM_RSA_D);
    d.p = component(key, OSSL_PKEY_PARAM_RSA_FACTOR1);
    d.q = component(key, OSSL_PKEY_PARAM_RSA_FACTOR2);
    d.dp = component(key, OSSL_PKEY_PARAM_RSA_EXPONENT1);
    d.dq = component(key, OSSL_PKEY_PARAM_RSA_EXPONENT2);
    d.qinv = component(key, OSSL_PKEY_PARAM_RSA_COEFFICIENT1);
    if (d.n.empty() || d.e.empty() || d.d.empty())
        throw Failure(kExitLocal, "cannot read the RSA components of the ATTK");
    // The CRT values go together: with one missing, the key is stored as n, e, d.
    std::vector<uint8_t> *crt[] = {&d.p, &d.q, &d.dp, &d.dq, &d.qinv};
    bool complete = true;
    for (std::vector<uint8_t> *v : crt)
        complete = complete && !v->empty();
    if (!complete)
        for (std::vector<uint8_t> *v : crt)
            wipe(*v);
    d.sensor_name = o.sensor_name;
    d.sensor_version = o.sensor_version;
    d.cpu_id = o.cpu_id;
    if (o.fp_ta_uuid.empty()) {
        d.fp_ta_uuid = trusted_client_uuids[0]; // the fingerprint TA this TA trusts
    } else {
        std::optional<TEE_UUID> u = parse_uuid(o.fp_ta_uuid);
        if (!u)
            usage_error("--fp-ta-uuid: expected a UUID as 8-4-4-4-12 hexadecimal digits");
        d.fp_ta_uuid = *u;
    }
    return d;
}

void wipe_factory(tee_host::provisioning::FactoryData &d) {
    for (std::vector<uint8_t> *v : {&d.d, &d.p, &d.q, &d.dp, &d.dq, &d.qinv})
        wipe(*v);
}

void provision(const GlobalOptions &options, const ProvisionOptions &o) {
    if (o.cpu_id.size() > kMaxCpuId)
        usage_error("--cpu-id: at most " + std::to_string(kMaxCpuId) + " bytes");
    Pkey key = o.attk.empty() ? Pkey() : read_attk(o.attk);
    Session session(options);
    // The factory store sits beside the TEE; kmd's is out of reach.
    if (!session.embedded())
        usage_error("soter provision is the factory step: run it without --socket, before kmd starts");
    const std::filesystem::path dir = session.state_dir();
    if (!o.force && tee_host::provisioning::provisioned(dir))
        throw Failure(kExitRefused, "the device is already provisioned; --force replaces its SOTER material");
    if (!key)
        key = generate_attk();
    tee_host::provisioning::FactoryData data = factory_data(key.get(), o);
    tee_host::provisioning::StoreResult stored = tee_host::provisioning::store(dir, data, o.force);
    wipe_factory(data);
    switch (stored) {
    case tee_host::provisioning::StoreResult::stored:
        break;
    case tee_host::provisioning::StoreResult::already_provisioned:
        throw Failure(kExitRefused, "the device is already provisioned; --force replaces its SOTER material");
    case tee_host::provisioning::StoreResult::invalid:
        usage_error("a SOTER text is too long for the provisioning store");
    case tee_host::provisioning::StoreResult::io_error:
        throw Failure(kExitLocal, "cannot write the provisioning store in " + dir.string());
    }
    // The TA loads what was stored, or the provisioning was for nothing.
    check(session.client().soter_load_attk());
}

void verify(const GlobalOptions &options) {
    Session session(options);
    km::Result<int32_t> r = session.client().soter_verify_attk();
    check(r.status);
    if (r.value == 0) {
        std::puts("provisioned");
        return;
    }
    // A negative verdict exits 1 with its reason on stderr, as `verify` does.
    if (r.value == -1)
        throw Failure(kExitRefused, "not provisioned");
    throw Failure(kExitRefused, "the ATTK does not load from the provisioning TA (" + std::to_string(r.value) + ")");
}

// The DER SubjectPublicKeyInfo inside the TA's one-line PEM text, checked by OpenSSL.
std::vector<uint8_t> pem_to_der(const std::string &pem) {
    const std::string head = "-----BEGIN PUBLIC KEY-----\n";
    const std::string tail = "\n-----END PUBLIC KEY-----";
    auto bad = [] {
        return Failure(kExitTeeFailure, km::describe({TEE_ERROR_BAD_FORMAT, 0}) + ": not a PEM public key");
    };
    if (pem.size() < head.size() + tail.size() || pem.compare(0, head.size(), head) != 0 ||
        pem.compare(pem.size() - tail.size(), tail.size(), tail) != 0)
        throw bad();
    std::string b64 = pem.substr(head.size(), pem.size() - head.size() - tail.size());
    if (b64.empty() || b64.size() % 4 != 0)
        throw bad();
    std::vector<uint8_t> der(b64.size() / 4 * 3, 0);
    int n =
        EVP_DecodeBlock(der.data(), reinterpret_cast<const unsigned char *>(b64.data()), static_cast<int>(b64.size()));
    if (n < 0)
        throw bad();
    size_t pad = b64.size() >= 2 && b64[b64.size() - 2] == '=' ? 2 : b64.back() == '=' ? 1 : 0;
    der.resize(static_cast<size_t>(n) - pad);
    std::string why;
    std::optional<km::Bytes> checked = km::public_key_der(KM_ALGORITHM_RSA, der, &why);
    if (!checked)
        throw Failure(kExitTeeFailure, km::describe({TEE_ERROR_BAD_FORMAT, 0}) + ": " + why);
    return *checked;
}

void export_attk(const GlobalOptions &options, const ExportOptions &o) {
    Session session(options);
    km::Result<std::string> r = session.client().soter_export_attk();
    if (r.status.refused() && r.status.km == -1)
        throw Failure(kExitRefused, "the SOTER state does not load: is the device provisioned? (-1)");
    std::vector<uint8_t> der = pem_to_der(take(std::move(r)));
    if (o.format == "der")
        write_output(o.out, der);
    else
        write_output(o.out, km::pem_encode("PUBLIC KEY", der));
}

void device_id(const GlobalOptions &options) {
    Session session(options);
    km::Bytes id = take(session.client().soter_device_id());
    std::string text;
    static const char digits[] = "0123456789abcdef";
    for (uint8_t b : id) {
        text += digits[b >> 4];
        text += digits[b & 15];
    }
    std::puts(text.c_str());
}

// The notification counts from the moment the TA takes it: a signing more
// than three seconds later no longer carries the fid.
void notify_fid(const GlobalOptions &options, uint32_t fid) {
    Session session(options);
    report_fid(session.client(), fid);
    if (session.embedded())
        std::cerr << "kmctl: note: this TEE ends with this command; through kmd the fid stays for 3 seconds\n";
}

} // namespace

Command add_soter(CLI::App &kmctl, const GlobalOptions &options) {
    CLI::App *soter = kmctl.add_subcommand(
        "soter", "SOTER attestation: provisioning, the ATTK, the device id and checking its outputs");
    soter->require_subcommand(1);

    auto p = std::make_shared<ProvisionOptions>();
    CLI::App *prov = soter->add_subcommand(
        "provision", "Factory step: store the ATTK and the device facts in the provisioning TA's store");
    prov->add_option("--attk", p->attk, "The ATTK, an RSA-2048 PKCS#8 private key (PEM or DER); default: a new one")
        ->type_name("KEY");
    prov->add_option("--cpu-id", p->cpu_id, "The CPU identifier, at most 64 bytes")->capture_default_str();
    prov->add_option("--sensor-name", p->sensor_name, "The fingerprint sensor's name")->capture_default_str();
    prov->add_option("--sensor-version", p->sensor_version, "The fingerprint sensor's version")->capture_default_str();
    prov->add_option("--fp-ta-uuid", p->fp_ta_uuid,
                     "The fingerprint TA's UUID (default: " + uuid_text(trusted_client_uuids[0]) + ")")
        ->type_name("UUID");
    prov->add_flag("--force", p->force, "Replace the SOTER material of a provisioned device");

    CLI::App *attk = soter->add_subcommand("attk", "The attestation key pair (ATTK)");
    attk->require_subcommand(1);
    CLI::App *verify_app =
        attk->add_subcommand("verify", "Whether the provisioning TA holds an ATTK that loads (command 0xFF01)");
    auto e = std::make_shared<ExportOptions>();
    CLI::App *export_app = attk->add_subcommand("export", "Write the ATTK public key (command 0xFF02)");
    export_app->add_option("--format", e->format, "pem (default) or der")
        ->check(CLI::IsMember({"pem", "der"}))
        ->type_name("FORMAT");
    add_out_option(*export_app, e->out, "The public key", true);

    CLI::App *id_app = soter->add_subcommand("device-id", "Print the device identifier in hex (command 0xFF03)");
    auto fid = std::make_shared<uint32_t>(0);
    CLI::App *fid_app = soter->add_subcommand(
        "notify-fid", "Have the fingerprint TA report that fingerprint N matched (through kmd: for later signings)");
    fid_app->add_option("fid", *fid, "The fingerprint id")->required()->type_name("N");
    Command statement = add_soter_verify(*soter);

    return {soter, [=, &options] {
                if (prov->parsed())
                    provision(options, *p);
                else if (verify_app->parsed())
                    verify(options);
                else if (export_app->parsed())
                    export_attk(options, *e);
                else if (id_app->parsed())
                    device_id(options);
                else if (fid_app->parsed())
                    notify_fid(options, *fid);
                else if (statement.app->parsed())
                    statement.run();
            }};
}

} // namespace kmctl
