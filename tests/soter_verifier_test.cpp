/*
 * The SOTER verifier a relying server runs, and `kmctl soter verify` on top
 * of it. Outputs are composed here and signed with OpenSSL, so every byte of
 * a good or damaged output is known.
 */
#include <sys/wait.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>
#include <openssl/evp.h>
#include <openssl/rsa.h>

#include "cli_files.h"
#include "rsa_keys.h"
#include "scratch_dir.h"
#include "soter/verifier.h"
#include "soter_keys.h"

namespace {

using Bytes = std::vector<uint8_t>;

// A 2048-bit key made once per run: the chain needs three distinct keys.
EVP_PKEY *generated(int which) {
    static Pkey keys[2] = {Pkey(EVP_RSA_gen(2048)), Pkey(EVP_RSA_gen(2048))};
    return keys[which].get();
}

EVP_PKEY *attk() {
    static Pkey key = decode_rsa(kRsa2048Pem);
    return key.get();
}
EVP_PKEY *app_key() {
    return generated(0);
}
EVP_PKEY *auth_key() {
    return generated(1);
}

Bytes spki(const EVP_PKEY *key) {
    return der_of(key, EVP_PKEY_PUBLIC_KEY, "SubjectPublicKeyInfo");
}

soter::PublicKey pub(const EVP_PKEY *key) {
    return soter::load_public_key(spki(key));
}

// The TA's PEM: header, base64 on one line, footer without a newline.
std::string pem_one_line(const EVP_PKEY *key) {
    Bytes der = spki(key);
    std::string b64(4 * ((der.size() + 2) / 3) + 1, '\0');
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char *>(b64.data()), der.data(), static_cast<int>(der.size()));
    b64.resize(static_cast<size_t>(n));
    return "-----BEGIN PUBLIC KEY-----\n" + b64 + "\n-----END PUBLIC KEY-----";
}

// A JSON string as the TA's writer renders it: every slash escaped.
std::string quoted(const std::string &s) {
    std::string out = "\"";
    for (char c : s) {
        switch (c) {
        case '"':
            out += "\\\"";
            break;
        case '\\':
            out += "\\\\";
            break;
        case '/':
            out += "\\/";
            break;
        case '\n':
            out += "\\n";
            break;
        default:
            out += c;
        }
    }
    return out + "\"";
}

// A document as an ordered list of members: names and rendered values.
using Members = std::vector<std::pair<std::string, std::string>>;

std::string render(const Members &members) {
    std::string out = "{";
    for (const auto &[name, value] : members)
        out += (out.size() > 1 ? "," : "") + quoted(name) + ":" + value;
    return out + "}";
}

Members without(Members m, const std::string &name) {
    std::erase_if(m, [&](const auto &member) { return member.first == name; });
    return m;
}

Members with(Members m, const std::string &name, const std::string &value) {
    for (auto &member : m)
        if (member.first == name)
            member.second = value;
    return m;
}

Members export_members(const EVP_PKEY *carried) {
    return {{"counter", "7"}, {"uid", "1000"}, {"pub_key", quoted(pem_one_line(carried))}};
}

std::string export_doc(const EVP_PKEY *carried) {
    return render(export_members(carried));
}

const std::string kChallenge = "server-nonce/4711";

Members sign_members() {
    return {{"raw", quoted(kChallenge)},
            {"fid", "3"},
            {"counter", "12"},
            {"uid", "1000"},
            {"tee_n", "\"host-tee\""},
            {"tee_v", "\"1.0\""},
            {"fp_n", "\"host-fingerprint-sensor\""},
            {"fp_v", "\"1.0\""},
            {"cpu_id", "\"host-cpu-0\""}};
}

std::string sign_doc() {
    return render(sign_members());
}

Bytes bytes_of(const std::string &s) {
    return Bytes(s.begin(), s.end());
}

Bytes rsa_sign(EVP_PKEY *key, const Bytes &msg, const char *md = "SHA256", int pss_salt = -100) {
    EVP_MD_CTX *ctx = EVP_MD_CTX_new();
    EVP_PKEY_CTX *pctx = nullptr;
    Bytes sig(static_cast<size_t>(EVP_PKEY_get_size(key)), 0);
    size_t len = sig.size();
    bool ok = EVP_DigestSignInit_ex(ctx, &pctx, md, nullptr, nullptr, key, nullptr) == 1;
    if (ok && pss_salt != -100)
        ok = EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PSS_PADDING) == 1 &&
             EVP_PKEY_CTX_set_rsa_pss_saltlen(pctx, pss_salt) == 1;
    ok = ok && EVP_DigestSign(ctx, sig.data(), &len, msg.data(), msg.size()) == 1;
    EVP_MD_CTX_free(ctx);
    EXPECT_TRUE(ok);
    sig.resize(len);
    return sig;
}

Bytes pack(const Bytes &signed_bytes, uint32_t j, const Bytes &sig) {
    Bytes out = {static_cast<uint8_t>(j), static_cast<uint8_t>(j >> 8), static_cast<uint8_t>(j >> 16),
                 static_cast<uint8_t>(j >> 24)};
    out.insert(out.end(), signed_bytes.begin(), signed_bytes.end());
    out.insert(out.end(), sig.begin(), sig.end());
    return out;
}

// export_output - J without NUL, the document, its PKCS#1 v1.5 SHA-256 signature.
Bytes export_output(const std::string &doc, EVP_PKEY *signer) {
    Bytes d = bytes_of(doc);
    return pack(d, static_cast<uint32_t>(d.size()), rsa_sign(signer, d));
}

// sign_output - J with NUL, the document and its NUL, their signature.
Bytes sign_output(const std::string &doc, EVP_PKEY *signer, const char *md = "SHA256", int pss_salt = -100) {
    Bytes d = bytes_of(doc);
    d.push_back(0);
    return pack(d, static_cast<uint32_t>(d.size()), rsa_sign(signer, d, md, pss_salt));
}

soter::SignExpectations expect_challenge() {
    soter::SignExpectations e;
    e.challenge = bytes_of(kChallenge);
    return e;
}

soter::Check export_check(const Bytes &out, EVP_PKEY *signer) {
    return soter::verify_export_output(out, pub(signer)).failed;
}

soter::Check sign_check(const Bytes &out, EVP_PKEY *signer, const soter::SignExpectations &e = expect_challenge()) {
    return soter::verify_sign_output(out, pub(signer), e).failed;
}

TEST(SoterVerifier, ExportYieldsItsMembersAndTheKeyItCarries) {
    soter::ExportVerdict v = soter::verify_export_output(export_output(export_doc(app_key()), attk()), pub(attk()));
    ASSERT_TRUE(v.valid()) << v.reason;
    EXPECT_EQ(v.failed, soter::Check::none);
    EXPECT_EQ(v.document.counter, 7u);
    EXPECT_EQ(v.document.uid, 1000u);
    EXPECT_EQ(v.document.pub_key_pem, pem_one_line(app_key()));
    EXPECT_EQ(v.document.pub_key.spki_der(), spki(app_key()));
    EXPECT_EQ(soter::exported_key(v).spki_der(), spki(app_key()));

    // Only "pub_key" is mandatory; a PEM ending in a newline reads as well.
    std::string doc = "{\"pub_key\":" + quoted(pem_one_line(app_key()) + "\n") + "}";
    v = soter::verify_export_output(export_output(doc, attk()), pub(attk()));
    ASSERT_TRUE(v.valid()) << v.reason;
    EXPECT_FALSE(v.document.counter);
    EXPECT_FALSE(v.document.uid);
    EXPECT_EQ(v.document.pub_key.bits(), 2048);
}

TEST(SoterVerifier, ChainFromTheAttkToASigningOutput) {
    soter::ExportVerdict app = soter::verify_export_output(export_output(export_doc(app_key()), attk()), pub(attk()));
    soter::ExportVerdict auth =
        soter::verify_export_output(export_output(export_doc(auth_key()), app_key()), soter::exported_key(app));
    soter::SignVerdict sig =
        soter::verify_sign_output(sign_output(sign_doc(), auth_key()), soter::exported_key(auth), expect_challenge());
    ASSERT_TRUE(sig.valid()) << sig.reason;
    EXPECT_EQ(sig.document.raw, kChallenge);
    EXPECT_EQ(sig.document.fid, 3u);
    EXPECT_EQ(sig.document.counter, 12u);
    EXPECT_EQ(sig.document.uid, 1000u);
    EXPECT_EQ(sig.document.tee_n, "host-tee");
    EXPECT_EQ(sig.document.fp_n, "host-fingerprint-sensor");
    EXPECT_EQ(sig.document.cpu_id, "host-cpu-0");
    EXPECT_EQ(soter::scheme_name(sig.scheme), "rsa_pkcs1_1_5_sign/sha256");

    // A link signed by the wrong key breaks the chain, and a refused export
    // hands on no key: everything after it is refused.
    soter::ExportVerdict forged =
        soter::verify_export_output(export_output(export_doc(auth_key()), auth_key()), soter::exported_key(app));
    EXPECT_EQ(forged.failed, soter::Check::signature);
    EXPECT_TRUE(soter::exported_key(forged).empty());
    EXPECT_EQ(
        soter::verify_sign_output(sign_output(sign_doc(), auth_key()), soter::exported_key(forged), expect_challenge())
            .failed,
        soter::Check::key);
}

TEST(SoterVerifier, EveryFlippedByteIsRefused) {
    const Bytes exp = export_output(export_doc(app_key()), attk());
    const Bytes sig = sign_output(sign_doc(), auth_key());
    ASSERT_EQ(export_check(exp, attk()), soter::Check::none);
    ASSERT_EQ(sign_check(sig, auth_key()), soter::Check::none);
    for (size_t i = 0; i < exp.size(); ++i) {
        Bytes bad = exp;
        bad[i] ^= 0x01;
        soter::Check c = export_check(bad, attk());
        // The length prefix may fail the layout; any other byte fails the signature.
        if (i >= 4)
            EXPECT_EQ(c, soter::Check::signature) << "export byte " << i;
        else
            EXPECT_NE(c, soter::Check::none) << "export byte " << i;
    }
    for (size_t i = 0; i < sig.size(); ++i) {
        Bytes bad = sig;
        bad[i] ^= 0x80;
        soter::Check c = sign_check(bad, auth_key());
        if (i == 4 + sign_doc().size())
            EXPECT_EQ(c, soter::Check::layout) << "the document's NUL";
        else if (i >= 4)
            EXPECT_EQ(c, soter::Check::signature) << "signing byte " << i;
        else
            EXPECT_NE(c, soter::Check::none) << "signing byte " << i;
    }
}

TEST(SoterVerifier, WrongKeyAndWeakKeyAreRefused) {
    EXPECT_EQ(export_check(export_output(export_doc(app_key()), attk()), app_key()), soter::Check::signature);
    EXPECT_EQ(sign_check(sign_output(sign_doc(), auth_key()), attk()), soter::Check::signature);

    Pkey weak = decode_rsa(kRsa1024Pem);
    soter::ExportVerdict v =
        soter::verify_export_output(export_output(export_doc(app_key()), weak.get()), pub(weak.get()));
    EXPECT_EQ(v.failed, soter::Check::key);
    EXPECT_NE(v.reason.find("1024"), std::string::npos) << v.reason;
    EXPECT_EQ(
        soter::verify_sign_output(sign_output(sign_doc(), auth_key()), soter::PublicKey(), expect_challenge()).failed,
        soter::Check::key);
}

TEST(SoterVerifier, OneOutputPresentedAsTheOtherIsRefused) {
    // By layout: the NUL that only a signing output has.
    EXPECT_EQ(export_check(sign_output(sign_doc(), attk()), attk()), soter::Check::layout);
    EXPECT_EQ(sign_check(export_output(export_doc(app_key()), attk()), attk()), soter::Check::layout);
    // By members, when the layout is made to fit.
    EXPECT_EQ(export_check(export_output(sign_doc(), attk()), attk()), soter::Check::members);
    EXPECT_EQ(sign_check(sign_output(export_doc(app_key()), attk()), attk()), soter::Check::members);
}

TEST(SoterVerifier, SigningExpectationsEachNameTheirCheck) {
    const Bytes out = sign_output(sign_doc(), auth_key());
    soter::SignExpectations e = expect_challenge();
    e.last_counter = 11;
    e.uid = 1000;
    e.cpu_id = "host-cpu-0";
    e.fid = 3;
    EXPECT_EQ(sign_check(out, auth_key(), e), soter::Check::none);

    soter::SignExpectations stale = e;
    stale.last_counter = 12;
    soter::SignVerdict v = soter::verify_sign_output(out, pub(auth_key()), stale);
    EXPECT_EQ(v.failed, soter::Check::counter);
    EXPECT_TRUE(v.authentic) << "a genuine but stale document still shows its members";
    EXPECT_EQ(v.document.counter, 12u);

    soter::SignExpectations other = e;
    other.challenge.push_back('\n');
    EXPECT_EQ(sign_check(out, auth_key(), other), soter::Check::challenge);
    other = e;
    other.challenge.back() ^= 1;
    EXPECT_EQ(sign_check(out, auth_key(), other), soter::Check::challenge);
    other = e;
    other.uid = 0;
    EXPECT_EQ(sign_check(out, auth_key(), other), soter::Check::uid);
    other = e;
    other.cpu_id = "host-cpu-1";
    EXPECT_EQ(sign_check(out, auth_key(), other), soter::Check::cpu_id);
    other = e;
    other.fid = 4;
    EXPECT_EQ(sign_check(out, auth_key(), other), soter::Check::fid);

    // No fresh fid: fine unless one is expected.
    const Bytes no_fid = sign_output(render(without(sign_members(), "fid")), auth_key());
    EXPECT_EQ(sign_check(no_fid, auth_key()), soter::Check::none);
    EXPECT_EQ(sign_check(no_fid, auth_key(), e), soter::Check::fid);
}

TEST(SoterVerifier, DocumentsAreReadStrictly) {
    struct Case {
        std::string doc;
        soter::Check check;
    };
    const Members exp = export_members(app_key());
    const std::string pem = quoted(pem_one_line(app_key()));
    Members twice = exp;
    twice.insert(twice.begin(), {"uid", "2"});
    const Case exports[] = {
        {render(twice), soter::Check::json},
        {render(exp) + " ", soter::Check::none},
        {render(exp) + "x", soter::Check::json},
        {render(exp) + "{}", soter::Check::json},
        {"[" + render(exp) + "]", soter::Check::json},
        {render(without(exp, "pub_key")), soter::Check::members},
        {render(with(exp, "counter", "\"7\"")), soter::Check::members},
        {render(with(exp, "counter", "7.5")), soter::Check::members},
        {render(with(exp, "counter", "7.0")), soter::Check::members},
        {render(with(exp, "counter", "-1")), soter::Check::members},
        {render(with(exp, "counter", "9007199254740992")), soter::Check::none},
        {render(with(exp, "counter", "9007199254740993")), soter::Check::members},
        {render(with(exp, "uid", "4294967296")), soter::Check::members},
        {render(with(exp, "uid", "{}")), soter::Check::members},
        {render(with(exp, "uid", "null")), soter::Check::members},
        {render(with(exp, "pub_key", "7")), soter::Check::members},
        {"{\"extra\":1," + render(exp).substr(1), soter::Check::members},
        {render(with(exp, "pub_key", "\"hello\"")), soter::Check::pub_key},
        {render(with(exp, "pub_key", quoted("junk\n" + pem_one_line(app_key())))), soter::Check::pub_key},
        {render(with(exp, "pub_key", quoted(pem_one_line(app_key()) + "\n" + pem_one_line(attk())))),
         soter::Check::pub_key},
    };
    for (const Case &c : exports)
        EXPECT_EQ(export_check(export_output(c.doc, attk()), attk()), c.check) << c.doc;

    const Members sig = sign_members();
    Members fid_twice = sig, counter_twice = sig;
    fid_twice.push_back({"fid", "3"});
    counter_twice.insert(counter_twice.begin(), {"counter", "13"});
    const Case signs[] = {
        {render(fid_twice), soter::Check::json},
        {render(counter_twice), soter::Check::json},
        {render(with(sig, "tee_n", "\"\xc0\xaf\"")), soter::Check::json},
        {render(with(sig, "raw", "\"server-nonce\xed\xa0\x80\"")), soter::Check::json},
        {render(with(sig, "cpu_id", "7")), soter::Check::members},
        {render(with(sig, "fid", "null")), soter::Check::members},
        {render(with(sig, "fid", "\"3\"")), soter::Check::members},
        {render(with(sig, "counter", "[12]")), soter::Check::members},
        {render(sig) + "\n", soter::Check::none},
    };
    for (const Case &c : signs)
        EXPECT_EQ(sign_check(sign_output(c.doc, auth_key()), auth_key()), c.check) << c.doc;

    // Each mandatory member, taken out, is named.
    for (const char *name : {"raw", "counter", "uid", "tee_n", "tee_v", "fp_n", "fp_v", "cpu_id"}) {
        soter::SignVerdict v = soter::verify_sign_output(sign_output(render(without(sig, name)), auth_key()),
                                                         pub(auth_key()), expect_challenge());
        EXPECT_EQ(v.failed, soter::Check::members) << name;
        EXPECT_NE(v.reason.find(name), std::string::npos) << v.reason;
    }
}

TEST(SoterVerifier, MalformedLayoutsAreRefusedAndSplitsKeepTheSignedBytes) {
    const Bytes good = sign_output(sign_doc(), auth_key());
    soter::Split s = soter::split_sign_output(good);
    ASSERT_TRUE(s.ok()) << s.reason;
    EXPECT_EQ(s.document.size(), sign_doc().size() + 1);
    EXPECT_EQ(s.document.back(), 0);
    EXPECT_EQ(s.text(), sign_doc());
    EXPECT_EQ(s.signature, Bytes(good.end() - 256, good.end()));
    const Bytes exp = export_output(export_doc(app_key()), attk());
    s = soter::split_export_output(exp);
    ASSERT_TRUE(s.ok()) << s.reason;
    EXPECT_EQ(s.text(), export_doc(app_key()));
    EXPECT_EQ(s.signature.size(), 256u);

    auto with_j = [](Bytes out, uint32_t j) {
        for (int i = 0; i < 4; ++i)
            out[static_cast<size_t>(i)] = static_cast<uint8_t>(j >> (8 * i));
        return out;
    };
    const uint32_t rest = static_cast<uint32_t>(exp.size() - 4);
    const Bytes layouts[] = {
        {}, {1, 0, 0}, with_j(exp, 0), with_j(exp, rest), with_j(exp, rest + 1), with_j(exp, 0xFFFFFFFF),
    };
    for (const Bytes &bad : layouts) {
        EXPECT_EQ(soter::split_export_output(bad).failed, soter::Check::layout) << bad.size();
        EXPECT_EQ(soter::split_sign_output(bad).failed, soter::Check::layout) << bad.size();
        EXPECT_EQ(export_check(bad, attk()), soter::Check::layout);
    }

    // A NUL inside a document would end nlohmann's reading early: refused.
    std::string doc = export_doc(app_key());
    EXPECT_EQ(export_check(export_output(doc + std::string(1, '\0') + "{}", attk()), attk()), soter::Check::layout);
    EXPECT_EQ(sign_check(sign_output(sign_doc() + std::string(1, '\0') + "x", auth_key()), auth_key()),
              soter::Check::layout);

    // Bytes after the signature make it longer than the key's.
    Bytes trailing = good;
    trailing.push_back(0);
    EXPECT_EQ(sign_check(trailing, auth_key()), soter::Check::signature);
}

TEST(SoterVerifier, SigningSchemes) {
    // PSS with SHA-256 and any salt length is accepted by default.
    for (int salt : {0, 32, RSA_PSS_SALTLEN_MAX}) {
        soter::SignVerdict v = soter::verify_sign_output(sign_output(sign_doc(), auth_key(), "SHA256", salt),
                                                         pub(auth_key()), expect_challenge());
        ASSERT_TRUE(v.valid()) << salt << ": " << v.reason;
        EXPECT_EQ(soter::scheme_name(v.scheme), "rsa_pss/sha256");
    }
    // Other digests only when asked for.
    const Bytes sha512_pss = sign_output(sign_doc(), auth_key(), "SHA512", 20);
    const Bytes sha1 = sign_output(sign_doc(), auth_key(), "SHA1");
    EXPECT_EQ(sign_check(sha512_pss, auth_key()), soter::Check::signature);
    EXPECT_EQ(sign_check(sha1, auth_key()), soter::Check::signature);
    soter::SignExpectations e = expect_challenge();
    e.schemes = {{soter::Padding::pss, soter::Digest::sha512}, {soter::Padding::pkcs1_v1_5, soter::Digest::sha1}};
    EXPECT_EQ(sign_check(sha512_pss, auth_key(), e), soter::Check::none);
    EXPECT_EQ(sign_check(sha1, auth_key(), e), soter::Check::none);
    // An export is PKCS#1 v1.5 SHA-256 only.
    Bytes d = bytes_of(export_doc(app_key()));
    EXPECT_EQ(export_check(pack(d, static_cast<uint32_t>(d.size()), rsa_sign(attk(), d, "SHA256", 32)), attk()),
              soter::Check::signature);
}

TEST(SoterVerifier, PublicKeysLoadFromPemOrDerOnly) {
    Bytes der = spki(attk());
    std::string pem = pem_one_line(attk()) + "\n";
    std::string why;
    EXPECT_EQ(soter::load_public_key(der, &why).spki_der(), der) << why;
    EXPECT_EQ(soter::load_public_key(bytes_of(pem), &why).spki_der(), der) << why;

    Bytes trailing = der;
    trailing.push_back(0);
    EXPECT_TRUE(soter::load_public_key(trailing, &why).empty());
    EXPECT_NE(why.find("follow"), std::string::npos) << why;
    EXPECT_TRUE(soter::load_public_key(bytes_of("not a key"), &why).empty());
    EXPECT_TRUE(soter::load_public_key(bytes_of(kRsa2048Pem), &why).empty()) << "a private key is no SPKI";
    EXPECT_TRUE(soter::load_public_key(Bytes(), &why).empty());
}

#ifdef KMCTL_PATH

namespace fs = std::filesystem;

class KmctlSoterVerify : public ::testing::Test {
  protected:
    void SetUp() override {
        spit(dir_ / "attk.der", spki(attk()));
        spit(dir_ / "attk.pem", bytes_of(pem_one_line(attk()) + "\n"));
        spit(dir_ / "app.export", export_output(export_doc(app_key()), attk()));
        spit(dir_ / "auth.export", export_output(export_doc(auth_key()), app_key()));
        spit(dir_ / "sign.out", sign_output(sign_doc(), auth_key()));
        spit(dir_ / "challenge", bytes_of(kChallenge));
    }
    // kmctl with a state directory that must never come to exist.
    CliRun kmctl(const std::string &args) {
        std::string cmd = std::string("cd '") + dir_.string() + "' && '" + KMCTL_PATH + "' --state '" +
                          (dir_ / "state").string() + "' soter verify " + args + " >'" + (dir_ / "out").string() +
                          "' 2>'" + (dir_ / "err").string() + "'";
        int raw = std::system(cmd.c_str());
        CliRun r;
        r.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
        r.out = slurp(dir_ / "out");
        r.err = slurp(dir_ / "err");
        EXPECT_FALSE(fs::exists(dir_ / "state")) << "verify made a state directory: " << args;
        return r;
    }

    ScratchDir scratch_{"kmctl-soter-verify"};
    const fs::path &dir_ = scratch_.path();
};

TEST_F(KmctlSoterVerify, ChainOnTheCommandLineWithPemAndDerKeys) {
    CliRun r = kmctl("export --in app.export --key attk.pem --pub-key-out app.pem");
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out.rfind("valid: ", 0), 0u) << r.out;
    EXPECT_NE(r.out.find("counter  7\n"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("uid      1000\n"), std::string::npos) << r.out;
    r = kmctl("export --in app.export --key attk.der");
    EXPECT_EQ(r.status, 0) << r.err;

    ASSERT_EQ(kmctl("export --in auth.export --key app.pem --pub-key-out auth.pem").status, 0);
    r = kmctl("sign --in sign.out --key auth.pem --challenge-file challenge --last-counter 11 --uid 1000 "
              "--cpu-id host-cpu-0 --fid 3");
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("counter  12\n"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("cpu_id   host-cpu-0\n"), std::string::npos) << r.out;
    EXPECT_EQ(r.err, "");

    // A signing output is no export, and the ATTK does not sign it.
    r = kmctl("export --in sign.out --key attk.der --pub-key-out none.pem");
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("refused (layout)"), std::string::npos) << r.err;
    EXPECT_FALSE(fs::exists(dir_ / "none.pem")) << "a refused export hands on no key";
    r = kmctl("sign --in sign.out --key attk.der --challenge-file challenge");
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("refused (signature)"), std::string::npos) << r.err;
}

TEST_F(KmctlSoterVerify, JsonVerdicts) {
    CliRun r = kmctl("export --in app.export --key attk.der --json");
    ASSERT_EQ(r.status, 0) << r.err;
    nlohmann::json j = nlohmann::json::parse(r.out);
    EXPECT_EQ(j["verdict"], "valid");
    EXPECT_TRUE(j["failed_check"].is_null());
    EXPECT_EQ(j["output"], "export");
    EXPECT_EQ(j["members"]["counter"], 7);
    EXPECT_EQ(j["members"]["pub_key"], pem_one_line(app_key()));

    ASSERT_EQ(kmctl("export --in app.export --key attk.der --pub-key-out app.pem").status, 0);
    ASSERT_EQ(kmctl("export --in auth.export --key app.pem --pub-key-out auth.pem").status, 0);

    // A stale counter: refused, the genuine members shown.
    r = kmctl("sign --in sign.out --key auth.pem --challenge-file challenge --last-counter 12 --json");
    EXPECT_EQ(r.status, 1);
    EXPECT_NE(r.err.find("refused (counter)"), std::string::npos) << r.err;
    j = nlohmann::json::parse(r.out);
    EXPECT_EQ(j["verdict"], "refused");
    EXPECT_EQ(j["failed_check"], "counter");
    EXPECT_EQ(j["scheme"], "rsa_pkcs1_1_5_sign/sha256");
    EXPECT_EQ(j["members"]["raw"], kChallenge);
    EXPECT_EQ(j["members"]["counter"], 12);

    // A wrong challenge, then a damaged signature: no members from a forgery.
    spit(dir_ / "other", bytes_of(kChallenge + "\n"));
    r = kmctl("sign --in sign.out --key auth.pem --challenge-file other --json");
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(nlohmann::json::parse(r.out)["failed_check"], "challenge");
    Bytes bad = bytes_of(slurp(dir_ / "sign.out"));
    bad.back() ^= 1;
    spit(dir_ / "bad.out", bad);
    r = kmctl("sign --in bad.out --key auth.pem --challenge-file challenge --json");
    EXPECT_EQ(r.status, 1);
    j = nlohmann::json::parse(r.out);
    EXPECT_EQ(j["failed_check"], "signature");
    EXPECT_TRUE(j["members"].is_null());
    EXPECT_TRUE(j["scheme"].is_null());
}

TEST_F(KmctlSoterVerify, UsageAndFileErrors) {
    EXPECT_EQ(kmctl("sign --in sign.out --key attk.der").status, 2) << "--challenge-file is required";
    EXPECT_EQ(kmctl("export --in app.export").status, 2);
    EXPECT_EQ(kmctl("").status, 2);
    EXPECT_EQ(kmctl("sign --in sign.out --key attk.der --challenge-file challenge --uid -1").status, 2);
    EXPECT_EQ(kmctl("sign --in sign.out --key attk.der --challenge-file challenge --fid 4294967296").status, 2);
    CliRun r = kmctl("export --in app.export --key challenge");
    EXPECT_EQ(r.status, 2);
    EXPECT_NE(r.err.find("--key"), std::string::npos) << r.err;
    EXPECT_EQ(kmctl("export --in missing --key attk.der").status, 4);
    EXPECT_EQ(kmctl("export --in - --key -").status, 2);
}

#endif

} // namespace
