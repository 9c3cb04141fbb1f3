/*
 * param_options.cpp - options that become key parameters.
 */
#include "param_options.h"

#include "common.h"
#include "keymaster_defs.h"
#include "km/names.h"
#include "km/param_text.h"

namespace kmctl {

void add_param_text(km::ParamSet &set, std::string_view option, const std::string &text) {
    std::string why;
    std::optional<km::Param> p = km::parse_param(text, &why);
    if (!p)
        usage_error(std::string(option) + ": " + why);
    if (km::tag_is_bytes(p->tag))
        set.add_bytes(p->tag, std::move(p->bytes));
    else
        set.add(p->tag, p->value);
}

void add_tag_value(km::ParamSet &set, std::string_view option, std::string_view tag, const std::string &value) {
    add_param_text(set, option, std::string(tag) + "=" + value);
}

CLI::Option *add_list_option(CLI::App &app, const std::string &name, std::vector<std::string> &values,
                             const std::string &help) {
    // One value per occurrence: a following word is never swallowed.
    return app.add_option(name, values, help)->delimiter(',')->allow_extra_args(false)->type_name("LIST");
}

void check_single_tags(const km::ParamSet &set) {
    if (std::optional<uint32_t> tag = km::repeated_single_tag(set))
        usage_error(km::tag_name(*tag) + " may be given only once");
}

void add_new_key_options(CLI::App &app, NewKeyOptions &desc) {
    app.add_option("--algorithm", desc.algorithm, "Key algorithm: rsa, ec, aes or hmac")->required()->type_name("ALG");
    app.add_option("--size", desc.size, "Key size in bits (KM_TAG_KEY_SIZE)")->type_name("BITS");
    add_list_option(app, "--purpose", desc.purposes,
                    "Purposes: encrypt, decrypt, sign, verify (default: all the algorithm has)");
    add_list_option(app, "--digest", desc.digests, "Digests: none, md5, sha1, sha224, sha256, sha384, sha512");
    add_list_option(app, "--padding", desc.paddings,
                    "Paddings: none, rsa_oaep, rsa_pss, rsa_pkcs1_1_5_encrypt, rsa_pkcs1_1_5_sign, pkcs7");
    add_list_option(app, "--block-mode", desc.block_modes, "Block modes: ecb, cbc, ctr, gcm");
    app.add_option("--min-mac-length", desc.min_mac_length, "Shortest MAC or GCM tag allowed, in bits")
        ->type_name("BITS");
    app.add_option("--exponent", desc.exponent, "RSA public exponent (KM_TAG_RSA_PUBLIC_EXPONENT)")->type_name("E");
    app.add_option_function<std::string>(
           "--app-id",
           [&desc](const std::string &v) {
               desc.app_id = v;
               desc.has_app_id = true;
           },
           "Bind the key to this application id; every later use must give it")
        ->type_name("TEXT");
    app.add_option_function<std::string>(
           "--app-data",
           [&desc](const std::string &v) {
               desc.app_data = v;
               desc.has_app_data = true;
           },
           "Bind the key to this application data; every later use must give it")
        ->type_name("TEXT");
    app.add_option("--tag", desc.tags, "Any key parameter, NAME[=VALUE]; repeatable")
        ->allow_extra_args(false)
        ->type_name("NAME[=VALUE]");
    app.add_flag("--soter", desc.soter, "A SOTER key (RSA): export and signing give signed statements");
    app.add_flag("--soter-counter", desc.soter_counter, "SOTER: each export takes a new counter value");
    app.add_option("--soter-uid", desc.soter_uid, "SOTER: the user id the statements carry")->type_name("N");
    app.add_option("--soter-sign-with", desc.soter_sign_with, "SOTER: the export is signed by the device's ATTK")
        ->check(CLI::IsMember({"attk"}))
        ->type_name("attk");
    app.add_option("--soter-sign-with-key", desc.soter_sign_with_key,
                   "SOTER: the export is signed by this RSA key (a key blob of this TA)")
        ->type_name("BLOB");
}

namespace {

// The SOTER tags of a new key, from its options.
void add_soter_tags(km::ParamSet &set, const NewKeyOptions &desc, uint32_t algorithm) {
    const bool described = desc.soter_counter || !desc.soter_uid.empty() || !desc.soter_sign_with.empty() ||
                           !desc.soter_sign_with_key.empty();
    if (!desc.soter) {
        if (described)
            usage_error("--soter-counter, --soter-uid and --soter-sign-with* describe a SOTER key: add --soter");
        return;
    }
    if (algorithm != KM_ALGORITHM_RSA)
        usage_error("--soter: SOTER keys are RSA keys");
    if (!desc.soter_sign_with.empty() && !desc.soter_sign_with_key.empty())
        usage_error("--soter-sign-with and --soter-sign-with-key: the export has one signer");
    set.add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
    // Servers check statements with PKCS#1 v1.5 over SHA-256 first: the
    // usable default, so that sign needs no --padding.
    if (!set.find(KM_TAG_PADDING))
        set.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
    if (desc.soter_counter)
        set.add_bool(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY);
    if (!desc.soter_uid.empty())
        add_tag_value(set, "--soter-uid", "KM_TAG_SOTER_UID", desc.soter_uid);
    if (!desc.soter_sign_with.empty())
        set.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY);
    if (!desc.soter_sign_with_key.empty()) {
        set.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
        set.add_bytes(KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB,
                      read_input(desc.soter_sign_with_key));
    }
}

} // namespace

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

namespace {

bool has_value(const km::ParamSet &set, uint32_t tag, uint32_t value) {
    for (const km::Param &p : set.params())
        if (p.tag == tag && p.value == value)
            return true;
    return false;
}

// What kmctl can tell is wrong with an RSA key before any TEE starts.
void check_rsa(const km::ParamSet &set, bool generating) {
    const km::Param *size = set.find(KM_TAG_KEY_SIZE);
    if (generating && size && (size->value % 8 != 0 || size->value < 512 || size->value > 8192))
        usage_error("--size: an RSA key is 512 to 8192 bits, a multiple of 8 (2048 is usual), not " +
                    std::to_string(size->value));
    const km::Param *e = set.find(KM_TAG_RSA_PUBLIC_EXPONENT);
    if (generating && e && (e->value % 2 == 0 || e->value < 3))
        usage_error("--exponent: an RSA public exponent is odd and at least 3 (65537 is usual), not " +
                    std::to_string(e->value));
}

} // namespace

void add_key_defaults(km::ParamSet &set, uint32_t alg, bool generating) {
    const bool rsa = alg == KM_ALGORITHM_RSA;
    const bool signs =
        has_value(set, KM_TAG_PURPOSE, KM_PURPOSE_SIGN) || has_value(set, KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
    const bool ciphers =
        has_value(set, KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT) || has_value(set, KM_TAG_PURPOSE, KM_PURPOSE_DECRYPT);
    if (generating && !set.find(KM_TAG_KEY_SIZE)) {
        if (rsa)
            set.add(KM_TAG_KEY_SIZE, 2048);
        else if (alg == KM_ALGORITHM_EC)
            set.add(KM_TAG_KEY_SIZE, 256);
        else if (alg == KM_ALGORITHM_AES)
            usage_error("an AES key needs --size: 128, 192 or 256");
    }
    // The TA wants an exponent; an import reads it from the key instead.
    if (generating && rsa && !set.find(KM_TAG_RSA_PUBLIC_EXPONENT))
        set.add(KM_TAG_RSA_PUBLIC_EXPONENT, 65537);
    if (rsa)
        check_rsa(set, generating);
    if (alg != KM_ALGORITHM_AES && !set.find(KM_TAG_DIGEST))
        set.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    if (rsa && !set.find(KM_TAG_PADDING)) {
        if (signs) {
            set.add(KM_TAG_PADDING, KM_PAD_RSA_PSS);
            set.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
        }
        if (ciphers)
            set.add(KM_TAG_PADDING, KM_PAD_RSA_OAEP);
    }
    if (alg == KM_ALGORITHM_AES && !set.find(KM_TAG_BLOCK_MODE))
        usage_error("an AES key needs --block-mode: ecb, cbc, ctr or gcm");
    if (alg == KM_ALGORITHM_HMAC) {
        // The shortest digest's length: a MAC can never be longer.
        uint32_t shortest = 0;
        for (const km::Param &p : set.params())
            if (p.tag == KM_TAG_DIGEST && digest_bits(static_cast<uint32_t>(p.value)) != 0 &&
                (shortest == 0 || digest_bits(static_cast<uint32_t>(p.value)) < shortest))
                shortest = digest_bits(static_cast<uint32_t>(p.value));
        if (generating && !set.find(KM_TAG_KEY_SIZE) && shortest != 0)
            set.add(KM_TAG_KEY_SIZE, shortest);
        if (!set.find(KM_TAG_MIN_MAC_LENGTH) && shortest != 0)
            set.add(KM_TAG_MIN_MAC_LENGTH, shortest);
    }
    if (alg == KM_ALGORITHM_AES && has_value(set, KM_TAG_BLOCK_MODE, KM_MODE_GCM) && !set.find(KM_TAG_MIN_MAC_LENGTH))
        set.add(KM_TAG_MIN_MAC_LENGTH, 128);
    // A key with neither is refused every operation for want of an auth token.
    if (!set.find(KM_TAG_NO_AUTH_REQUIRED) && !set.find(KM_TAG_USER_SECURE_ID))
        set.add_bool(KM_TAG_NO_AUTH_REQUIRED);
}

km::ParamSet key_params(const NewKeyOptions &desc, uint32_t *algorithm, bool generating) {
    std::optional<uint32_t> alg = km::parse_enum(km::Enumeration::algorithm, desc.algorithm);
    if (!alg)
        usage_error("--algorithm: unknown algorithm '" + desc.algorithm + "': expected rsa, ec, aes or hmac");
    *algorithm = *alg;

    km::ParamSet set;
    set.add(KM_TAG_ALGORITHM, *alg);
    if (!desc.size.empty())
        add_tag_value(set, "--size", "KM_TAG_KEY_SIZE", desc.size);
    if (desc.purposes.empty()) {
        std::vector<uint32_t> all;
        // A SOTER key signs statements; it has nothing to encrypt.
        if (!desc.soter && (*alg == KM_ALGORITHM_RSA || *alg == KM_ALGORITHM_AES))
            all.insert(all.end(), {KM_PURPOSE_ENCRYPT, KM_PURPOSE_DECRYPT});
        if (*alg == KM_ALGORITHM_RSA || *alg == KM_ALGORITHM_EC || *alg == KM_ALGORITHM_HMAC)
            all.insert(all.end(), {KM_PURPOSE_SIGN, KM_PURPOSE_VERIFY});
        for (uint32_t p : all)
            set.add(KM_TAG_PURPOSE, p);
    }
    for (const std::string &p : desc.purposes)
        add_tag_value(set, "--purpose", "KM_TAG_PURPOSE", p);
    for (const std::string &d : desc.digests)
        add_tag_value(set, "--digest", "KM_TAG_DIGEST", d);
    for (const std::string &p : desc.paddings)
        add_tag_value(set, "--padding", "KM_TAG_PADDING", p);
    for (const std::string &m : desc.block_modes)
        add_tag_value(set, "--block-mode", "KM_TAG_BLOCK_MODE", m);
    if (!desc.min_mac_length.empty())
        add_tag_value(set, "--min-mac-length", "KM_TAG_MIN_MAC_LENGTH", desc.min_mac_length);
    if (!desc.exponent.empty())
        add_tag_value(set, "--exponent", "KM_TAG_RSA_PUBLIC_EXPONENT", desc.exponent);
    if (desc.has_app_id)
        set.add_bytes(KM_TAG_APPLICATION_ID, text_bytes(desc.app_id));
    if (desc.has_app_data)
        set.add_bytes(KM_TAG_APPLICATION_DATA, text_bytes(desc.app_data));
    for (const std::string &t : desc.tags)
        add_param_text(set, "--tag", t);
    add_soter_tags(set, desc, *alg);
    add_key_defaults(set, *alg, generating);
    check_single_tags(set);
    return set;
}

} // namespace kmctl
