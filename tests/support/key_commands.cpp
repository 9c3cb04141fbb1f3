/*
 * key_commands.cpp - the key commands for tests.
 */
#include "key_commands.h"

#include <algorithm>
#include <cstring>

#include <openssl/evp.h>

#include "key_store.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "marshal.h"
#include "ta_heap.h"
#include "ta_entry.h"

const EVP_MD *md_for(uint32_t digest) {
    switch (digest) {
    case KM_DIGEST_MD5:
        return EVP_md5();
    case KM_DIGEST_SHA1:
        return EVP_sha1();
    case KM_DIGEST_SHA_2_224:
        return EVP_sha224();
    case KM_DIGEST_SHA_2_256:
        return EVP_sha256();
    case KM_DIGEST_SHA_2_384:
        return EVP_sha384();
    case KM_DIGEST_SHA_2_512:
        return EVP_sha512();
    default:
        return nullptr;
    }
}

Bytes rsa_material(const char *pem) {
    std::string why;
    auto m = km::rsa_import_material(std::span<const uint8_t>(reinterpret_cast<const uint8_t *>(pem), std::strlen(pem)),
                                     &why);
    EXPECT_TRUE(m.has_value()) << why;
    return m.value_or(Bytes{});
}

namespace {
Outcome outcome(TEE_Result res, const Params &p) {
    return {res, static_cast<int32_t>(p.p[0].value.a)};
}
} // namespace

Outcome KeyTest::generate(const km::ParamSet &params, Bytes *blob, size_t capacity) {
    Bytes in = params.serialize();
    blob->assign(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, blob);
    TEE_Result res = invoke(KM_CMD_GENERATE_KEY, p);
    blob->resize(p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::import(const km::ParamSet &params, const Bytes &material, Bytes *blob, Bytes *chars, size_t capacity) {
    Bytes in;
    km::put_lv(in, params.serialize());
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, &out);
    TEE_Result res = invoke(KM_CMD_IMPORT_KEY, p);
    Outcome o = outcome(res, p);
    blob->clear();
    if (chars)
        chars->clear();
    if (o.ok()) {
        EXPECT_GE(p.p[2].memref.size, 8u);
        uint32_t blob_len = km::get_u32(out.data());
        uint32_t chars_len = km::get_u32(out.data() + 4 + blob_len);
        EXPECT_EQ(p.p[2].memref.size, 8 + blob_len + chars_len);
        blob->assign(out.begin() + 4, out.begin() + 4 + blob_len);
        if (chars)
            chars->assign(out.begin() + 8 + blob_len, out.begin() + 8 + blob_len + chars_len);
    }
    return o;
}

Outcome KeyTest::character_size(const Bytes &reference, uint32_t *size) {
    Bytes in = reference;
    Params p = Params::io(0, 0, &in, nullptr);
    TEE_Result res = invoke(KM_CMD_GET_KEY_CHARACTER_SIZE, p);
    *size = p.p[0].value.b;
    return outcome(res, p);
}

Outcome KeyTest::reference_command(uint32_t cmd, const Bytes &reference, Bytes *out, size_t capacity) {
    Bytes in = reference;
    out->assign(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, out);
    TEE_Result res = invoke(cmd, p);
    out->resize(p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::delete_key(const Bytes &blob) {
    Bytes in = blob;
    Params p = Params::io(0, 0, &in, nullptr);
    return outcome(invoke(KM_CMD_DELETE_KEY, p), p);
}

Outcome KeyTest::delete_all() {
    Params p = Params::value();
    return outcome(invoke(KM_CMD_DELETE_ALL_KEY, p), p);
}

TEE_Result KeyTest::open_raw(uint32_t session, const Bytes &blob, Bytes *payload) {
    *payload = blob;
    Params p;
    p.types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_MEMREF_INOUT, 0, 0, 0);
    p.p[0].memref.buffer = payload->data();
    p.p[0].memref.size = static_cast<uint32_t>(payload->size());
    TEE_Result res = invoke_on(session, KM_CMD_OPEN_KEY, p);
    payload->resize(res == TEE_SUCCESS ? p.p[0].memref.size : 0);
    return res;
}

Outcome KeyTest::begin(uint32_t purpose, const Bytes &blob, const km::ParamSet &params, uint32_t *handle,
                       Bytes *out_params) {
    Bytes in;
    km::put_lv(in, blob);
    km::put_lv(in, params.serialize());
    Bytes out(1024, 0xEE);
    Params p = Params::io(purpose, 0, &in, &out);
    TEE_Result res = invoke(KM_CMD_BEGIN, p);
    *handle = p.p[0].value.b;
    if (out_params)
        out_params->assign(out.begin(), out.begin() + p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::update(uint32_t handle, const Bytes &data, const km::ParamSet &params, Bytes *output,
                        uint32_t *consumed) {
    Bytes in;
    km::put_lv(in, data);
    km::put_lv(in, params.serialize());
    Bytes out(data.size() + 64, 0xEE);
    Params p = Params::io(handle, 0, &in, &out);
    TEE_Result res = invoke(KM_CMD_UPDATE, p);
    if (consumed)
        *consumed = p.p[0].value.b;
    if (output)
        output->assign(out.begin(), out.begin() + p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::finish(uint32_t handle, const Bytes &signature, const km::ParamSet &params, Bytes *output,
                        size_t capacity) {
    Bytes in;
    km::put_lv(in, signature);
    km::put_lv(in, params.serialize());
    Bytes out(capacity, 0xEE);
    Params p = Params::io(handle, 0, &in, &out);
    TEE_Result res = invoke(KM_CMD_FINISH, p);
    Outcome o = outcome(res, p);
    if (output) {
        output->clear();
        if (o.ok()) {
            uint32_t n = km::get_u32(out.data());
            EXPECT_EQ(p.p[2].memref.size, 8 + n + km::get_u32(out.data() + 4 + n));
            output->assign(out.begin() + 4, out.begin() + 4 + n);
        }
    }
    return o;
}

Outcome KeyTest::abort(uint32_t handle) {
    Params p = Params::value(handle, 0);
    return outcome(invoke(KM_CMD_ABORT, p), p);
}

Outcome KeyTest::run(uint32_t purpose, const Bytes &blob, const km::ParamSet &begin_params, const Bytes &message,
                     size_t chunk, const Bytes &signature, Bytes *out) {
    uint32_t handle = 0;
    Outcome o = begin(purpose, blob, begin_params, &handle);
    if (!o.ok())
        return o;
    for (size_t off = 0; off < message.size(); off += chunk) {
        Bytes piece(message.begin() + static_cast<long>(off),
                    message.begin() + static_cast<long>(std::min(message.size(), off + chunk)));
        uint32_t consumed = 0;
        o = update(handle, piece, {}, nullptr, &consumed);
        if (!o.ok())
            return o;
        EXPECT_EQ(consumed, piece.size());
    }
    return finish(handle, signature, {}, out);
}

void KeyTest::restart_instance() {
    tee_->close_session(session_);
    session_ = open();
    baseline_live_ = tee_host::heap::stats().live_count;
}

Bytes KeyTest::mint_token(uint64_t challenge, uint64_t user_id, uint64_t authenticator_id, uint32_t auth_type,
                          uint64_t timestamp_ms, uint8_t version) {
    Bytes t =
        mint_auth_token(tee_->boot_seed(), {challenge, user_id, authenticator_id, auth_type, timestamp_ms, version});
    EXPECT_EQ(t.size(), 69u);
    return t;
}

operation_t *KeyTest::create_record(const Bytes &blob, uint32_t algorithm, uint32_t purpose,
                                    const km::ParamSet &params) {
    uint8_t *key_data = nullptr;
    uint32_t key_data_len = 0;
    keymaster_key_param_set_t key_params{};
    keymaster_key_param_set_t in_params{};
    keymaster_key_param_set_t out_params{};
    int32_t error = 0;
    if (open_key(blob.data(), static_cast<uint32_t>(blob.size()), &key_data, &key_data_len, &key_params, &error) !=
        TEE_SUCCESS) {
        ADD_FAILURE() << "the blob does not open, error " << error;
        return nullptr;
    }
    const Bytes ser = params.serialize();
    const purpose_ops_t *ops = find_purpose_ops(algorithm, purpose);
    operation_t *op = nullptr;
    if (ops && unmarshal(ser.data(), static_cast<uint32_t>(ser.size()), &in_params) == TEE_SUCCESS)
        op = ops->create_operation(key_data, key_data_len, &key_params, &in_params, &out_params, &error);
    if (op)
        op->key_params = key_params;
    else
        key_param_set_release(&key_params);
    EXPECT_NE(op, nullptr) << "create refused, error " << error << "\n" << dump_log();
    // Like begin, the record outlives the key data and the begin parameters.
    ta_free_wiped(key_data, key_data_len);
    key_param_set_release(&in_params);
    key_param_set_release(&out_params);
    return op;
}

km::ParamSet KeyTest::hmac_params(uint32_t key_bits, uint32_t digest, uint32_t min_mac) {
    km::ParamSet s;
    s.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
        .add(KM_TAG_KEY_SIZE, key_bits)
        .add(KM_TAG_DIGEST, digest)
        .add(KM_TAG_MIN_MAC_LENGTH, min_mac)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    return s;
}
