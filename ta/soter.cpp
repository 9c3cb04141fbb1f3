/*
 * soter.cpp - the SOTER state and the SOTER commands that act on it. The
 * state is shared by every session and loaded on first use; the TEE
 * delivers one call at a time, so it needs no lock.
 */
#include "soter.h"

#include <cstring>

#include "base64.h"
#include "json_writer.h"
#include "ta_heap.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

// Zero-initialised aggregates: no constructors run at load.
uint32_t ready_flag = 0;
soter_key_pair attk = {};
soter_prop_set props = {};

// The last fingerprint the fingerprint TA reported. Until it reports one
// there is none: the empty record is never fresh, even in the first
// seconds after boot, so no document claims a fingerprint that never matched.
uint32_t fid_value = 0;
uint64_t fid_timestamp = 0;
bool fid_reported = false;
// The notification's size, and how long a reported fid stays fresh.
constexpr uint32_t kFidNotificationBytes = 16;
constexpr uint64_t kFidFreshMs = 3000;

constexpr int32_t kVerifyNoKey = -1;
constexpr int32_t kVerifyFailed = -2;
constexpr int32_t kExportNotReady = -1;
constexpr uint32_t kVerifyAttempts = 3;

} // namespace

bool soter_is_ready() {
    return ready_flag == 1;
}
const soter_key_pair *soter_attk() {
    return &attk;
}
const soter_prop_set *soter_props() {
    return &props;
}

TEE_Result soter_init() {
    TEE_Result res = init_soter_key(&attk);
    if (res == TEE_SUCCESS)
        res = init_soter_prop_set(&props);
    if (res != TEE_SUCCESS) {
        free_soter_key(&attk);
        free_soter_prop_set(&props);
        return res;
    }
    ready_flag = 1;
    return TEE_SUCCESS;
}

TEE_Result soter_check_ready() {
    if (ready_flag == 1)
        return TEE_SUCCESS;
    return soter_init();
}

void soter_deinit() {
    ready_flag = 0;
    free_soter_key(&attk);
    free_soter_prop_set(&props);
}

TEE_Result soter_handle_generate_attk_key_pair(uint32_t, int32_t *result) {
    KM_INFO("this function should not be called in anytime but in meta mode\n");
    if (soter_check_ready() != TEE_SUCCESS) {
        KM_ERR("attk_key_pair is not produced\n");
        *result = KM_ERROR_UNKNOWN_ERROR;
        return TEE_SUCCESS;
    }
    *result = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_verify_attk_key_pair(int32_t *result) {
    soter_key_pair local = {};
    TEE_Result res = TEE_ERROR_OUT_OF_MEMORY;
    for (uint32_t attempt = 0; attempt < kVerifyAttempts && res == TEE_ERROR_OUT_OF_MEMORY; ++attempt)
        res = init_soter_key(&local);
    free_soter_key(&local);
    if (res == TEE_SUCCESS)
        *result = KM_ERROR_OK;
    else if (res == TEE_ERROR_ITEM_NOT_FOUND)
        *result = kVerifyNoKey;
    else
        *result = kVerifyFailed;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_export_attk_public_key(uint8_t *buf, uint32_t *size, int32_t *result) {
    // A NULL reference reaches handlers as an empty one: no room is no buffer.
    if (!buf || *size == 0) {
        KM_ERR("No buffer for the ATTK public key");
        *result = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    if (soter_check_ready() != TEE_SUCCESS) {
        KM_ERR("soter is not ready\n");
        *result = kExportNotReady;
        return TEE_SUCCESS;
    }
    uint32_t key_size = 0;
    uint32_t len = 0;
    object_guard key;
    *key.out() = convert_key_to_object(&attk, &key_size);
    TEE_Result res = key.get() ? export_rsa_public_key(key.get(), key_size, buf, *size, &len) : TEE_ERROR_BAD_FORMAT;
    if (res != TEE_SUCCESS) {
        KM_ERR("export attk public key error 0x%x\n", res);
        *result = KM_ERROR_UNKNOWN_ERROR;
        return TEE_SUCCESS;
    }
    *size = len;
    *result = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_get_device_id(uint8_t *buf, uint32_t *size, int32_t *result) {
    TEE_Result res = retrieve_orvel_property(kOrvelPropDeviceIdFirst, kOrvelPropDeviceIdSecond, buf, size);
    if (res == TEE_SUCCESS) {
        *result = KM_ERROR_OK;
    } else if (res == TEE_ERROR_SHORT_BUFFER) {
        KM_ERR("device id buffer too small\n");
        *result = KM_ERROR_INSUFFICIENT_BUFFER_SPACE;
    } else {
        KM_ERR("retrieve_device_id_from_orvel fail, 0x%x\n", res);
        *result = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

/* ---- the counter ---------------------------------------------------------- */

namespace {

// The identifier counts its terminating NUL.
constexpr char kCounterId[] = "SOTER_COUNTER_OBJECT";
constexpr uint32_t kCounterFlags = TEE_DATA_FLAG_ACCESS_READ | TEE_DATA_FLAG_ACCESS_WRITE;
constexpr uint32_t kCounterBytes = 8;

TEE_Result open_counter(TEE_ObjectHandle *obj) {
    return TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, kCounterId, sizeof kCounterId, kCounterFlags, obj);
}

// The counter object, created holding 0 when there is none yet. Another
// caller may create it first; then it is opened once more.
TEE_Result open_or_create_counter(TEE_ObjectHandle *obj) {
    TEE_Result res = open_counter(obj);
    if (res != TEE_ERROR_ITEM_NOT_FOUND)
        return res;
    KM_INFO("No counter object, we need create one\n");
    const uint8_t zero[kCounterBytes] = {};
    res = TEE_CreatePersistentObject(TEE_STORAGE_PRIVATE, kCounterId, sizeof kCounterId, kCounterFlags, TEE_HANDLE_NULL,
                                     zero, sizeof zero, obj);
    if (res != TEE_SUCCESS) {
        KM_ERR("retry to open counter object");
        return open_counter(obj);
    }
    KM_INFO("Create counter object success\n");
    return TEE_SUCCESS;
}

} // namespace

TEE_Result increase_and_get_counter(uint64_t *counter) {
    *counter = 0;
    persistent_guard obj;
    TEE_Result res = open_or_create_counter(obj.out());
    if (res != TEE_SUCCESS)
        return res;
    uint8_t bytes[kCounterBytes] = {};
    uint32_t count = 0;
    res = TEE_ReadObjectData(obj.get(), bytes, sizeof bytes, &count);
    if (res != TEE_SUCCESS)
        return res;
    if (count != kCounterBytes) {
        KM_ERR("counter object is not %d bytes, %d bytes\n", static_cast<int>(kCounterBytes), static_cast<int>(count));
        return TEE_ERROR_BAD_STATE;
    }
    // The TEE's native order: little-endian.
    const uint64_t value = get_u64le(bytes) + 1;
    put_u64le(bytes, value);
    res = TEE_SeekObjectData(obj.get(), 0, TEE_DATA_SEEK_SET);
    if (res != TEE_SUCCESS) {
        KM_ERR("seek pos to the beginning error\n");
        return res;
    }
    res = TEE_WriteObjectData(obj.get(), bytes, sizeof bytes);
    if (res != TEE_SUCCESS) {
        KM_ERR("write object error\n");
        return res;
    }
    *counter = value;
    return TEE_SUCCESS;
}

/* ---- the fingerprint notification ----------------------------------------- */

TEE_Result get_client_property(TEE_Identity *identity) {
    KM_INFO("Try to get client property\n");
    TEE_MemFill(identity, 0, sizeof *identity);
    TEE_Result res = TEE_GetPropertyAsIdentity(TEE_PROPSET_CURRENT_CLIENT, "gpd.client.identity", identity);
    if (res != TEE_SUCCESS)
        KM_ERR("get client property error, 0x%x\n", res);
    return res;
}

TEE_Result is_from_fp_ta() {
    auto *identity = static_cast<TEE_Identity *>(ta_malloc(sizeof(TEE_Identity)));
    if (!identity)
        return TEE_ERROR_OUT_OF_MEMORY;
    TEE_Result res = get_client_property(identity);
    // Until the property set is loaded its UUID is all zero: nobody matches.
    if (res == TEE_SUCCESS && (identity->login != TEE_LOGIN_TRUSTED_APP ||
                               TEE_MemCompare(&identity->uuid, props.fp_ta_uuid, sizeof props.fp_ta_uuid) != 0))
        res = TEE_ERROR_ACCESS_DENIED;
    ta_free(identity);
    return res;
}

void soter_fid_reset() {
    fid_value = 0;
    fid_timestamp = 0;
    fid_reported = false;
}

TEE_Result soter_handle_setFid(const uint8_t *buf, uint32_t size) {
    KM_INFO("soter handle finger print ta notify");
    TEE_Result res = is_from_fp_ta();
    if (res != TEE_SUCCESS) {
        KM_ERR("soter deny finger print ta");
        return res;
    }
    byte_reader in(buf, size);
    uint32_t version = 0;
    uint32_t fid = 0;
    uint64_t timestamp = 0;
    if (size != kFidNotificationBytes || !in.read_u32(&version) || !in.read_u32(&fid) || !in.read_u64(&timestamp)) {
        KM_ERR("finger print ta input argument error");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    if (version != 0) {
        KM_ERR("finger print ta input argument version mismatch expected %u actual %u\n", 0u, version);
        return TEE_ERROR_BAD_FORMAT;
    }
    fid_value = fid;
    fid_timestamp = timestamp;
    fid_reported = true;
    KM_INFO("soter handle finger print ta notify success");
    return TEE_SUCCESS;
}

TEE_Result get_fresh_fid(uint32_t *fid) {
    TEE_Time now{};
    TEE_GetSystemTime(&now);
    const uint64_t now_ms = uint64_t{now.seconds} * 1000 + now.millis;
    // Wrap-around on purpose: a timestamp in the future is stale.
    if (fid_reported && now_ms - fid_timestamp <= kFidFreshMs) {
        *fid = fid_value;
        return TEE_SUCCESS;
    }
    *fid = 0xFFFFFFFF;
    return kSoterErrorStaleFid;
}

/* ---- signing with SHA-256 ------------------------------------------------ */

TEE_Result do_digest_with_sha(uint32_t algorithm, const uint8_t *message, uint32_t message_len, uint8_t *digest,
                              uint32_t *digest_len) {
    operation_guard op;
    TEE_Result res =
        keyed_operation(op.out(), algorithm, TEE_MODE_DIGEST, 0, TEE_HANDLE_NULL, tee_call_texts::prefixed);
    if (res != TEE_SUCCESS)
        return res;
    TEE_DigestUpdate(op.get(), message, message_len);
    return tee_logged(TEE_DigestDoFinal(op.get(), nullptr, 0, digest, digest_len), "DigestDoFinal",
                      tee_call_texts::prefixed);
}

TEE_Result do_sign_with_rsa(TEE_ObjectHandle key, uint32_t key_size, const uint8_t *digest, uint32_t digest_len,
                            uint8_t *signature, uint32_t *signature_len) {
    operation_guard op;
    TEE_Result res = keyed_operation(op.out(), TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, TEE_MODE_SIGN, key_size, key,
                                     tee_call_texts::prefixed);
    if (res != TEE_SUCCESS)
        return res;
    return tee_logged(TEE_AsymmetricSignDigest(op.get(), nullptr, 0, digest, digest_len, signature, signature_len),
                      "AsymmetricSignDigest", tee_call_texts::prefixed);
}

TEE_Result digest_and_sign(TEE_ObjectHandle key, uint32_t key_size, const uint8_t *message, uint32_t message_len,
                           uint8_t *signature, uint32_t *signature_len) {
    constexpr uint32_t kSoterDigestRoom = 256; // any TEE digest fits
    heap_buf digest;
    if (!digest.alloc(kSoterDigestRoom))
        return TEE_ERROR_OUT_OF_MEMORY;
    uint32_t digest_len = kSoterDigestRoom;
    TEE_Result res = do_digest_with_sha(TEE_ALG_SHA256, message, message_len, digest.get(), &digest_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("digest message error 0x%x\n", res);
        return res;
    }
    res = do_sign_with_rsa(key, key_size, digest.get(), digest_len, signature, signature_len);
    if (res != TEE_SUCCESS)
        KM_ERR("sign degist error 0x%x\n", res);
    return res;
}

/* ---- the export document ------------------------------------------------- */

namespace {

struct json_doc_guard {
    json_doc *doc = nullptr;
    ~json_doc_guard() { json_doc_free(doc); }
};
struct json_text_guard {
    char *text = nullptr;
    ~json_text_guard() { json_doc_free_text(text); }
};

// The key that signs an export document, as the exported key's tags choose it.
TEE_Result export_signing_key(const keymaster_key_param_set_t *key_params, TEE_ObjectHandle *key, uint32_t *key_size) {
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY)) {
        KM_INFO("soter use attkey sign\n");
        TEE_Result res = soter_check_ready();
        if (res != TEE_SUCCESS) {
            KM_ERR("soter is not ready\n");
            return res;
        }
        *key = convert_key_to_object(&attk, key_size);
        return TEE_SUCCESS;
    }
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY)) {
        KM_INFO("soter use normal key sign\n");
        const key_param_t *blob =
            key_param_set_find_unique(key_params, KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB);
        if (blob) {
            KM_INFO("use key blob argument to retrieve sign key\n");
        } else {
            blob = key_param_set_find_unique(key_params, KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY);
            if (blob)
                KM_INFO("use key name argument as key blob to retrieve sign key\n");
        }
        if (!blob) {
            KM_ERR("no sign key with key blob\n");
            return TEE_ERROR_ITEM_NOT_FOUND;
        }
        *key = retrieve_key_from_pobj(blob->blob.data, blob->blob.data_length, key_size);
        return TEE_SUCCESS;
    }
    return TEE_ERROR_BAD_PARAMETERS;
}

} // namespace

TEE_Result pack_export_output(const char *json, uint32_t json_len, const uint8_t *signature, uint32_t signature_len,
                              uint8_t *out, uint32_t *out_len) {
    const uint64_t needed = uint64_t{json_len} + signature_len + 4;
    if (needed > *out_len) {
        *out_len = needed > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(needed);
        return TEE_ERROR_SHORT_BUFFER;
    }
    byte_writer w(out, *out_len);
    if (!w.write_u32(json_len) || !w.write_bytes(reinterpret_cast<const uint8_t *>(json), json_len) ||
        !w.write_bytes(signature, signature_len))
        return TEE_ERROR_SHORT_BUFFER;
    *out_len = static_cast<uint32_t>(needed);
    return TEE_SUCCESS;
}

TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *key_params, const uint8_t *key_data,
                                    uint32_t key_data_len, uint8_t *out, uint32_t *out_len) {
    json_doc_guard doc{json_doc_create()};
    if (!doc.doc) {
        KM_ERR("json error root_value %p root_object %p\n", static_cast<void *>(doc.doc), static_cast<void *>(doc.doc));
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY)) {
        KM_INFO("This key need increase the counter");
        uint64_t counter = 0;
        TEE_Result res = increase_and_get_counter(&counter);
        if (res != TEE_SUCCESS) {
            KM_ERR("increase counter error %x\n", res);
            return res;
        }
        int rc = json_doc_set_number(doc.doc, "counter", static_cast<double>(counter));
        if (rc != 0) {
            KM_ERR("set counter error %d\n", rc);
            return TEE_ERROR_BAD_STATE;
        }
    }
    const key_param_t *uid = key_param_set_find_unique(key_params, KM_TAG_SOTER_UID);
    if (uid) {
        KM_INFO("soter key has uid\n");
        int rc = json_doc_set_number(doc.doc, "uid", static_cast<double>(uid->integer));
        if (rc != 0) {
            KM_ERR("set number error %x\n", rc);
            return TEE_ERROR_BAD_STATE;
        }
    }
    constexpr uint32_t kSoterPemRoom = 1024; // an RSA-2048 public key in PEM
    heap_buf pem;
    if (!pem.alloc(kSoterPemRoom))
        return TEE_ERROR_OUT_OF_MEMORY;
    uint32_t exported_size = 0;
    object_guard exported;
    *exported.out() = resolve_key_from_data(key_data, key_data_len, &exported_size);
    if (!exported.get()) {
        KM_ERR("resolve key from data stream error\n");
        return TEE_ERROR_BAD_FORMAT;
    }
    uint32_t pem_len = 0;
    TEE_Result res = export_rsa_public_key(exported.get(), exported_size, pem.get(), pem.len(), &pem_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("export public key error\n");
        return res;
    }
    int rc = json_doc_set_string(doc.doc, "pub_key", reinterpret_cast<const char *>(pem.get()));
    if (rc != 0) {
        KM_ERR("set publickey error %d\n", rc);
        return TEE_ERROR_BAD_STATE;
    }
    json_text_guard text{json_doc_render(doc.doc)};
    if (!text.text) {
        KM_ERR("json serialization error\n");
        return TEE_ERROR_BAD_STATE;
    }
    const uint32_t json_len = static_cast<uint32_t>(strlen(text.text));

    uint32_t signer_size = 0;
    object_guard signer;
    res = export_signing_key(key_params, signer.out(), &signer_size);
    if (res != TEE_SUCCESS)
        return res;
    if (!signer.get()) {
        KM_ERR("Sign key is null\n");
        return TEE_ERROR_BAD_STATE;
    }
    uint8_t signature[256] = {}; // RSA-2048, the largest signer
    uint32_t signature_len = sizeof signature;
    res = digest_and_sign(signer.get(), signer_size, reinterpret_cast<const uint8_t *>(text.text), json_len, signature,
                          &signature_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("sign data error 0x%x\n", res);
        return res;
    }
    return pack_export_output(text.text, json_len, signature, signature_len, out, out_len);
}

/* ---- the signing document ------------------------------------------------ */

namespace {

const char *prop_text(const vlb &field) {
    return reinterpret_cast<const char *>(field.buf);
}

// Sets the members after "raw" in their order; false, logged, at the first that fails.
bool set_sign_members(json_doc *doc, uint64_t uid) {
    uint32_t fid = 0;
    TEE_Result res = get_fresh_fid(&fid);
    if (res == TEE_SUCCESS) {
        int rc = json_doc_set_number(doc, "fid", static_cast<double>(fid));
        if (rc != 0) {
            KM_ERR("set finger id error %d\n", rc);
            return false;
        }
    } else {
        KM_INFO("get finger id error %x, continue without fid\n", res);
    }
    uint64_t counter = 0;
    res = increase_and_get_counter(&counter);
    if (res != TEE_SUCCESS) {
        KM_ERR("increase counter error %x\n", res);
        return false;
    }
// Each member's failure has its own text, so the format stays a literal.
#define SOTER_SET_MEMBER(call, failure)                                                                                \
    do {                                                                                                               \
        const int rc = (call);                                                                                         \
        if (rc != 0) {                                                                                                 \
            KM_ERR(failure, rc);                                                                                       \
            return false;                                                                                              \
        }                                                                                                              \
    } while (false)
    SOTER_SET_MEMBER(json_doc_set_number(doc, "counter", static_cast<double>(counter)), "set counter error %d\n");
    SOTER_SET_MEMBER(json_doc_set_number(doc, "uid", static_cast<double>(uid)), "set uid error %d\n");
    // Every property text is NUL-terminated by the loader.
    SOTER_SET_MEMBER(json_doc_set_string(doc, "tee_n", prop_text(props.tee_name)), "set tee name error %d\n");
    SOTER_SET_MEMBER(json_doc_set_string(doc, "tee_v", prop_text(props.tee_version)), "set tee version error %d\n");
    SOTER_SET_MEMBER(json_doc_set_string(doc, "fp_n", prop_text(props.fp_sensor_name)),
                     "set fp sensor name error %d\n");
    SOTER_SET_MEMBER(json_doc_set_string(doc, "fp_v", prop_text(props.fp_sensor_version)),
                     "set fp sensor version error %d\n");
    SOTER_SET_MEMBER(json_doc_set_string(doc, "cpu_id", prop_text(props.cpu_id)), "set cpu id error %d\n");
#undef SOTER_SET_MEMBER
    return true;
}

} // namespace

char *produce_soter_sign_json(uint64_t uid, const uint8_t *message, uint32_t message_len) {
    json_doc_guard doc{json_doc_create()};
    if (soter_check_ready() != TEE_SUCCESS) {
        KM_ERR("soter is not ready\n");
        return nullptr;
    }
    if (!doc.doc) {
        KM_ERR("json error root_value %p root_object %p\n", static_cast<void *>(doc.doc), static_cast<void *>(doc.doc));
        return nullptr;
    }
    uint32_t text_len = 0; // up to the first NUL byte (no strnlen in a TEE's C library)
    while (text_len < message_len && message[text_len] != 0)
        ++text_len;
    if (!utf8_is_valid(message, message_len) || text_len != message_len) {
        KM_ERR("Not a valid utf8 string, strlen(raw) %d length %d", static_cast<int>(text_len),
               static_cast<int>(message_len));
        return nullptr;
    }
    // The collected message has no terminator of its own.
    heap_buf raw(true);
    if (message_len == UINT32_MAX || !raw.alloc(message_len + 1)) {
        KM_ERR("set raw message error %d\n", -1);
        return nullptr;
    }
    TEE_MemMove(raw.get(), message, message_len);
    int rc = json_doc_set_string(doc.doc, "raw", reinterpret_cast<const char *>(raw.get()));
    if (rc != 0) {
        KM_ERR("set raw message error %d\n", rc);
        return nullptr;
    }
    if (!set_sign_members(doc.doc, uid))
        return nullptr;
    char *text = json_doc_render(doc.doc);
    if (!text) {
        KM_ERR("json serialization error\n");
        return nullptr;
    }
    KM_DEBUG("%s success", __func__);
    return text;
}

TEE_Result soter_do_sign_finish(rsa_sign_operation_t *op, const uint8_t *message, uint32_t message_len,
                                uint8_t **signature, uint32_t *signature_len) {
    *signature = nullptr;
    *signature_len = 0;
    const uint32_t key_bytes = op->key_size / 8;
    // Creation refuses a SOTER operation without a digest.
    op->block_len = key_bytes;
    TEE_Result res = TEE_DigestDoFinal(op->digest_operation, message, message_len, op->block, &op->block_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("DigestDoFinal failed with 0x%08x\n", res);
        return res;
    }
    heap_buf out;
    if (!out.alloc(key_bytes)) {
        KM_ERR("Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    TEE_Attribute salt{};
    const uint32_t attr_count = rsa_salt_attribute(op->padding, TEE_RSA_PSS_SALT_MAX_OR_AUTO, &salt);
    uint32_t len = key_bytes;
    res = TEE_AsymmetricSignDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->block, op->block_len,
                                   out.get(), &len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AsymmetricSignDigest failed with 0x%08x\n", res);
        return res;
    }
    *signature_len = len;
    *signature = out.release();
    return TEE_SUCCESS;
}

TEE_Result soter_enhance_sign_finish(rsa_sign_operation_t *op, const uint8_t *message, uint32_t message_len,
                                     uint8_t **output, uint32_t *output_len) {
    *output = nullptr;
    *output_len = 0;
    uint64_t uid = 0;
    const key_param_t *uid_param = key_param_set_find_unique(&op->header.key_params, KM_TAG_SOTER_UID);
    if (uid_param) {
        uid = uid_param->integer;
        KM_INFO("soter key has uid\n");
    }
    json_text_guard text{produce_soter_sign_json(uid, message, message_len)};
    if (!text.text) {
        KM_ERR("produce json string error");
        return TEE_ERROR_GENERIC;
    }
    // The signed document counts its NUL.
    const uint32_t json_len = static_cast<uint32_t>(strlen(text.text)) + 1;
    heap_buf signature;
    uint8_t *sig = nullptr;
    uint32_t sig_len = 0;
    TEE_Result res = soter_do_sign_finish(op, reinterpret_cast<const uint8_t *>(text.text), json_len, &sig, &sig_len);
    signature.adopt(sig, sig_len);
    if (res != TEE_SUCCESS)
        return res;
    const uint64_t total = uint64_t{json_len} + sig_len + 4;
    heap_buf out;
    if (total > UINT32_MAX || !out.alloc(static_cast<uint32_t>(total))) {
        KM_ERR("Out of memory for output");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    byte_writer w(out.get(), out.len());
    if (!w.write_u32(json_len) || !w.write_bytes(reinterpret_cast<const uint8_t *>(text.text), json_len) ||
        !w.write_bytes(signature.get(), signature.len()))
        return TEE_ERROR_GENERIC;
    *output_len = out.len();
    *output = out.release();
    return TEE_SUCCESS;
}
