/*
 * soter_key.cpp - the provisioning-TA client, the ATTK and SOTER property
 * set loaded from it, and the SOTER key conversions.
 */
#include "soter_key.h"

#include "base64.h"
#include "key_store.h"
#include "rsa.h"
#include "ta_heap.h"
#include "ta_log.h"
#include "tee_guard.h"

// The provisioning TA of this deployment.
const TEE_UUID soter_provisioning_ta_uuid = {
    0x5d0c3b2a, 0x8e47, 0x4f19, {0xb6, 0x3d, 0x21, 0x7e, 0x94, 0xc0, 0x5a, 0x01}};

namespace {

constexpr uint32_t kKeyAnswerSize = 8192;
constexpr uint32_t kPropAnswerSize = 512;
constexpr uint32_t kPropTextSize = 64;
constexpr uint32_t kAttkBits = 2048;
constexpr uint32_t kFpUuidSize = 16;

// The provisioning TA's commands.
constexpr uint32_t kOrvelCmdGetKey = 2;
constexpr uint32_t kOrvelCmdGetData = 5;
constexpr uint32_t kOrvelCmdGetProperty = 12;

void vlb_free(vlb *field, bool secret) {
    if (secret)
        ta_free_wiped(field->buf, field->len);
    else
        ta_free(field->buf);
    field->buf = nullptr;
    field->len = 0;
}

// One request: its own session, one command, the session closed whatever
// the outcome. A failed open is logged here, in the requesting function's
// name; *invoked tells the caller that the command itself ran.
TEE_Result orvel_request(uint32_t cmd, uint32_t types, TEE_Param params[4], bool *invoked,
                         const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    TEE_TASessionHandle session = nullptr;
    TEE_Param none[4] = {};
    *invoked = false;
    TEE_Result res = TEE_OpenTASession(&soter_provisioning_ta_uuid, TEE_TIMEOUT_INFINITE, 0, none, &session, nullptr);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Open orvel session fails, 0x%x\n", res);
        return res;
    }
    *invoked = true;
    res = TEE_InvokeTACommand(session, TEE_TIMEOUT_INFINITE, cmd, types, params, nullptr);
    TEE_CloseTASession(session);
    return res;
}

// Commands 2 and 5: the answer into buf, its length in value a.
TEE_Result orvel_buffer_request(uint32_t cmd, uint8_t *buf, uint32_t size, uint32_t *used_length, bool *invoked,
                                const char *func) {
    *invoked = false;
    if (!buf) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Buf is null\n");
        return TEE_ERROR_SHORT_BUFFER;
    }
    if (!used_length) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "used_length pointer is null\n");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    TEE_Param params[4] = {};
    params[0].memref.buffer = buf;
    params[0].memref.size = size;
    params[1].value.a = 0;
    uint32_t types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_VALUE_OUTPUT, TEE_PARAM_TYPE_NONE,
                                     TEE_PARAM_TYPE_NONE);
    TEE_Result res = orvel_request(cmd, types, params, invoked, func);
    if (res == TEE_SUCCESS)
        *used_length = params[1].value.a;
    return res;
}

// retrieve_soter_property - the SOTER property answer as a parsed box.
TEE_Result retrieve_soter_property(uint16_t id, tlv_box **box) {
    heap_buf buf;
    if (!buf.alloc(kPropAnswerSize)) {
        KM_ERR("No memory for buf");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    uint32_t len = kPropAnswerSize;
    TEE_Result res = retrieve_orvel_property(id, 0x0000, buf.get(), &len);
    if (res != TEE_SUCCESS)
        return res;
    if (len > kPropAnswerSize) {
        KM_ERR("parse property tlv box error");
        return TEE_ERROR_GENERIC;
    }
    *box = tlv_box_parse(buf.get(), len);
    if (!*box) {
        KM_ERR("parse property tlv box error");
        return TEE_ERROR_GENERIC;
    }
    return TEE_SUCCESS;
}

// A text property from the box: its bytes and a NUL behind them.
TEE_Result init_prop_with_tag(vlb *field, const tlv_box *box, uint16_t tag) {
    vlb_free(field, false);
    const uint8_t *value = nullptr;
    uint32_t len = 0;
    if (tlv_box_get_bytes_ptr(box, tag, &value, &len) != 0) {
        KM_ERR("tlv_box_get_bytes_ptr error for tag 0x%x\n", tag);
        return TEE_ERROR_GENERIC;
    }
    field->buf = static_cast<uint8_t *>(ta_malloc(len + 1));
    if (!field->buf) {
        KM_ERR("No memory for prop->buf, tag 0x%x length %u\n", tag, len);
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    if (len)
        TEE_MemMove(field->buf, value, len);
    field->len = len;
    return TEE_SUCCESS;
}

TEE_Result init_soter_cpuid(vlb *cpu_id) {
    vlb_free(cpu_id, false);
    // One byte beyond what is asked for keeps the text terminated.
    cpu_id->buf = static_cast<uint8_t *>(ta_malloc(kPropTextSize + 1));
    if (!cpu_id->buf) {
        KM_ERR("No memory for cpu_id");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    uint32_t len = kPropTextSize;
    constexpr uint16_t kCpuIdFirst = 0x1734; // the request (first, second) that answers the CPU id
    constexpr uint16_t kCpuIdSecond = 0x173A;
    TEE_Result res = retrieve_orvel_property(kCpuIdFirst, kCpuIdSecond, cpu_id->buf, &len);
    if (res == TEE_SUCCESS && len > kPropTextSize)
        res = TEE_ERROR_BAD_FORMAT;
    if (res != TEE_SUCCESS) {
        KM_ERR("retrieve soter cpu id error 0x%x\n", res);
        vlb_free(cpu_id, false);
        return res;
    }
    cpu_id->len = len;
    return TEE_SUCCESS;
}

// get_tee_property - a TEE implementation property as text in buf
// (capacity bytes, NUL included); *len is the text length without NUL.
TEE_Result get_tee_property(const char *name, uint8_t *buf, uint32_t capacity, uint32_t *len) {
    uint32_t size = capacity;
    TEE_Result res =
        TEE_GetPropertyAsString(TEE_PROPSET_TEE_IMPLEMENTATION, name, reinterpret_cast<char *>(buf), &size);
    if (res != TEE_SUCCESS) {
        KM_ERR("get client id property error, 0x%x\n", res);
        return res;
    }
    *len = size ? size - 1 : 0;
    return TEE_SUCCESS;
}

TEE_Result init_tee_text(vlb *field, const char *name, const char *no_memory) {
    vlb_free(field, false);
    field->buf = static_cast<uint8_t *>(ta_malloc(kPropTextSize));
    if (!field->buf) {
        KM_ERR("%s", no_memory);
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    uint32_t len = 0;
    TEE_Result res = get_tee_property(name, field->buf, kPropTextSize, &len);
    if (res != TEE_SUCCESS)
        return res;
    field->len = len;
    return TEE_SUCCESS;
}

} // namespace

namespace {

// One buffer request with its own success and failure lines.
TEE_Result orvel_retrieve(uint32_t cmd, const char *what, uint8_t *buf, uint32_t size, uint32_t *used_length,
                          const char *func) {
    bool invoked = false;
    TEE_Result res = orvel_buffer_request(cmd, buf, size, used_length, &invoked, func);
    if (res == TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_DEBUG, func, __LINE__, "Retrieve %s success\n", what);
    else if (invoked)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Retrieve %s fails, 0x%x\n", what, res);
    return res;
}

} // namespace

TEE_Result retrieve_key_from_orvel(uint8_t *buf, uint32_t size, uint32_t *used_length) {
    return orvel_retrieve(kOrvelCmdGetKey, "key", buf, size, used_length, __func__);
}

TEE_Result retrieve_data_from_orvel(uint8_t *buf, uint32_t size, uint32_t *used_length) {
    return orvel_retrieve(kOrvelCmdGetData, "TA data", buf, size, used_length, __func__);
}

TEE_Result retrieve_property_from_orvel(const uint8_t *request, uint8_t *output, uint32_t *output_length) {
    if (!request || !output) {
        KM_ERR("request %p output %p\n", static_cast<const void *>(request), static_cast<void *>(output));
        return TEE_ERROR_BAD_PARAMETERS;
    }
    if (!output_length) {
        KM_ERR("output_length pointer is null\n");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    TEE_Param params[4] = {};
    params[0].memref.buffer = const_cast<uint8_t *>(request);
    params[0].memref.size = 4;
    params[1].memref.buffer = output;
    params[1].memref.size = *output_length;
    uint32_t types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE,
                                     TEE_PARAM_TYPE_NONE);
    bool invoked = false;
    TEE_Result res = orvel_request(kOrvelCmdGetProperty, types, params, &invoked);
    if (res == TEE_SUCCESS) {
        KM_DEBUG("Retrieve TA property success\n");
        *output_length = params[1].memref.size;
    } else if (invoked) {
        KM_ERR("Retrieve TA property fails, 0x%x\n", res);
    }
    return res;
}

TEE_Result retrieve_orvel_property(uint16_t first, uint16_t second, uint8_t *output, uint32_t *output_length) {
    const uint8_t request[4] = {static_cast<uint8_t>(first), static_cast<uint8_t>(first >> 8),
                                static_cast<uint8_t>(second), static_cast<uint8_t>(second >> 8)};
    return retrieve_property_from_orvel(request, output, output_length);
}

TEE_Result init_vlb_with_tag(vlb *field, const tlv_box *box, uint16_t tag) {
    const uint8_t *value = nullptr;
    uint32_t length = 0;
    if (tlv_box_get_bytes_ptr(box, tag, &value, &length) != 0) {
        KM_ERR("Get length error for %x\n", tag);
        return TEE_ERROR_BAD_PARAMETERS;
    }
    field->buf = static_cast<uint8_t *>(ta_malloc(length));
    if (!field->buf) {
        KM_ERR("Fail to allocate memory for %x\n", tag);
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    int32_t got = static_cast<int32_t>(length);
    int rc = tlv_box_get_bytes(box, tag, field->buf, &got);
    if (rc != 0 || got != static_cast<int32_t>(length)) {
        KM_ERR("Fail to init attribute for %x, rc=%x, length(%d) capacity(%d)\n", tag, static_cast<unsigned>(rc), got,
               static_cast<int32_t>(length));
        ta_free_wiped(field->buf, length);
        field->buf = nullptr;
        return TEE_ERROR_SHORT_BUFFER;
    }
    field->len = length;
    return TEE_SUCCESS;
}

TEE_Result parse_buf_fill_key(soter_key_pair *key, const uint8_t *buf, uint32_t length) {
    tlv_box *box = tlv_box_parse(buf, length);
    if (!box) {
        free_soter_key(key);
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    scope_exit destroy_box([&] { tlv_box_destroy(box); });
    struct field_tag {
        vlb *field;
        uint16_t tag;
    };
    // The key answer's TLV tags, field by field. n, e and d are required; a
    // key without p has no CRT values at all.
    const field_tag fields[] = {{&key->modulus, 17},   {&key->public_exponent, 18}, {&key->private_exponent, 19},
                                {&key->prime1, 20},    {&key->prime2, 21},          {&key->exponent1, 22},
                                {&key->exponent2, 23}, {&key->coefficient, 24}};
    constexpr uint32_t kFirstCrtField = 3;
    for (uint32_t i = 0; i < sizeof fields / sizeof fields[0]; ++i) {
        TEE_Result res = init_vlb_with_tag(fields[i].field, box, fields[i].tag);
        if (res == TEE_SUCCESS)
            continue;
        if (i == kFirstCrtField) {
            KM_DEBUG("This rsa key pair only have n, e, d\n");
            return TEE_SUCCESS;
        }
        free_soter_key(key);
        return res;
    }
    return TEE_SUCCESS;
}

TEE_Result init_soter_key(soter_key_pair *key) {
    heap_buf buf(true);
    if (!buf.alloc(kKeyAnswerSize)) {
        KM_ERR("No memory for serialization\n");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    uint32_t used = 0;
    TEE_Result res = retrieve_key_from_orvel(buf.get(), kKeyAnswerSize, &used);
    if (res == TEE_SUCCESS && used > kKeyAnswerSize)
        res = TEE_ERROR_BAD_FORMAT; // an answer longer than the buffer it was written into
    if (res == TEE_SUCCESS)
        res = parse_buf_fill_key(key, buf.get(), used);
    if (res == TEE_SUCCESS)
        KM_DEBUG("Init Soter key pair success\n");
    else
        KM_ERR("Init Soter key pair fail\n");
    return res;
}

TEE_Result init_soter_prop_set(soter_prop_set *props) {
    // The property answer's TLV tags, and the request that gets it.
    constexpr uint16_t kSensorNameTag = 0x1835;
    constexpr uint16_t kSensorVersionTag = 0x1836;
    constexpr uint16_t kFpTaUuidTag = 0x1837;
    constexpr uint16_t kOrvelPropSoter = 0x1834;
    tlv_box *box = nullptr;
    const uint8_t *uuid = nullptr;
    uint32_t uuid_len = 0;
    TEE_Result res = retrieve_soter_property(kOrvelPropSoter, &box);
    if (res != TEE_SUCCESS)
        goto fail;
    res = init_prop_with_tag(&props->fp_sensor_name, box, kSensorNameTag);
    if (res != TEE_SUCCESS)
        goto fail;
    res = init_prop_with_tag(&props->fp_sensor_version, box, kSensorVersionTag);
    if (res != TEE_SUCCESS)
        goto fail;
    if (tlv_box_get_bytes_ptr(box, kFpTaUuidTag, &uuid, &uuid_len) != 0) {
        KM_ERR("get fp uuid bytes ptr error");
        res = TEE_ERROR_GENERIC;
        goto fail;
    }
    if (uuid_len != kFpUuidSize) {
        KM_ERR("fp_uuid length unmatch expect %zu actual %d\n", static_cast<size_t>(kFpUuidSize),
               static_cast<int>(uuid_len));
        res = TEE_ERROR_GENERIC;
        goto fail;
    }
    TEE_MemMove(props->fp_ta_uuid, uuid, kFpUuidSize);
    res = init_soter_cpuid(&props->cpu_id);
    if (res != TEE_SUCCESS) {
        KM_ERR("init soter cpuid error 0x%x\n", res);
        goto fail;
    }
    res = init_tee_text(&props->tee_name, "gpd.tee.trustedos.manufacturer", "No memory for tee_name");
    if (res != TEE_SUCCESS) {
        if (res != TEE_ERROR_OUT_OF_MEMORY)
            KM_ERR("get_tee_property os manufacturer error 0x%x\n", res);
        goto fail;
    }
    res = init_tee_text(&props->tee_version, "gpd.tee.trustedos.implementation.version", "No memory for tee_version");
    if (res != TEE_SUCCESS)
        goto fail;
    KM_DEBUG("Init soter data success\n");
    tlv_box_destroy(box);
    return TEE_SUCCESS;
fail:
    KM_ERR("Init soter data fails, 0x%x\n", res);
    tlv_box_destroy(box);
    free_soter_prop_set(props);
    return res;
}

void free_soter_key(soter_key_pair *key) {
    if (!key)
        return;
    vlb *fields[] = {&key->modulus, &key->private_exponent, &key->public_exponent, &key->prime1,
                     &key->prime2,  &key->exponent1,        &key->exponent2,       &key->coefficient};
    for (vlb *f : fields)
        vlb_free(f, true);
}

void free_soter_prop_set(soter_prop_set *props) {
    if (!props)
        return;
    vlb_free(&props->fp_sensor_name, false);
    vlb_free(&props->fp_sensor_version, false);
    TEE_MemFill(props->fp_ta_uuid, 0, sizeof props->fp_ta_uuid);
    vlb_free(&props->cpu_id, false);
    vlb_free(&props->tee_name, false);
    vlb_free(&props->tee_version, false);
}

TEE_ObjectHandle convert_key_to_object(const soter_key_pair *key, uint32_t *key_size) {
    *key_size = kAttkBits;
    struct attr_source {
        uint32_t id;
        const vlb *value;
    };
    const attr_source sources[] = {
        {TEE_ATTR_RSA_MODULUS, &key->modulus},
        {TEE_ATTR_RSA_PUBLIC_EXPONENT, &key->public_exponent},
        {TEE_ATTR_RSA_PRIVATE_EXPONENT, &key->private_exponent},
        {TEE_ATTR_RSA_PRIME1, &key->prime1},
        {TEE_ATTR_RSA_PRIME2, &key->prime2},
        {TEE_ATTR_RSA_EXPONENT1, &key->exponent1},
        {TEE_ATTR_RSA_EXPONENT2, &key->exponent2},
        {TEE_ATTR_RSA_COEFFICIENT, &key->coefficient},
    };
    TEE_Attribute attrs[8] = {};
    uint32_t count = key->prime1.len != 0 ? 8 : 3;
    for (uint32_t i = 0; i < count; ++i)
        TEE_InitRefAttribute(&attrs[i], sources[i].id, sources[i].value->buf, sources[i].value->len);
    TEE_ObjectHandle obj = nullptr;
    key_object(TEE_TYPE_RSA_KEYPAIR, kAttkBits, attrs, count, &obj, key_fill::populate, tee_call_texts::prefixed);
    return obj;
}

TEE_ObjectHandle resolve_key_from_data(const uint8_t *key_data, uint32_t key_data_len, uint32_t *key_size) {
    TEE_ObjectHandle obj = nullptr;
    int32_t error = 0;
    TEE_Result res = rsa_resolve_key_data(key_data, key_data_len, &obj, key_size, &error);
    if (res != TEE_SUCCESS || error != 0 || !obj) {
        free_object(&obj);
        KM_ERR("Resolve key data failed");
        return nullptr;
    }
    return obj;
}

TEE_ObjectHandle retrieve_key_from_pobj(const uint8_t *blob, uint32_t blob_len, uint32_t *key_size) {
    uint8_t *key_data = nullptr;
    uint32_t key_data_len = 0;
    keymaster_key_param_set_t params{};
    int32_t error = 0;
    TEE_Result res = open_key(blob, blob_len, &key_data, &key_data_len, &params, &error);
    scope_exit release([&] {
        ta_free_wiped(key_data, key_data_len);
        key_param_set_release(&params);
    });
    if (res != TEE_SUCCESS || error != 0) {
        KM_ERR("Open key failed");
        return nullptr;
    }
    return resolve_key_from_data(key_data, key_data_len, key_size);
}

TEE_Result export_rsa_public_key(TEE_ObjectHandle key, uint32_t key_size, uint8_t *dest, uint32_t capacity,
                                 uint32_t *out_len) {
    operation_guard op;
    TEE_Result res =
        keyed_operation(op.out(), TEE_ALG_RSA_NOPAD, TEE_MODE_EXPORT, key_size, key, tee_call_texts::prefixed);
    if (res != TEE_SUCCESS)
        return res;
    *out_len = capacity;
    res = TEE_AsymmetricExport(op.get(), TEE_EXPORT_RSA_PUBLIC_KEY_DER, dest, out_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AsymmetricExport failed: %08x\n", res);
        return res;
    }
    return public_key_to_pem(dest, *out_len, dest, capacity, out_len);
}
