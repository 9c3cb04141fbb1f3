/*
 * SOTER statements through the command interface: the counter, the
 * fingerprint TA's notification and its freshness, the export and signing
 * documents byte for byte, and their signatures checked with OpenSSL.
 */
#include <cstring>
#include <string>

#include <openssl/evp.h>
#include <openssl/rsa.h>

#include "key_commands.h"
#include "km/key_material.h"
#include "rsa_keys.h"
#include "soter.h"
#include "soter_keys.h"
#include "ta_entry.h"

namespace {

namespace prov = tee_host::provisioning;
namespace fp = tee_host::fingerprint;
using km::ParamSet;

// The fingerprint TA the factory data names.
constexpr TEE_UUID kFingerprintTa = {0x0fb1c2d3, 0x4e5f, 0x4a6b, {0x9c, 0x8d, 0x7e, 0x6f, 0x50, 0x41, 0x32, 0x23}};

// The PEM text the TA makes of a key's public half: the base64 of its
// SubjectPublicKeyInfo on one line between the two armour lines.
std::string public_pem(const char *pem) {
    Bytes der = spki_of(pem);
    std::string b64(4 * ((der.size() + 2) / 3) + 1, '\0');
    const int n =
        EVP_EncodeBlock(reinterpret_cast<unsigned char *>(b64.data()), der.data(), static_cast<int>(der.size()));
    b64.resize(static_cast<size_t>(n));
    return "-----BEGIN PUBLIC KEY-----\n" + b64 + "\n-----END PUBLIC KEY-----";
}

// The PEM as a JSON string body: line breaks and slashes escaped.
std::string json_escaped(const std::string &text) {
    std::string out;
    for (char c : text) {
        if (c == '\n')
            out += "\\n";
        else if (c == '/')
            out += "\\/";
        else
            out += c;
    }
    return out;
}

// verify - whether sig is key's signature over data: SHA-256 with PKCS#1
// v1.5, or with PSS and any salt length.
bool verify(const char *key_pem, const Bytes &data, const Bytes &sig, bool pss = false) {
    Pkey key = decode_rsa(key_pem);
    EVP_MD_CTX *md = EVP_MD_CTX_new();
    EVP_PKEY_CTX *pctx = nullptr;
    bool ok = EVP_DigestVerifyInit(md, &pctx, EVP_sha256(), nullptr, key.get()) == 1;
    if (ok && pss)
        ok = EVP_PKEY_CTX_set_rsa_padding(pctx, RSA_PKCS1_PSS_PADDING) == 1 &&
             EVP_PKEY_CTX_set_rsa_pss_saltlen(pctx, RSA_PSS_SALTLEN_AUTO) == 1;
    ok = ok && EVP_DigestVerify(md, sig.data(), sig.size(), data.data(), data.size()) == 1;
    EVP_MD_CTX_free(md);
    return ok;
}

// An output split at its u32 little-endian J.
struct Split {
    Bytes json;
    Bytes signature;
};
Split split(const Bytes &out) {
    EXPECT_GE(out.size(), 4u);
    if (out.size() < 4)
        return {};
    const uint32_t j = out[0] | out[1] << 8 | out[2] << 16 | static_cast<uint32_t>(out[3]) << 24;
    EXPECT_LE(j, out.size() - 4);
    if (j > out.size() - 4)
        return {};
    return {Bytes(out.begin() + 4, out.begin() + 4 + j), Bytes(out.begin() + 4 + j, out.end())};
}

std::string text_of(const Bytes &b) {
    return std::string(b.begin(), b.end());
}

class Soter : public KeyTest {
  protected:
    void SetUp() override {
        KeyTest::SetUp();
        tee_host::clock::freeze();
        prov::FactoryData d = factory_key(kRsa2048Pem);
        d.sensor_name = "sensor";
        d.sensor_version = "2.1";
        d.fp_ta_uuid = kFingerprintTa;
        d.cpu_id = "cpu-42";
        ASSERT_EQ(prov::store(state_dir_, d, false), prov::StoreResult::stored);
    }
    void TearDown() override {
        tee_host::clock::unfreeze();
        KeyTest::TearDown();
    }

    // load - command 0xFF00: the SOTER state is loaded, so the fingerprint TA is known.
    void load() {
        Params p = Params::value();
        ASSERT_EQ(invoke(KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, p), TEE_SUCCESS);
        ASSERT_EQ(p.p[0].value.a, 0u) << dump_log();
    }

    // A SOTER signing key imported from pem, with the extra tags.
    Bytes soter_key(const char *pem, ParamSet p = {}) {
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA);
        p.add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        p.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
        p.add(KM_TAG_DIGEST, KM_DIGEST_NONE);
        p.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
        p.add(KM_TAG_PADDING, KM_PAD_RSA_PSS);
        p.add_bool(KM_TAG_NO_AUTH_REQUIRED);
        p.add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
        Bytes blob;
        EXPECT_TRUE(import(p, rsa_material(pem), &blob, nullptr, 16384).ok()) << dump_log();
        return blob;
    }
    static ParamSet attk_signed(bool counter, std::optional<uint32_t> uid) {
        ParamSet p;
        p.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY);
        if (counter)
            p.add_bool(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY);
        if (uid)
            p.add(KM_TAG_SOTER_UID, *uid);
        return p;
    }

    Outcome soter_export(const Bytes &blob, Bytes *out, size_t capacity = 4096) {
        return export_key(key_reference(blob), out, capacity);
    }

    // sign - one SOTER signing of message in updates of chunk bytes.
    Outcome sign(const Bytes &blob, const std::string &message, Bytes *out,
                 uint32_t padding = KM_PAD_RSA_PKCS1_1_5_SIGN, size_t chunk = 0) {
        ParamSet params;
        params.add(KM_TAG_PADDING, padding);
        params.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
        Bytes msg(message.begin(), message.end());
        return run(KM_PURPOSE_SIGN, blob, params, msg, chunk ? chunk : msg.size() + 1, {}, out);
    }

    std::string expected_sign_json(const std::string &raw, std::optional<uint32_t> fid, uint64_t counter,
                                   uint32_t uid) {
        std::string j = "{\"raw\":\"" + raw + "\"";
        if (fid)
            j += ",\"fid\":" + std::to_string(*fid);
        j += ",\"counter\":" + std::to_string(counter) + ",\"uid\":" + std::to_string(uid) +
             ",\"tee_n\":\"Host TEE Emulation\",\"tee_v\":\"1.0.0\",\"fp_n\":\"sensor\",\"fp_v\":\"2.1\","
             "\"cpu_id\":\"cpu-42\"}";
        return j;
    }

    // The counter object as stored: its bytes.
    Bytes counter_object() {
        TEE_ObjectHandle obj = TEE_HANDLE_NULL;
        static const char id[] = "SOTER_COUNTER_OBJECT";
        EXPECT_EQ(TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, id, sizeof id, TEE_DATA_FLAG_ACCESS_READ, &obj),
                  TEE_SUCCESS);
        Bytes data(16, 0);
        uint32_t n = 0;
        EXPECT_EQ(TEE_ReadObjectData(obj, data.data(), static_cast<uint32_t>(data.size()), &n), TEE_SUCCESS);
        TEE_CloseObject(obj);
        data.resize(n);
        return data;
    }
    void plant_counter_object(const Bytes &data) {
        static const char id[] = "SOTER_COUNTER_OBJECT";
        TEE_ObjectHandle obj = TEE_HANDLE_NULL;
        ASSERT_EQ(TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE, id, sizeof id,
                                             TEE_DATA_FLAG_ACCESS_WRITE | TEE_DATA_FLAG_OVERWRITE, TEE_HANDLE_NULL,
                                             data.data(), static_cast<uint32_t>(data.size()), &obj),
                  TEE_SUCCESS);
        TEE_CloseObject(obj);
    }
};

TEST_F(Soter, ExportSignedByTheAttkCarriesCounterUidAndThePem) {
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(true, 1000));
    const std::string pem = json_escaped(public_pem(kRsa1024Pem));
    for (uint64_t counter : {1, 2}) {
        Bytes out;
        ASSERT_TRUE(soter_export(blob, &out).ok()) << dump_log();
        Split s = split(out);
        EXPECT_EQ(text_of(s.json),
                  "{\"counter\":" + std::to_string(counter) + ",\"uid\":1000,\"pub_key\":\"" + pem + "\"}");
        EXPECT_EQ(s.json.back(), '}') << "the export's document carries no NUL";
        EXPECT_EQ(s.signature.size(), 256u);
        EXPECT_TRUE(verify(kRsa2048Pem, s.json, s.signature)) << "the ATTK signs exactly the J bytes";
        Bytes with_nul = s.json;
        with_nul.push_back(0);
        EXPECT_FALSE(verify(kRsa2048Pem, with_nul, s.signature));
        EXPECT_FALSE(verify(kRsa1024Pem, s.json, s.signature));
    }
    // Eight little-endian bytes holding the last value handed out.
    EXPECT_EQ(counter_object(), (Bytes{2, 0, 0, 0, 0, 0, 0, 0}));
    EXPECT_TRUE(logged_message("No counter object, we need create one"));
    EXPECT_TRUE(logged_message("Create counter object success"));
}

TEST_F(Soter, ExportWithoutCounterOrUidHoldsOnlyThePublicKey) {
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(false, std::nullopt));
    Bytes out;
    ASSERT_TRUE(soter_export(blob, &out).ok()) << dump_log();
    Split s = split(out);
    EXPECT_EQ(text_of(s.json), "{\"pub_key\":\"" + json_escaped(public_pem(kRsa1024Pem)) + "\"}");
    EXPECT_TRUE(verify(kRsa2048Pem, s.json, s.signature));
    EXPECT_EQ(text_of(s.json).find('/'), text_of(s.json).find("\\/") + 1) << "every slash is escaped";
}

TEST_F(Soter, ExportSignedByAnApplicationKey) {
    ParamSet app_params;
    app_params.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY);
    Bytes app = soter_key(kRsa2048Pem, app_params);
    for (uint32_t tag : {KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB,
                         KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY}) {
        ParamSet p;
        p.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
        p.add(KM_TAG_SOTER_UID, 7);
        p.add_bytes(tag, app);
        Bytes auth = soter_key(kRsa1024Pem, p);
        Bytes out;
        tee_host::trace::clear();
        ASSERT_TRUE(soter_export(auth, &out).ok()) << dump_log();
        Split s = split(out);
        EXPECT_TRUE(verify(kRsa2048Pem, s.json, s.signature)) << "signed by the application key's private half";
        EXPECT_TRUE(logged_message(tag == KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB
                                       ? "use key blob argument to retrieve sign key"
                                       : "use key name argument as key blob to retrieve sign key"));
    }
    // Named to sign with a key blob but given none.
    ParamSet none;
    none.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
    Bytes orphan = soter_key(kRsa1024Pem, none);
    Bytes out;
    EXPECT_EQ(soter_export(orphan, &out).res, TEE_ERROR_ITEM_NOT_FOUND);
    EXPECT_TRUE(logged_message("no sign key with key blob"));
    // A blob that is no key of this TA.
    ParamSet forged;
    forged.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
    forged.add_bytes(KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB, Bytes(300, 0x5A));
    Bytes fake = soter_key(kRsa1024Pem, forged);
    EXPECT_EQ(soter_export(fake, &out).res, TEE_ERROR_BAD_STATE);
    EXPECT_TRUE(logged_message("Sign key is null"));
}

TEST_F(Soter, ExportRefusals) {
    // Neither signing tag: refused after the document was made, its counter value spent.
    ParamSet unsigned_params;
    unsigned_params.add_bool(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY);
    Bytes unsigned_key = soter_key(kRsa1024Pem, unsigned_params);
    Bytes out(8, 0xEE);
    EXPECT_EQ(soter_export(unsigned_key, &out).res, TEE_ERROR_BAD_PARAMETERS);
    EXPECT_EQ(counter_object(), (Bytes{1, 0, 0, 0, 0, 0, 0, 0}));

    // One byte short of J + S + 4: nothing written, the size needed reported.
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(true, std::nullopt));
    Bytes full;
    ASSERT_TRUE(soter_export(blob, &full).ok());
    const size_t needed = full.size();
    Params p;
    Bytes ref = key_reference(blob);
    Bytes shortbuf(needed - 1, 0xEE);
    p = Params::io(0, 0, &ref, &shortbuf);
    EXPECT_EQ(invoke(KM_CMD_EXPORT_KEY, p), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(p.p[2].memref.size, needed);
    EXPECT_EQ(shortbuf, Bytes(needed - 1, 0xEE));
    Bytes exact(needed, 0);
    p = Params::io(0, 0, &ref, &exact);
    EXPECT_EQ(invoke(KM_CMD_EXPORT_KEY, p), TEE_SUCCESS);
    EXPECT_EQ(p.p[2].memref.size, needed);
    EXPECT_EQ(text_of(split(exact).json).substr(0, 12), "{\"counter\":4") << "every attempt takes a value";

    // An application key too large for the export's signature room.
    ParamSet big;
    big.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
    big.add_bytes(KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB, soter_key(kRsa3072Pem));
    EXPECT_EQ(soter_export(soter_key(kRsa1024Pem, big), &out).res, TEE_ERROR_SHORT_BUFFER);
    EXPECT_TRUE(logged_message("sign data error 0xffff0010"));
}

TEST_F(Soter, CounterObjectOfTheWrongSizeFailsEveryRequest) {
    plant_counter_object(Bytes{1, 0, 0, 0});
    load();
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(true, std::nullopt));
    Bytes out;
    EXPECT_EQ(soter_export(blob, &out).res, TEE_ERROR_BAD_STATE);
    EXPECT_TRUE(logged_message("counter object is not 8 bytes, 4 bytes"));
    EXPECT_TRUE(logged_message("increase counter error ffff0007"));
    EXPECT_EQ(sign(blob, "challenge", &out).error, KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged_message("soter enhance error ffff0000"));
    EXPECT_EQ(counter_object(), (Bytes{1, 0, 0, 0})) << "never rewritten";
}

TEST_F(Soter, CounterSurvivesARestartOfTheTee) {
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(true, std::nullopt));
    Bytes out;
    ASSERT_TRUE(soter_export(blob, &out).ok());
    stop();
    start();
    ASSERT_TRUE(soter_export(blob, &out).ok());
    EXPECT_EQ(text_of(split(out).json).substr(0, 12), "{\"counter\":2");
}

TEST_F(Soter, SigningDocumentWithAndWithoutAFreshFid) {
    Bytes blob = soter_key(kRsa1024Pem);
    load();
    ASSERT_EQ(fp::notify(keymaster_ta_uuid, 77), TEE_SUCCESS) << dump_log();
    EXPECT_TRUE(logged_message("soter handle finger print ta notify success"));

    tee_host::clock::advance_system_ms(3000);
    Bytes out;
    ASSERT_TRUE(sign(blob, "challenge-1", &out).ok()) << dump_log();
    Split s = split(out);
    EXPECT_EQ(text_of(s.json), expected_sign_json("challenge-1", 77, 1, 0) + std::string(1, '\0'))
        << "the NUL is counted and sent";
    EXPECT_TRUE(verify(kRsa1024Pem, s.json, s.signature)) << "signed with its NUL";
    s.json.pop_back();
    EXPECT_FALSE(verify(kRsa1024Pem, s.json, s.signature));

    // Reading the fid does not consume it; one millisecond later it is stale.
    ASSERT_TRUE(sign(blob, "again", &out).ok());
    EXPECT_NE(text_of(split(out).json).find("\"fid\":77"), std::string::npos);
    tee_host::clock::advance_system_ms(1);
    ASSERT_TRUE(sign(blob, "late", &out, KM_PAD_RSA_PSS, 2).ok()) << dump_log();
    s = split(out);
    EXPECT_EQ(text_of(s.json), expected_sign_json("late", std::nullopt, 3, 0) + std::string(1, '\0'));
    EXPECT_TRUE(verify(kRsa1024Pem, s.json, s.signature, true));
    EXPECT_TRUE(logged_message("get finger id error ffff3001, continue without fid"));
}

TEST_F(Soter, SigningDocumentCarriesTheKeysUidAndEscapesTheMessage) {
    ParamSet p;
    p.add(KM_TAG_SOTER_UID, 4294967295u);
    Bytes blob = soter_key(kRsa1024Pem, p);
    Bytes out;
    // No fingerprint was ever reported: no "fid", even this soon after boot.
    ASSERT_LT(tee_host::clock::system_ms(), 3000u);
    ASSERT_TRUE(sign(blob, "a/b\"c\\d\n\xC3\xA9", &out).ok()) << dump_log();
    Split s = split(out);
    EXPECT_EQ(text_of(s.json),
              expected_sign_json("a\\/b\\\"c\\\\d\\n\xC3\xA9", std::nullopt, 1, 4294967295u) + std::string(1, '\0'));
    EXPECT_TRUE(verify(kRsa1024Pem, s.json, s.signature));
}

TEST_F(Soter, MessagesThatAreNotTextMakeNoDocumentAndSpendNoCounter) {
    Bytes blob = soter_key(kRsa1024Pem);
    Bytes out;
    const struct {
        std::string message;
        int text_length; // where a C string of it would end
    } cases[] = {{std::string("nul\0inside", 10), 3}, {"\xC0\xAF", 2}, {"\xED\xA0\x80", 3}, {"cut \xE2\x82", 6}};
    for (const auto &c : cases) {
        tee_host::trace::clear();
        EXPECT_EQ(sign(blob, c.message, &out).error, KM_ERROR_UNKNOWN_ERROR);
        EXPECT_TRUE(logged_message("Not a valid utf8 string, strlen(raw) " + std::to_string(c.text_length) +
                                   " length " + std::to_string(c.message.size())))
            << dump_log();
        EXPECT_TRUE(logged_message("produce json string error"));
        EXPECT_TRUE(logged_message("soter enhance error ffff0000"));
    }
    ASSERT_TRUE(sign(blob, "ok", &out).ok());
    EXPECT_NE(text_of(split(out).json).find("\"counter\":1,"), std::string::npos) << "no value was taken before";
}

TEST_F(Soter, RawMessageBufferGrowth) {
    Bytes blob = soter_key(kRsa1024Pem);
    ParamSet params;
    params.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
    params.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, params, &h).ok());
    tee_host::trace::set_level(TEE_TRACE_DEBUG);
    ASSERT_TRUE(update(h, Bytes(5000, 'a')).ok());
    EXPECT_TRUE(logged_message("expand soter buf 4096 -> 8192")) << dump_log();
    ASSERT_TRUE(update(h, Bytes(10000, 'b')).ok());
    EXPECT_TRUE(logged_message("expand soter buf 8192 -> 16384"));
    Bytes out;
    ASSERT_TRUE(finish(h, {}, {}, &out, 32768).ok()) << dump_log();
    Split s = split(out);
    EXPECT_EQ(text_of(s.json).substr(0, 9 + 15000),
              "{\"raw\":\"" + std::string(5000, 'a') + std::string(10000, 'b') + "\"");
    EXPECT_TRUE(verify(kRsa1024Pem, s.json, s.signature));

    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, params, &h).ok());
    ASSERT_TRUE(update(h, Bytes(20000, 'c')).ok());
    EXPECT_TRUE(logged_message("expand soter buf 4096 -> 20000"));
    EXPECT_TRUE(abort(h).ok());
}

TEST_F(Soter, SigningWithoutADigestIsRefusedAtBegin) {
    Bytes blob = soter_key(kRsa1024Pem);
    ParamSet params;
    params.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
    params.add(KM_TAG_DIGEST, KM_DIGEST_NONE);
    uint32_t h = 0;
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, params, &h).error, KM_ERROR_INCOMPATIBLE_DIGEST);
    EXPECT_TRUE(logged_message("soter signing needs a digest"));
}

TEST_F(Soter, NotificationChecksItsSenderAndItsBytes) {
    const Bytes good = fp::notification(0, 5, tee_host::clock::system_ms());
    // Before the property set is loaded nobody is the fingerprint TA.
    EXPECT_EQ(fp::send(keymaster_ta_uuid, good), TEE_ERROR_ACCESS_DENIED);
    EXPECT_TRUE(logged_message("soter deny finger print ta"));
    load();
    EXPECT_EQ(fp::send(keymaster_ta_uuid, good), TEE_SUCCESS);

    TEE_Identity user = tee_host::normal_world_identity();
    user.uuid = kFingerprintTa;
    EXPECT_EQ(fp::send_as(keymaster_ta_uuid, user, good), TEE_ERROR_ACCESS_DENIED) << "the right UUID, not a TA";
    EXPECT_EQ(fp::send_as(keymaster_ta_uuid, tee_host::ta_identity(trusted_client_uuids[0]), good),
              TEE_ERROR_ACCESS_DENIED)
        << "a TA, not the fingerprint TA";

    tee_host::trace::clear();
    EXPECT_EQ(fp::send(keymaster_ta_uuid, Bytes(good.begin(), good.end() - 1)), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged_message("finger print ta input argument error"));
    Bytes longer = good;
    longer.push_back(0);
    EXPECT_EQ(fp::send(keymaster_ta_uuid, longer), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_EQ(fp::send(keymaster_ta_uuid, fp::notification(1, 5, 0)), TEE_ERROR_BAD_FORMAT);
    EXPECT_TRUE(logged_message("finger print ta input argument version mismatch expected 0 actual 1"));

    // Refused notifications left the accepted one in place; a future stamp is stale.
    Bytes blob = soter_key(kRsa1024Pem);
    Bytes out;
    ASSERT_TRUE(sign(blob, "x", &out).ok());
    EXPECT_NE(text_of(split(out).json).find("\"fid\":5,"), std::string::npos);
    ASSERT_EQ(fp::send(keymaster_ta_uuid, fp::notification(0, 6, tee_host::clock::system_ms() + 1)), TEE_SUCCESS);
    ASSERT_TRUE(sign(blob, "y", &out).ok());
    EXPECT_EQ(text_of(split(out).json).find("\"fid\""), std::string::npos);
}

TEST_F(Soter, NotificationTypesAreChecked) {
    load();
    Params p;
    p.types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INPUT, TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_NONE,
                              TEE_PARAM_TYPE_NONE);
    EXPECT_EQ(invoke(KM_CMD_SOTER_SET_FID, p), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Bad argument type 0x51"));
}

TEST_F(Soter, AllocationFailureSweeps) {
    load();
    Bytes blob = soter_key(kRsa1024Pem, attk_signed(true, 3));
    Bytes out;
    ASSERT_TRUE(soter_export(blob, &out).ok());
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    const Outcome provider_oom{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED};
    const Outcome unparsed{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}; // a parameter set not parsed
    // Every failure point refuses, and nothing stays behind.
    int points = sweep_allocations("soter export", nullptr, [&] { return soter_export(blob, &out); },
                                   {oom,
                                    provider_oom,
                                    unparsed,
                                    {TEE_ERROR_BAD_FORMAT, 0},  // the exported key not resolved
                                    {TEE_ERROR_BAD_STATE, 0}}); // the ATTK object not made
    EXPECT_GT(points, 5);

    ParamSet params;
    params.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
    params.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    uint32_t h = 0;
    points = sweep_allocations(
        "soter begin", nullptr, [&] { return begin(KM_PURPOSE_SIGN, blob, params, &h); },
        {oom,
         provider_oom,
         unparsed,
         {TEE_ERROR_BAD_PARAMETERS, 0},          // begin parameters not parsed
         {TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR}}, // a TEE object or operation not made
        [&] { abort(h); });
    EXPECT_GT(points, 3);

    points = sweep_allocations(
        "soter update", [&] { ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, params, &h).ok()); },
        [&] { return update(h, Bytes(6000, 'u')); }, {oom, provider_oom, unparsed}, [&] { abort(h); });
    EXPECT_GT(points, 1);

    points = sweep_allocations(
        "soter finish",
        [&] {
            ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, params, &h).ok());
            ASSERT_TRUE(update(h, Bytes(100, 'f')).ok());
        },
        [&] { return finish(h, {}, {}, &out); }, {oom, provider_oom, unparsed, {TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR}},
        [&] { abort(h); });
    EXPECT_GT(points, 3);

    // A notification that cannot check its sender is refused.
    const Bytes note = fp::notification(0, 9, tee_host::clock::system_ms());
    points = sweep_allocations("notification", nullptr,
                               [&] {
                                   return Outcome{fp::send(keymaster_ta_uuid, note), 0};
                               },
                               {oom});
    EXPECT_GT(points, 0);
}

} // namespace
