/*
 * verifier.cpp - the SOTER statement checks of soter/verifier.h: splitting
 * the outputs, RSA signature verification with OpenSSL's EVP, and a strict
 * reading of the documents with nlohmann::json.
 */
#include "soter/verifier.h"

#include <algorithm>
#include <set>
#include <string>
#include <utility>

#include <nlohmann/json.hpp>
#include <openssl/decoder.h>
#include <openssl/encoder.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>

namespace soter {
namespace {

using json = nlohmann::json;

constexpr int kMinKeyBits = 2048;
// Counters pass through a double in the TA: beyond 2^53 they are not exact.
constexpr std::uint64_t kMaxCounter = std::uint64_t{1} << 53;
constexpr std::string_view kPemHeader = "-----BEGIN PUBLIC KEY-----\n";

// refuse - records the failed check and its reason; returns false.
bool refuse(Verdict &v, Check check, std::string why) {
    v.failed = check;
    v.reason = std::move(why);
    return false;
}

std::shared_ptr<evp_pkey_st> own(EVP_PKEY *key) {
    return std::shared_ptr<evp_pkey_st>(key, EVP_PKEY_free);
}

// decode_spki - an RSA SubjectPublicKeyInfo of the given input type ("PEM",
// "DER", or null for either) that fills the whole input.
PublicKey decode_spki(std::span<const std::uint8_t> bytes, const char *input_type, std::string &why) {
    EVP_PKEY *raw = nullptr;
    OSSL_DECODER_CTX *ctx = OSSL_DECODER_CTX_new_for_pkey(&raw, input_type, "SubjectPublicKeyInfo", "RSA",
                                                          EVP_PKEY_PUBLIC_KEY, nullptr, nullptr);
    const unsigned char *p = bytes.data();
    size_t left = bytes.size();
    bool decoded = ctx && !bytes.empty() && OSSL_DECODER_from_data(ctx, &p, &left) == 1 && raw;
    OSSL_DECODER_CTX_free(ctx);
    ERR_clear_error();
    std::shared_ptr<evp_pkey_st> key = own(raw);
    if (!decoded) {
        why = "not an RSA public key (SubjectPublicKeyInfo)";
        return PublicKey();
    }
    if (left != 0) {
        why = "bytes follow the public key";
        return PublicKey();
    }
    return PublicKey(std::move(key));
}

std::uint32_t read_u32le(const std::uint8_t *p) {
    return static_cast<std::uint32_t>(p[0]) | static_cast<std::uint32_t>(p[1]) << 8 |
           static_cast<std::uint32_t>(p[2]) << 16 | static_cast<std::uint32_t>(p[3]) << 24;
}

// split_common - the length prefix, the document and the signature; the NUL
// rules of each output are checked by the callers.
Split split_common(std::span<const std::uint8_t> output) {
    Split s;
    auto refuse = [&s](std::string why) {
        s.failed = Check::layout;
        s.reason = std::move(why);
        return s;
    };
    if (output.size() < 4)
        return refuse("the output is " + std::to_string(output.size()) + " bytes, too short for its length prefix");
    const std::uint64_t j = read_u32le(output.data());
    const std::uint64_t rest = output.size() - 4;
    if (j == 0)
        return refuse("the document length is 0");
    if (j > rest)
        return refuse("the document length " + std::to_string(j) + " runs past the end of the " +
                      std::to_string(output.size()) + "-byte output");
    if (j == rest)
        return refuse("no signature follows the document");
    s.document.assign(output.begin() + 4, output.begin() + 4 + static_cast<std::ptrdiff_t>(j));
    s.signature.assign(output.begin() + 4 + static_cast<std::ptrdiff_t>(j), output.end());
    return s;
}

Split refused_split(std::string why) {
    Split s;
    s.failed = Check::layout;
    s.reason = std::move(why);
    return s;
}

// digest_name - OpenSSL's name of a digest, or its lower-case text for messages.
const char *digest_name(Digest d, bool text = false) {
    switch (d) {
    case Digest::sha1:
        return text ? "sha1" : "SHA1";
    case Digest::sha224:
        return text ? "sha224" : "SHA224";
    case Digest::sha256:
        return text ? "sha256" : "SHA256";
    case Digest::sha384:
        return text ? "sha384" : "SHA384";
    case Digest::sha512:
        return text ? "sha512" : "SHA512";
    }
    return nullptr;
}

struct MdCtxFree {
    void operator()(EVP_MD_CTX *c) const { EVP_MD_CTX_free(c); }
};

// verify_rsa - whether sig is the scheme's signature of msg under key.
// Any failure to set the verification up is a signature that does not hold.
bool verify_rsa(EVP_PKEY *key, Scheme scheme, std::span<const std::uint8_t> msg, std::span<const std::uint8_t> sig) {
    const char *md = digest_name(scheme.digest);
    std::unique_ptr<EVP_MD_CTX, MdCtxFree> ctx(EVP_MD_CTX_new());
    EVP_PKEY_CTX *pctx = nullptr; // owned by ctx
    bool ok = md && ctx && EVP_DigestVerifyInit_ex(ctx.get(), &pctx, md, nullptr, nullptr, key, nullptr) == 1 && pctx;
    if (ok && scheme.padding == Padding::pss)
        ok = EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PSS_PADDING) == 1 &&
             EVP_PKEY_CTX_set_rsa_pss_saltlen(pctx, RSA_PSS_SALTLEN_AUTO) == 1 &&
             EVP_PKEY_CTX_set_rsa_mgf1_md_name(pctx, md, nullptr) == 1;
    else if (ok)
        ok = EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PADDING) == 1;
    ok = ok && EVP_DigestVerify(ctx.get(), sig.data(), sig.size(), msg.data(), msg.size()) == 1;
    ERR_clear_error();
    return ok;
}

// check_key - a key this library verifies with: RSA of at least 2048 bits.
bool check_key(const PublicKey &key, Verdict &v) {
    if (key.empty())
        return refuse(v, Check::key, "no verification key");
    if (EVP_PKEY_is_a(key.get(), "RSA") != 1)
        return refuse(v, Check::key, "the verification key is not an RSA key");
    if (key.bits() < kMinKeyBits)
        return refuse(v, Check::key,
                      "the verification key has " + std::to_string(key.bits()) + " bits; at least " +
                          std::to_string(kMinKeyBits) + " are needed");
    return true;
}

bool check_signature_size(const PublicKey &key, const Split &s, Verdict &v) {
    const auto want = static_cast<size_t>(EVP_PKEY_get_size(key.get()));
    return s.signature.size() == want || refuse(v, Check::signature,
                                                "the signature is " + std::to_string(s.signature.size()) +
                                                    " bytes; the key's are " + std::to_string(want) + " bytes");
}

// parse_strict - the document as one JSON object, read strictly: nothing
// after the value, well-formed UTF-8, no NUL byte (which nlohmann's reader
// would take as the end of the input), no member name twice in an object.
bool parse_strict(std::string_view text, json &out, Verdict &v) {
    if (text.find('\0') != std::string_view::npos)
        return refuse(v, Check::json, "the document holds a NUL byte");
    std::vector<std::set<std::string>> names;
    std::string duplicate;
    json::parser_callback_t track = [&names, &duplicate](int, json::parse_event_t event, json &parsed) {
        if (event == json::parse_event_t::object_start)
            names.emplace_back();
        else if (event == json::parse_event_t::object_end && !names.empty())
            names.pop_back();
        else if (event == json::parse_event_t::key && !names.empty() && duplicate.empty() &&
                 !names.back().insert(parsed.get<std::string>()).second)
            duplicate = parsed.get<std::string>();
        return true;
    };
    try {
        out = json::parse(text.begin(), text.end(), track);
    } catch (const json::parse_error &e) {
        // "[json.exception.parse_error.101] parse error at ..." without its tag.
        std::string what = e.what();
        size_t tag = what.find("] ");
        return refuse(v, Check::json,
                      "the document is not valid JSON: " + (tag == std::string::npos ? what : what.substr(tag + 2)));
    }
    if (!duplicate.empty())
        return refuse(v, Check::json, "the document has the member \"" + duplicate + "\" twice");
    if (!out.is_object())
        return refuse(v, Check::json, "the document is not a JSON object");
    return true;
}

enum class Kind { text, u32, counter };
struct MemberRule {
    std::string_view name;
    Kind kind;
    bool required;
};

constexpr MemberRule kExportMembers[] = {
    {"counter", Kind::counter, false},
    {"uid", Kind::u32, false},
    {"pub_key", Kind::text, true},
};

constexpr MemberRule kSignMembers[] = {
    {"raw", Kind::text, true},  {"fid", Kind::u32, false},   {"counter", Kind::counter, true},
    {"uid", Kind::u32, true},   {"tee_n", Kind::text, true}, {"tee_v", Kind::text, true},
    {"fp_n", Kind::text, true}, {"fp_v", Kind::text, true},  {"cpu_id", Kind::text, true},
};

bool fits(const json &value, Kind kind) {
    switch (kind) {
    case Kind::text:
        return value.is_string();
    case Kind::u32:
        return value.is_number_unsigned() && value.get<std::uint64_t>() <= UINT32_MAX;
    case Kind::counter:
        return value.is_number_unsigned() && value.get<std::uint64_t>() <= kMaxCounter;
    }
    return false;
}

const char *kind_text(Kind kind) {
    switch (kind) {
    case Kind::text:
        return "a string";
    case Kind::u32:
        return "a whole number from 0 to 4294967295";
    case Kind::counter:
        return "a whole number from 0 to 2^53";
    }
    return "";
}

// check_members - every member known and of its type, every required one there.
bool check_members(const json &doc, std::span<const MemberRule> rules, Verdict &v) {
    for (const auto &item : doc.items()) {
        const std::string &name = item.key();
        const json &value = item.value();
        auto rule = std::find_if(rules.begin(), rules.end(), [&](const MemberRule &r) { return r.name == name; });
        if (rule == rules.end())
            return refuse(v, Check::members, "the document has an unknown member \"" + name + "\"");
        if (!fits(value, rule->kind))
            return refuse(v, Check::members, "the member \"" + name + "\" is not " + kind_text(rule->kind));
    }
    for (const MemberRule &r : rules)
        if (r.required && !doc.contains(r.name))
            return refuse(v, Check::members, "the document lacks the member \"" + std::string(r.name) + "\"");
    return true;
}

template <typename T> std::optional<T> optional_member(const json &doc, const char *name) {
    auto it = doc.find(name);
    if (it == doc.end())
        return std::nullopt;
    return it->get<T>();
}

std::string_view as_text(const Bytes &b) {
    return std::string_view(reinterpret_cast<const char *>(b.data()), b.size());
}

// refuse_internal - a check that could not be completed refuses, naming the
// check it was at, and shows no members.
template <typename V> void refuse_internal(V &v, Check at) {
    v.failed = at == Check::none ? Check::signature : at;
    v.reason = std::string("the ") + check_name(v.failed) + " check could not be completed (out of memory?)";
    v.authentic = false;
    v.document = {};
}

// authenticate - the checks both outputs share, in order: key, layout,
// signature (`verifies` tries the accepted schemes and says why none held),
// json, members. The parsed document when they all hold. `at` follows the
// check under way, so that an exception refuses at the right one.
template <typename SplitFn, typename VerifiesFn>
std::optional<json> authenticate(std::span<const std::uint8_t> output, const PublicKey &key, SplitFn split,
                                 VerifiesFn verifies, std::span<const MemberRule> rules, Verdict &v, Check &at) {
    at = Check::key;
    if (!check_key(key, v))
        return std::nullopt;
    at = Check::layout;
    Split s = split(output);
    if (!s.ok()) {
        refuse(v, s.failed, std::move(s.reason));
        return std::nullopt;
    }
    at = Check::signature;
    if (!check_signature_size(key, s, v) || !verifies(s))
        return std::nullopt;
    at = Check::json;
    json doc;
    if (!parse_strict(s.text(), doc, v))
        return std::nullopt;
    at = Check::members;
    if (!check_members(doc, rules, v))
        return std::nullopt;
    v.authentic = true;
    return doc;
}

} // namespace

const char *check_name(Check check) noexcept {
    switch (check) {
    case Check::none:
        return "none";
    case Check::key:
        return "key";
    case Check::layout:
        return "layout";
    case Check::signature:
        return "signature";
    case Check::json:
        return "json";
    case Check::members:
        return "members";
    case Check::pub_key:
        return "pub_key";
    case Check::challenge:
        return "challenge";
    case Check::counter:
        return "counter";
    case Check::uid:
        return "uid";
    case Check::cpu_id:
        return "cpu_id";
    case Check::fid:
        return "fid";
    }
    return "unknown";
}

int PublicKey::bits() const noexcept {
    return key_ ? EVP_PKEY_get_bits(key_.get()) : 0;
}

Bytes PublicKey::spki_der() const noexcept {
    if (!key_)
        return {};
    OSSL_ENCODER_CTX *ctx =
        OSSL_ENCODER_CTX_new_for_pkey(key_.get(), EVP_PKEY_PUBLIC_KEY, "DER", "SubjectPublicKeyInfo", nullptr);
    unsigned char *der = nullptr;
    size_t len = 0;
    bool ok = ctx && OSSL_ENCODER_to_data(ctx, &der, &len) == 1;
    OSSL_ENCODER_CTX_free(ctx);
    ERR_clear_error();
    Bytes out;
    try {
        if (ok)
            out.assign(der, der + len);
    } catch (...) {
        out.clear();
    }
    OPENSSL_free(der);
    return out;
}

PublicKey load_public_key(std::span<const std::uint8_t> pem_or_der, std::string *why) noexcept {
    try {
        std::string reason;
        PublicKey key = decode_spki(pem_or_der, nullptr, reason);
        if (why)
            *why = reason;
        return key;
    } catch (...) {
        return PublicKey();
    }
}

std::string_view Split::text() const noexcept {
    std::string_view t = as_text(document);
    while (!t.empty() && t.back() == '\0')
        t.remove_suffix(1);
    return t;
}

Split split_export_output(std::span<const std::uint8_t> output) noexcept {
    try {
        Split s = split_common(output);
        if (!s.ok())
            return s;
        const std::string_view doc = as_text(s.document);
        if (doc.back() == '\0')
            return refused_split("the document ends with a NUL, as a signing output's does");
        if (doc.find('\0') != std::string_view::npos)
            return refused_split("the document holds a NUL byte");
        return s;
    } catch (...) {
        return refused_split("the output could not be split (out of memory?)");
    }
}

Split split_sign_output(std::span<const std::uint8_t> output) noexcept {
    try {
        Split s = split_common(output);
        if (!s.ok())
            return s;
        const std::string_view doc = as_text(s.document);
        if (doc.back() != '\0')
            return refused_split("the document does not end with its NUL, as an export output's does not");
        if (doc.find('\0') != doc.size() - 1)
            return refused_split("the document holds a NUL byte before its end");
        return s;
    } catch (...) {
        return refused_split("the output could not be split (out of memory?)");
    }
}

std::string scheme_name(Scheme scheme) {
    const char *digest = digest_name(scheme.digest, true);
    return std::string(scheme.padding == Padding::pss ? "rsa_pss/" : "rsa_pkcs1_1_5_sign/") +
           (digest ? digest : "unknown");
}

ExportVerdict verify_export_output(std::span<const std::uint8_t> output, const PublicKey &key) noexcept {
    ExportVerdict v;
    Check at = Check::key;
    try {
        auto verifies = [&](const Split &s) {
            return verify_rsa(key.get(), Scheme{Padding::pkcs1_v1_5, Digest::sha256}, s.document, s.signature) ||
                   refuse(v, Check::signature,
                          "the export document's signature (RSASSA-PKCS1-v1_5, SHA-256) does not verify under the key");
        };
        std::optional<json> doc = authenticate(output, key, split_export_output, verifies, kExportMembers, v, at);
        if (!doc)
            return v;
        v.document.counter = optional_member<std::uint64_t>(*doc, "counter");
        v.document.uid = optional_member<std::uint32_t>(*doc, "uid");
        v.document.pub_key_pem = (*doc)["pub_key"].get<std::string>();
        at = Check::pub_key;
        const std::string &pem = v.document.pub_key_pem;
        std::string why;
        // The TA writes exactly one PEM block: nothing may stand before it.
        PublicKey carried;
        if (pem.starts_with(kPemHeader))
            carried =
                decode_spki(std::span(reinterpret_cast<const std::uint8_t *>(pem.data()), pem.size()), "PEM", why);
        if (carried.empty())
            refuse(v, Check::pub_key,
                   "\"pub_key\" is not a PEM RSA public key" + (why.empty() ? std::string() : ": " + why));
        v.document.pub_key = std::move(carried);
        return v;
    } catch (...) {
        refuse_internal(v, at);
        return v;
    }
}

SignVerdict verify_sign_output(std::span<const std::uint8_t> output, const PublicKey &key,
                               const SignExpectations &expect) noexcept {
    SignVerdict v;
    Check at = Check::key;
    try {
        auto verifies = [&](const Split &s) {
            std::string tried;
            for (Scheme sc : expect.schemes) {
                if (verify_rsa(key.get(), sc, s.document, s.signature)) {
                    v.scheme = sc;
                    return true;
                }
                tried += (tried.empty() ? "" : ", ") + scheme_name(sc);
            }
            return refuse(v, Check::signature,
                          "the signing document's signature does not verify under the key (schemes tried: " +
                              (tried.empty() ? std::string("none") : tried) + ")");
        };
        std::optional<json> doc = authenticate(output, key, split_sign_output, verifies, kSignMembers, v, at);
        if (!doc)
            return v;
        SignDocument &d = v.document;
        d.raw = (*doc)["raw"].get<std::string>();
        d.fid = optional_member<std::uint32_t>(*doc, "fid");
        d.counter = (*doc)["counter"].get<std::uint64_t>();
        d.uid = (*doc)["uid"].get<std::uint32_t>();
        d.tee_n = (*doc)["tee_n"].get<std::string>();
        d.tee_v = (*doc)["tee_v"].get<std::string>();
        d.fp_n = (*doc)["fp_n"].get<std::string>();
        d.fp_v = (*doc)["fp_v"].get<std::string>();
        d.cpu_id = (*doc)["cpu_id"].get<std::string>();

        // Each expectation in turn; the first unmet one is the verdict.
        at = Check::challenge;
        if (d.raw != as_text(expect.challenge)) {
            refuse(v, at, "\"raw\" is not the expected challenge");
            return v;
        }
        at = Check::counter;
        if (d.counter <= expect.last_counter) {
            refuse(v, at,
                   "the counter " + std::to_string(d.counter) + " is not greater than the last one seen, " +
                       std::to_string(expect.last_counter));
            return v;
        }
        at = Check::uid;
        if (expect.uid && d.uid != *expect.uid) {
            refuse(v, at, "the uid is " + std::to_string(d.uid) + ", not " + std::to_string(*expect.uid));
            return v;
        }
        at = Check::cpu_id;
        if (expect.cpu_id && d.cpu_id != *expect.cpu_id) {
            refuse(v, at, "\"cpu_id\" is not the expected CPU identifier");
            return v;
        }
        at = Check::fid;
        if (expect.fid && d.fid != expect.fid)
            refuse(v, at,
                   d.fid ? "the fingerprint id is " + std::to_string(*d.fid) + ", not " + std::to_string(*expect.fid)
                         : "the document carries no fingerprint id; " + std::to_string(*expect.fid) + " was expected");
        return v;
    } catch (...) {
        refuse_internal(v, at);
        return v;
    }
}

PublicKey exported_key(const ExportVerdict &verdict) noexcept {
    return verdict.valid() ? verdict.document.pub_key : PublicKey();
}

} // namespace soter
