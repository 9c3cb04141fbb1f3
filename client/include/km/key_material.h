/*
 * key_material.h - conversions between the key encodings people hold
 * (PKCS#8 private keys, X.509 SubjectPublicKeyInfo, PEM) and the layouts
 * the TA's import and export use. Done in the normal world, with OpenSSL.
 *
 * TA layouts: every length is u32 little-endian, every integer unsigned
 * big-endian with no sign byte.
 * - RSA import: n, e, d, p, q, dp, dq, qinv, each as length then bytes.
 * - EC import: key size in bits, then x, y and the private value d, each as
 *   length then bytes, padded to the field size.
 * - EC export: key size, x, y as in the import.
 * - RSA export: already a DER SubjectPublicKeyInfo.
 */
#ifndef KM_KEY_MATERIAL_H
#define KM_KEY_MATERIAL_H

#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "km/param_set.h"

namespace km {

// Passphrase - gives the passphrase of an encrypted key when asked (only
// then), or nullopt when there is none to give. An empty function is none.
using Passphrase = std::function<std::optional<std::string>()>;

// rsa_import_material - the TA's RSA import material from an RSA private
// key in any form OpenSSL writes by default, read by OpenSSL's decoders:
// PKCS#8 (plain, or encrypted with the passphrase given), or traditional
// PKCS#1, PEM or DER. nullopt, with a one-line reason in *why, for anything
// else (another algorithm, a wrong or missing passphrase, bytes after a DER
// key, truncated input).
std::optional<Bytes> rsa_import_material(std::span<const uint8_t> key_file, const Passphrase &passphrase,
                                         std::string *why);
std::optional<Bytes> rsa_import_material(std::span<const uint8_t> key_file, std::string *why);

// ec_import_material - the same for an EC private key (PKCS#8 or SEC 1) on
// one of the NIST prime curves P-192, P-224, P-256, P-384 and P-521.
std::optional<Bytes> ec_import_material(std::span<const uint8_t> key_file, const Passphrase &passphrase,
                                        std::string *why);
std::optional<Bytes> ec_import_material(std::span<const uint8_t> key_file, std::string *why);

// public_key_der - the DER SubjectPublicKeyInfo of what the TA exported
// for a key of this algorithm: RSA's checked and passed on, EC's
// coordinates wrapped. nullopt, with *why, when the export does not parse
// or the algorithm exports no public key.
std::optional<Bytes> public_key_der(uint32_t algorithm, std::span<const uint8_t> exported, std::string *why);

// pem_encode - der in PEM armour under label ("PUBLIC KEY"), base64 in
// lines of 64 characters, ending with a newline, by OpenSSL's PEM writer.
// Throws std::bad_alloc when OpenSSL cannot allocate.
std::string pem_encode(std::string_view label, std::span<const uint8_t> der);

} // namespace km

#endif
