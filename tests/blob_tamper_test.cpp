/*
 * Tampered key blobs: every single-byte change and every truncation of a
 * blob of each algorithm is refused by every command that takes a blob,
 * with an error, without a crash and without a leak.
 */
#include <string>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "rsa_keys.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

struct Subject {
    const char *name;
    Bytes blob;
    uint32_t purpose;
    ParamSet begin_params;
};

class BlobTamper : public KeyTest {
  protected:
    std::vector<Subject> subjects() {
        std::vector<Subject> out;
        Bytes blob;
        EXPECT_TRUE(generate(hmac_params(), &blob).ok());
        out.push_back({"hmac", blob, KM_PURPOSE_SIGN, ParamSet().add(KM_TAG_MAC_LENGTH, 256)});

        ParamSet aes;
        aes.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add(KM_TAG_KEY_SIZE, 128).add(KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT);
        aes.add(KM_TAG_BLOCK_MODE, KM_MODE_CBC).add(KM_TAG_PADDING, KM_PAD_PKCS7).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        EXPECT_TRUE(generate(aes, &blob).ok());
        out.push_back({"aes", blob, KM_PURPOSE_ENCRYPT,
                       ParamSet().add(KM_TAG_BLOCK_MODE, KM_MODE_CBC).add(KM_TAG_PADDING, KM_PAD_PKCS7)});

        ParamSet rsa;
        rsa.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA).add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        rsa.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
        rsa.add_bool(KM_TAG_NO_AUTH_REQUIRED);
        EXPECT_TRUE(import(rsa, rsa_material(kRsa512Pem), &blob).ok());
        out.push_back(
            {"rsa", blob, KM_PURPOSE_SIGN,
             ParamSet().add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN)});

        ParamSet ec;
        ec.add(KM_TAG_ALGORITHM, KM_ALGORITHM_EC).add(KM_TAG_KEY_SIZE, 256).add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        ec.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        EXPECT_TRUE(generate(ec, &blob).ok());
        out.push_back({"ec", blob, KM_PURPOSE_SIGN, ParamSet().add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)});
        return out;
    }

    // Every command that takes a blob, on this one; each must refuse it.
    void expect_refused(const Subject &s, const Bytes &bad, const std::string &what, uint32_t trusted, size_t live) {
        const Bytes ref = key_reference(bad);
        uint32_t size = 0;
        Bytes out;
        uint32_t handle = 0;
        Bytes payload;
        EXPECT_FALSE(character_size(ref, &size).ok()) << what;
        EXPECT_FALSE(characteristics(ref, &out).ok()) << what;
        EXPECT_FALSE(export_key(ref, &out).ok()) << what;
        const Outcome begun = begin(s.purpose, bad, s.begin_params, &handle);
        EXPECT_FALSE(begun.ok()) << what;
        if (begun.ok())
            abort(handle);
        EXPECT_NE(open_raw(trusted, bad, &payload), TEE_SUCCESS) << what;
        EXPECT_EQ(tee_host::heap::stats().live_count, live) << what << ": leaked";
    }
};

TEST_F(BlobTamper, EveryByteChangeAndEveryTruncationIsRefusedEverywhere) {
    const uint32_t trusted = open(&trusted_client_uuids[0]);
    const std::vector<Subject> all = subjects();
    // What the TA holds between commands, the trusted session's context included.
    const size_t live = tee_host::heap::stats().live_count;
    for (const Subject &s : all) {
        // The untouched blob works in every command, so the refusals below are the tampering's.
        uint32_t handle = 0;
        ASSERT_TRUE(begin(s.purpose, s.blob, s.begin_params, &handle).ok()) << s.name << "\n" << dump_log();
        ASSERT_TRUE(abort(handle).ok());
        Bytes payload;
        ASSERT_EQ(open_raw(trusted, s.blob, &payload), TEE_SUCCESS) << s.name;

        for (size_t i = 0; i < s.blob.size(); ++i) {
            Bytes bad = s.blob;
            // Alternate low and high bits, so length fields change both ways.
            bad[i] ^= (i % 2) ? 0x01 : 0x80;
            expect_refused(s, bad, std::string(s.name) + ": byte " + std::to_string(i), trusted, live);
            tee_host::trace::clear();
        }
        for (size_t len = 0; len < s.blob.size(); ++len) {
            const Bytes cut(s.blob.begin(), s.blob.begin() + static_cast<long>(len));
            expect_refused(s, cut, std::string(s.name) + ": cut to " + std::to_string(len), trusted, live);
            tee_host::trace::clear();
        }
    }
    tee_->close_session(trusted);
}

} // namespace
