/*
 * soter/verifier.h - checks SOTER statements on a relying server: the
 * signed export output of a SOTER key's public key, and the signed output
 * of a SOTER signing operation. Normal-world code only: it needs OpenSSL 3,
 * no TEE and no TA.
 *
 * Export output:  u32 J (little-endian, no NUL counted), J bytes of JSON,
 *                 the RSASSA-PKCS1-v1_5 SHA-256 signature over those J bytes.
 *                 Members: "counter" (optional), "uid" (optional), "pub_key".
 * Signing output: u32 J (little-endian, the NUL counted), the JSON and its
 *                 NUL, the signature over those J bytes, NUL included.
 *                 Members: "raw", "fid" (optional), "counter", "uid",
 *                 "tee_n", "tee_v", "fp_n", "fp_v", "cpu_id".
 *
 * A server chains the checks: the ATTK verifies the export of an application
 * key, whose exported key verifies the export of an authentication key,
 * whose exported key verifies a signing output:
 *
 *     soter::ExportVerdict app = soter::verify_export_output(app_out, attk);
 *     soter::ExportVerdict auth = soter::verify_export_output(auth_out, soter::exported_key(app));
 *     soter::SignVerdict sig = soter::verify_sign_output(sign_out, soter::exported_key(auth), expected);
 *
 * Nothing here throws: every failure, out of memory and OpenSSL errors
 * included, comes back as a refusal naming the check that failed.
 */
#ifndef SOTER_VERIFIER_H
#define SOTER_VERIFIER_H

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

struct evp_pkey_st; // OpenSSL's EVP_PKEY

namespace soter {

using Bytes = std::vector<std::uint8_t>;

// Check - what a refusal names; check_name gives the text used in messages
// and JSON, in this order of evaluation:
enum class Check {
    none,      // "none": every check held
    key,       // "key": the verification key is missing, not RSA, or below 2048 bits
    layout,    // "layout": the output's length prefix, NUL terminator or signature bytes are malformed
    signature, // "signature": the signature is not the key's size or does not verify over the document
    json,      // "json": the document is not strict JSON (syntax, trailing bytes, invalid UTF-8,
               //         a duplicate member name) or not an object
    members,   // "members": an unknown or missing member, a member of the wrong type, a number out of range
    pub_key,   // "pub_key": the export's "pub_key" is not a PEM RSA SubjectPublicKeyInfo
    challenge, // "challenge": "raw" is not the expected challenge
    counter,   // "counter": the counter is not greater than the last one seen
    uid,       // "uid": not the expected user id
    cpu_id,    // "cpu_id": not the expected CPU identifier
    fid,       // "fid": absent or not the expected fingerprint id
};

// check_name - the name of a check, as listed above.
const char *check_name(Check check) noexcept;

// PublicKey - an RSA public key, shared and immutable. An empty key verifies
// nothing: a verification given one is refused with Check::key.
class PublicKey {
  public:
    PublicKey() = default;
    explicit PublicKey(std::shared_ptr<evp_pkey_st> key) noexcept : key_(std::move(key)) {}

    bool empty() const noexcept { return !key_; }
    // bits - the modulus size in bits; 0 for an empty key.
    int bits() const noexcept;
    // spki_der - the key as a DER SubjectPublicKeyInfo; empty for an empty key or on failure.
    Bytes spki_der() const noexcept;
    // get - the OpenSSL key, owned by this object (and its copies); null when empty.
    evp_pkey_st *get() const noexcept { return key_.get(); }

  private:
    std::shared_ptr<evp_pkey_st> key_;
};

// load_public_key - an RSA SubjectPublicKeyInfo in PEM or DER, with nothing
// after it. An empty key on failure, with the reason in *why when given.
PublicKey load_public_key(std::span<const std::uint8_t> pem_or_der, std::string *why = nullptr) noexcept;

// Split - an output taken apart into the signed document and the signature.
struct Split {
    Check failed = Check::none; // Check::layout when the output is malformed
    std::string reason;         // a sentence saying what is wrong; empty when ok
    Bytes document;             // exactly the signed bytes (for a signing output: the JSON and its NUL)
    Bytes signature;            // every byte after the document

    bool ok() const noexcept { return failed == Check::none; }
    // text - the JSON text without any NUL terminator.
    std::string_view text() const noexcept;
};

// split_export_output - J (without NUL) and the J document bytes, then the
// signature. Refused: shorter than 4 bytes, J of 0 or past the end, no
// signature byte, a NUL byte inside the document.
Split split_export_output(std::span<const std::uint8_t> output) noexcept;

// split_sign_output - J (with NUL) and the J document bytes, NUL included
// (they are what was signed), then the signature. Refused: shorter than 4
// bytes, J of 0 or past the end, no signature byte, a document that does not
// end in its NUL or holds another NUL before it.
Split split_sign_output(std::span<const std::uint8_t> output) noexcept;

// ExportDocument - the members of a verified export document.
struct ExportDocument {
    std::optional<std::uint64_t> counter; // at most 2^53
    std::optional<std::uint32_t> uid;
    std::string pub_key_pem; // the "pub_key" text as it was signed
    PublicKey pub_key;       // the key it carries (RSA)
};

// SignDocument - the members of a verified signing document.
struct SignDocument {
    std::string raw;
    std::optional<std::uint32_t> fid;
    std::uint64_t counter = 0; // at most 2^53
    std::uint32_t uid = 0;
    std::string tee_n;
    std::string tee_v;
    std::string fp_n;
    std::string fp_v;
    std::string cpu_id;
};

// Verdict - the outcome: valid, or the first check that failed and why.
struct Verdict {
    Check failed = Check::none;
    std::string reason;     // a sentence naming what failed; empty when valid
    bool authentic = false; // the signature held and the document parsed: the members below are the signer's

    bool valid() const noexcept { return failed == Check::none; }
};

struct ExportVerdict : Verdict {
    ExportDocument document; // filled when authentic
};

// Signature schemes a signing output may use; the export output is always
// RSASSA-PKCS1-v1_5 with SHA-256. PSS takes any salt length, with MGF1 over
// the same digest.
enum class Padding { pkcs1_v1_5, pss };
enum class Digest { sha1, sha224, sha256, sha384, sha512 };
struct Scheme {
    Padding padding = Padding::pkcs1_v1_5;
    Digest digest = Digest::sha256;
};

// scheme_name - "rsa_pkcs1_1_5_sign/sha256", "rsa_pss/sha512", ...
std::string scheme_name(Scheme scheme);

// What a signing output must show besides a good signature.
struct SignExpectations {
    Bytes challenge;                   // "raw" must be exactly these bytes
    std::uint64_t last_counter = 0;    // "counter" must be greater
    std::optional<std::uint32_t> uid;  // when given, "uid" must equal it
    std::optional<std::string> cpu_id; // when given, "cpu_id" must equal it
    std::optional<std::uint32_t> fid;  // when given, "fid" must be present and equal it
    // The schemes accepted, tried in order: by default PKCS#1 v1.5 and PSS
    // with SHA-256.
    std::vector<Scheme> schemes = {{Padding::pkcs1_v1_5, Digest::sha256}, {Padding::pss, Digest::sha256}};
};

struct SignVerdict : Verdict {
    SignDocument document; // filled when authentic
    Scheme scheme;         // the scheme that verified, when authentic
};

// verify_export_output - checks, in order: key, layout, signature
// (RSASSA-PKCS1-v1_5 SHA-256 over the J bytes under `key`), json, members,
// pub_key. The document's members come back once the signature holds and the
// document parses, even when a later check fails.
ExportVerdict verify_export_output(std::span<const std::uint8_t> output, const PublicKey &key) noexcept;

// verify_sign_output - checks, in order: key, layout, signature (one of
// expect.schemes over the J bytes, NUL included, under `key`), json,
// members, challenge, counter, uid, cpu_id, fid.
SignVerdict verify_sign_output(std::span<const std::uint8_t> output, const PublicKey &key,
                               const SignExpectations &expect) noexcept;

// exported_key - the public key a valid export carries, to verify the next
// output of the chain with; an empty key (refused by every verification)
// when the verdict is not valid.
PublicKey exported_key(const ExportVerdict &verdict) noexcept;

} // namespace soter

#endif
