/*
 * param_options.h - command-line options that become key parameters:
 * --tag/--param NAME[=VALUE], and the named options of generate and import.
 * Every function here throws Failure (usage) for a bad value, before any
 * TEE is opened.
 */
#ifndef KMCTL_PARAM_OPTIONS_H
#define KMCTL_PARAM_OPTIONS_H

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>

#include "km/param_set.h"

namespace kmctl {

// add_param_text - appends the parameter "NAME[=VALUE]" that option
// (for the message) gave.
void add_param_text(km::ParamSet &set, std::string_view option, const std::string &text);

// add_tag_value - appends tag=value, the value as its type reads it
// (km::parse_param); used by the named options.
void add_tag_value(km::ParamSet &set, std::string_view option, std::string_view tag, const std::string &value);

// add_list_option - a repeatable option whose values may also be
// comma-separated lists ("--digest sha256,sha512").
CLI::Option *add_list_option(CLI::App &app, const std::string &name, std::vector<std::string> &values,
                             const std::string &help);

// check_single_tags - refuses a set that holds a non-repeatable tag twice.
void check_single_tags(const km::ParamSet &set);

// NewKeyOptions - the options that describe a key to generate or import.
struct NewKeyOptions {
    std::string algorithm;
    std::string size;
    std::vector<std::string> purposes;
    std::vector<std::string> digests;
    std::vector<std::string> paddings;
    std::vector<std::string> block_modes;
    std::string min_mac_length;
    std::string exponent;
    std::string app_id;
    std::string app_data;
    bool has_app_id = false;
    bool has_app_data = false;
    std::vector<std::string> tags;
    // A SOTER key: its export and its signatures are signed statements.
    bool soter = false;
    bool soter_counter = false;
    std::string soter_uid;
    std::string soter_sign_with;     // "attk"
    std::string soter_sign_with_key; // a key blob file
};

// add_new_key_options - --algorithm (required), --size, --purpose,
// --digest, --padding, --block-mode, --min-mac-length, --exponent,
// --app-id, --app-data, --tag and the SOTER options on app.
void add_new_key_options(CLI::App &app, NewKeyOptions &desc);

// digest_bits - a digest's output length in bits; 0 for none or unknown.
uint32_t digest_bits(uint32_t digest);

// add_key_defaults - completes a new key's parameters so that the key is
// usable as it is (the defaults table of the README): RSA 2048 bits with
// exponent 65537 when generated, EC 256 bits, digest sha256 (RSA, EC,
// HMAC), RSA paddings for the key's purposes (PSS and PKCS#1 for signing,
// OAEP for encryption), an HMAC key's size and minimum MAC length from its
// shortest digest, 128-bit minimum GCM tags, and KM_TAG_NO_AUTH_REQUIRED
// unless auth is configured. Refuses (usage) an AES key without a size or
// block mode, and an RSA size or exponent the TEE cannot generate.
void add_key_defaults(km::ParamSet &set, uint32_t algorithm, bool generating);

// key_params - the key's parameter set: the options given, every purpose
// of the algorithm without --purpose, then add_key_defaults. *algorithm
// receives the algorithm's value. Throws Failure (usage).
km::ParamSet key_params(const NewKeyOptions &desc, uint32_t *algorithm, bool generating);

} // namespace kmctl

#endif
