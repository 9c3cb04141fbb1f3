/*
 * key_commands.cpp - the key commands for tests.
 */
#include "key_commands.h"

#include "keymaster_defs.h"
#include "ta_entry.h"

Bytes key_reference(const Bytes &blob, const Bytes &app_id, const Bytes &app_data) {
    Bytes out;
    km::put_lv(out, blob);
    km::put_lv(out, app_id);
    km::put_lv(out, app_data);
    return out;
}

namespace {
Outcome outcome(TEE_Result res, const Params &p) { return {res, static_cast<int32_t>(p.p[0].value.a)}; }
} // namespace

Outcome KeyTest::generate(const km::ParamSet &params, Bytes *blob, size_t capacity) {
    Bytes in = params.serialize();
    blob->assign(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, blob);
    TEE_Result res = invoke(KM_CMD_GENERATE_KEY, p);
    blob->resize(p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::import(const km::ParamSet &params, const Bytes &material, Bytes *blob, Bytes *chars,
                        size_t capacity) {
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

Outcome KeyTest::characteristics(const Bytes &reference, Bytes *out, size_t capacity) {
    Bytes in = reference;
    out->assign(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, out);
    TEE_Result res = invoke(KM_CMD_GET_KEY_CHARACTER, p);
    out->resize(p.p[2].memref.size);
    return outcome(res, p);
}

Outcome KeyTest::export_key(const Bytes &reference, Bytes *out, size_t capacity) {
    Bytes in = reference;
    out->assign(capacity, 0xEE);
    Params p = Params::io(0, 0, &in, out);
    TEE_Result res = invoke(KM_CMD_EXPORT_KEY, p);
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
