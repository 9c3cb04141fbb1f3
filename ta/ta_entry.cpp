/*
 * ta_entry.cpp - the five entry points, the trusted-client check, and the
 * command table with the checks made before any handler runs.
 */
#include "ta_entry.h"

#include "capability_query.h"
#include "key_management.h"
#include "key_store.h"
#include "auth_token.h"
#include "operation_pool.h"
#include "soter.h"
#include "keymaster_defs.h"
#include "ta_heap.h"
#include "ta_log.h"

const TEE_UUID keymaster_ta_uuid = {0x2b0b7c3e, 0x54a1, 0x4d6f, {0x9c, 0x2e, 0x1f, 0x6b, 0x3a, 0x8d, 0x70, 0x01}};

const TEE_UUID trusted_client_uuids[kTrustedClientCount] = {
    // The fingerprint TA.
    {0x7a3c5e11, 0x2f4b, 0x4c8d, {0xa1, 0x6e, 0x90, 0x3b, 0x5d, 0x27, 0xc4, 0x01}},
    // Two trusted key consumers.
    {0x7a3c5e11, 0x2f4b, 0x4c8d, {0xa1, 0x6e, 0x90, 0x3b, 0x5d, 0x27, 0xc4, 0x02}},
    {0x7a3c5e11, 0x2f4b, 0x4c8d, {0xa1, 0x6e, 0x90, 0x3b, 0x5d, 0x27, 0xc4, 0x03}},
};

namespace {

constexpr uint32_t kParamsNone = TEE_PARAM_TYPE_NONE;
constexpr uint32_t kValueInout = TEE_PARAM_TYPE_VALUE_INOUT;

// Which inputs of params[0].value the dispatcher requires to be zero.
enum zero_check : uint8_t { CHECK_NONE = 0, CHECK_A = 1, CHECK_B = 2, CHECK_AB = 3 };

using handler_fn = TEE_Result (*)(void *session_context, TEE_Param params[4]);

struct command_t {
    uint32_t id;
    const char *name;
    uint32_t types;
    uint8_t zero_checks;
    bool log_type_word; // the refusal names the type word received
    handler_fn handler;
};

int32_t *error_slot(TEE_Param params[4]) {
    return reinterpret_cast<int32_t *>(&params[0].value.a);
}

TEE_Result on_algo_cnt(void *, TEE_Param p[4]) {
    return get_support_algo_cnt(&p[0].value.a);
}
TEE_Result on_algo(void *, TEE_Param p[4]) {
    return get_support_algo(static_cast<uint8_t *>(p[2].memref.buffer), p[2].memref.size);
}

// Commands 3 to 8 take (algorithm = a, purpose = b); 9 to 12 take algorithm = a.
template <TEE_Result (*F)(uint32_t, uint32_t, int32_t *, uint32_t *)>
TEE_Result on_purpose_count(void *, TEE_Param p[4]) {
    uint32_t algorithm = p[0].value.a;
    uint32_t purpose = p[0].value.b;
    return F(algorithm, purpose, error_slot(p), &p[0].value.b);
}
template <TEE_Result (*F)(uint32_t, uint32_t, uint8_t *, uint32_t, int32_t *)>
TEE_Result on_purpose_list(void *, TEE_Param p[4]) {
    uint32_t algorithm = p[0].value.a;
    uint32_t purpose = p[0].value.b;
    return F(algorithm, purpose, static_cast<uint8_t *>(p[2].memref.buffer), p[2].memref.size, error_slot(p));
}
template <TEE_Result (*F)(uint32_t, int32_t *, uint32_t *)> TEE_Result on_format_count(void *, TEE_Param p[4]) {
    uint32_t algorithm = p[0].value.a;
    return F(algorithm, error_slot(p), &p[0].value.b);
}
template <TEE_Result (*F)(uint32_t, uint8_t *, uint32_t, int32_t *)> TEE_Result on_format_list(void *, TEE_Param p[4]) {
    uint32_t algorithm = p[0].value.a;
    return F(algorithm, static_cast<uint8_t *>(p[2].memref.buffer), p[2].memref.size, error_slot(p));
}

uint8_t *in_buf(TEE_Param p[4]) {
    return static_cast<uint8_t *>(p[1].memref.buffer);
}
uint8_t *out_buf(TEE_Param p[4]) {
    return static_cast<uint8_t *>(p[2].memref.buffer);
}

// Commands 13, 15, 19, 20: (request, response and its size, error).
template <TEE_Result (*F)(const uint8_t *, uint32_t, uint8_t *, uint32_t *, int32_t *)>
TEE_Result on_request_response(void *, TEE_Param p[4]) {
    return F(in_buf(p), p[1].memref.size, out_buf(p), &p[2].memref.size, error_slot(p));
}
TEE_Result on_character_size(void *, TEE_Param p[4]) {
    return get_key_character_size(in_buf(p), p[1].memref.size, error_slot(p), &p[0].value.b);
}
TEE_Result on_delete_key(void *, TEE_Param p[4]) {
    return delete_key(in_buf(p), p[1].memref.size, error_slot(p));
}
TEE_Result on_delete_all_key(void *, TEE_Param p[4]) {
    return delete_all_key(error_slot(p));
}
TEE_Result on_open_key(void *, TEE_Param p[4]) {
    return open_key_raw(static_cast<uint8_t *>(p[0].memref.buffer), &p[0].memref.size);
}

// Commands 16, 17: (a, request, response and its size, error, b).
TEE_Result on_begin(void *, TEE_Param p[4]) {
    return begin(p[0].value.a, in_buf(p), p[1].memref.size, out_buf(p), &p[2].memref.size, error_slot(p),
                 &p[0].value.b);
}
TEE_Result on_update(void *, TEE_Param p[4]) {
    return update(p[0].value.a, in_buf(p), p[1].memref.size, out_buf(p), &p[2].memref.size, error_slot(p),
                  &p[0].value.b);
}
TEE_Result on_finish(void *, TEE_Param p[4]) {
    return finish(p[0].value.a, in_buf(p), p[1].memref.size, out_buf(p), &p[2].memref.size, error_slot(p));
}
TEE_Result on_abort(void *, TEE_Param p[4]) {
    return abort_operation(p[0].value.a, error_slot(p));
}

// SOTER commands 0xFF00 to 0xFF03 report their own outcome in a.
TEE_Result on_soter_generate(void *, TEE_Param p[4]) {
    return soter_handle_generate_attk_key_pair(p[0].value.a, error_slot(p));
}
TEE_Result on_soter_verify(void *, TEE_Param p[4]) {
    return soter_handle_verify_attk_key_pair(error_slot(p));
}
TEE_Result on_soter_export(void *, TEE_Param p[4]) {
    return soter_handle_export_attk_public_key(out_buf(p), &p[2].memref.size, error_slot(p));
}
TEE_Result on_soter_device_id(void *, TEE_Param p[4]) {
    return soter_handle_get_device_id(out_buf(p), &p[2].memref.size, error_slot(p));
}
TEE_Result on_soter_set_fid(void *, TEE_Param p[4]) {
    return soter_handle_setFid(in_buf(p), p[1].memref.size);
}

constexpr uint32_t types(uint32_t t0, uint32_t t1, uint32_t t2) {
    return TEE_PARAM_TYPES(t0, t1, t2, kParamsNone);
}
constexpr uint32_t kTypesValue = types(kValueInout, kParamsNone, kParamsNone);                     // 0x0003
constexpr uint32_t kTypesValueOut = types(kValueInout, kParamsNone, TEE_PARAM_TYPE_MEMREF_OUTPUT); // 0x0603
constexpr uint32_t kTypesInOut =
    types(kValueInout, TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_MEMREF_OUTPUT);                // 0x0653
constexpr uint32_t kTypesIn = types(kValueInout, TEE_PARAM_TYPE_MEMREF_INPUT, kParamsNone);       // 0x0053
constexpr uint32_t kTypesMemInout = types(TEE_PARAM_TYPE_MEMREF_INOUT, kParamsNone, kParamsNone); // 0x0007
constexpr uint32_t kTypesValOutOut =
    types(TEE_PARAM_TYPE_VALUE_OUTPUT, kParamsNone, TEE_PARAM_TYPE_MEMREF_OUTPUT);              // 0x0602
constexpr uint32_t kTypesNotify = types(kParamsNone, TEE_PARAM_TYPE_MEMREF_INPUT, kParamsNone); // 0x0050

const command_t kCommands[] = {
    {KM_CMD_GET_SUPPORT_ALGO_CNT, "get_support_algo_cnt", kTypesValue, CHECK_AB, false, on_algo_cnt},
    {KM_CMD_GET_SUPPORT_ALGO, "get_support_algo", kTypesValueOut, CHECK_AB, false, on_algo},
    {KM_CMD_GET_SUPPORT_BLK_MODE_CNT, "get_support_blk_mode_cnt", kTypesValue, CHECK_NONE, false,
     on_purpose_count<get_support_blk_mode_cnt>},
    {KM_CMD_GET_SUPPORT_BLK_MODE, "get_support_blk_mode", kTypesValueOut, CHECK_NONE, false,
     on_purpose_list<get_support_blk_mode>},
    {KM_CMD_GET_SUPPORT_PADDING_MODE_CNT, "get_support_padding_mode_cnt", kTypesValue, CHECK_NONE, false,
     on_purpose_count<get_support_padding_mode_cnt>},
    {KM_CMD_GET_SUPPORT_PADDING_MODE, "get_support_padding_mode", kTypesValueOut, CHECK_NONE, false,
     on_purpose_list<get_support_padding_mode>},
    {KM_CMD_GET_SUPPORT_DIGEST_CNT, "get_support_digest_cnt", kTypesValue, CHECK_NONE, false,
     on_purpose_count<get_support_digest_cnt>},
    {KM_CMD_GET_SUPPORT_DIGEST, "get_support_digest", kTypesValueOut, CHECK_NONE, false,
     on_purpose_list<get_support_digest>},
    {KM_CMD_GET_SUPPORT_IMPORT_FORMAT_CNT, "get_support_import_format_cnt", kTypesValue, CHECK_B, false,
     on_format_count<get_support_import_format_cnt>},
    {KM_CMD_GET_SUPPORT_IMPORT_FORMAT, "get_support_import_format", kTypesValueOut, CHECK_B, false,
     on_format_list<get_support_import_format>},
    {KM_CMD_GET_SUPPORT_EXPORT_FORMAT_CNT, "get_support_export_format_cnt", kTypesValue, CHECK_B, false,
     on_format_count<get_support_export_format_cnt>},
    {KM_CMD_GET_SUPPORT_EXPORT_FORMAT, "get_support_export_format", kTypesValueOut, CHECK_B, false,
     on_format_list<get_support_export_format>},
    {KM_CMD_GENERATE_KEY, "generate_key", kTypesInOut, CHECK_AB, false, on_request_response<generate_key>},
    {KM_CMD_GET_KEY_CHARACTER_SIZE, "get_key_character_size", kTypesIn, CHECK_AB, false, on_character_size},
    {KM_CMD_GET_KEY_CHARACTER, "get_key_character", kTypesInOut, CHECK_AB, false,
     on_request_response<get_key_character>},
    {KM_CMD_BEGIN, "begin", kTypesInOut, CHECK_B, false, on_begin},
    {KM_CMD_UPDATE, "update", kTypesInOut, CHECK_B, false, on_update},
    {KM_CMD_FINISH, "finish", kTypesInOut, CHECK_B, false, on_finish},
    {KM_CMD_IMPORT_KEY, "import_key", kTypesInOut, CHECK_AB, false, on_request_response<import_key>},
    {KM_CMD_EXPORT_KEY, "export_key", kTypesInOut, CHECK_AB, false, on_request_response<export_key>},
    {KM_CMD_DELETE_KEY, "delete_key", kTypesIn, CHECK_AB, false, on_delete_key},
    {KM_CMD_DELETE_ALL_KEY, "delete_all_key", kTypesValue, CHECK_AB, false, on_delete_all_key},
    {KM_CMD_ABORT, "_abort", kTypesValue, CHECK_B, false, on_abort},
    {KM_CMD_OPEN_KEY, "open_key", kTypesMemInout, CHECK_NONE, true, on_open_key},
    {KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, "soter_handle_generate_attk_key_pair", kTypesValue, CHECK_B, false,
     on_soter_generate},
    {KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR, "soter_handle_verify_attk_key_pair", kTypesValue, CHECK_AB, false,
     on_soter_verify},
    {KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY, "soter_handle_export_attk_public_key", kTypesValOutOut, CHECK_AB, false,
     on_soter_export},
    {KM_CMD_SOTER_GET_DEVICE_ID, "soter_handle_get_device_id", kTypesValOutOut, CHECK_AB, false, on_soter_device_id},
    {KM_CMD_SOTER_SET_FID, "soter_handle_setFid", kTypesNotify, CHECK_NONE, true, on_soter_set_fid},
};

// What a NULL memory reference is given to read and write: nothing. Its
// capacity is 0, so no handler ever stores a byte here.
uint8_t no_room[1];

// The memory references of one call as the caller gave them.
struct memref_shield_t {
    void *buffer[4];
    uint32_t size[4];
    bool null_ref[4];
};

bool is_memref(uint32_t type) {
    return type == TEE_PARAM_TYPE_MEMREF_INPUT || type == TEE_PARAM_TYPE_MEMREF_OUTPUT ||
           type == TEE_PARAM_TYPE_MEMREF_INOUT;
}

// A NULL reference has no room, whatever size it claims (a size query): the
// handler sees an empty buffer it can neither read nor write.
void shield_memrefs(uint32_t types, TEE_Param params[4], memref_shield_t *s) {
    for (uint32_t i = 0; i < 4; ++i) {
        s->buffer[i] = nullptr;
        s->size[i] = 0;
        s->null_ref[i] = false;
        if (!is_memref(TEE_PARAM_TYPE_GET(types, i)))
            continue;
        s->buffer[i] = params[i].memref.buffer;
        s->size[i] = params[i].memref.size;
        if (!params[i].memref.buffer) {
            s->null_ref[i] = true;
            params[i].memref.buffer = no_room;
            params[i].memref.size = 0;
        }
    }
}

// Gives the caller back its references. An output size above the room the
// caller gave is only ever an answer with TEE_ERROR_SHORT_BUFFER; any other
// such size is withdrawn, so no caller is told to read past its buffer.
void restore_memrefs(uint32_t types, TEE_Param params[4], const memref_shield_t &s, TEE_Result res) {
    for (uint32_t i = 0; i < 4; ++i) {
        const uint32_t type = TEE_PARAM_TYPE_GET(types, i);
        if (!is_memref(type))
            continue;
        params[i].memref.buffer = s.buffer[i];
        if (type == TEE_PARAM_TYPE_MEMREF_INPUT) {
            params[i].memref.size = s.size[i];
            continue;
        }
        const uint32_t room = s.null_ref[i] ? 0 : s.size[i];
        if (params[i].memref.size > room && res != TEE_ERROR_SHORT_BUFFER) {
            KM_ERR("Output size %u above capacity %u withdrawn", static_cast<unsigned>(params[i].memref.size),
                   static_cast<unsigned>(room));
            params[i].memref.size = 0;
        }
    }
}

const command_t *find_command(uint32_t id) {
    for (const command_t &c : kCommands)
        if (c.id == id)
            return &c;
    return nullptr;
}

bool same_uuid(const TEE_UUID &a, const TEE_UUID &b) {
    return TEE_MemCompare(&a, &b, sizeof a) == 0;
}

const bool kSingleInstance = true;
const bool kMultiSession = true;
const bool kKeepAlive = false;
const uint32_t kDataSize = 0x80000;
const uint32_t kStackSize = 0x2000;

const ta_property_t kTaProperties[] = {
    {"gpd.ta.singleInstance", TA_PROP_BOOL, &kSingleInstance},
    {"gpd.ta.multiSession", TA_PROP_BOOL, &kMultiSession},
    {"gpd.ta.instanceKeepAlive", TA_PROP_BOOL, &kKeepAlive},
    {"gpd.ta.dataSize", TA_PROP_U32, &kDataSize},
    {"gpd.ta.stackSize", TA_PROP_U32, &kStackSize},
    {"gpd.ta.version", TA_PROP_STRING, "Undefined version"},
    {"gpd.ta.description", TA_PROP_STRING, "Undefined description"},
};

} // namespace

extern "C" {

TEE_Result TA_CreateEntryPoint(void) {
    soter_fid_reset();
    TEE_Result res = key_store_init();
    if (res != TEE_SUCCESS) {
        KM_ERR("Init key store failed");
        return res;
    }
    res = operation_pool_init();
    if (res != TEE_SUCCESS) {
        KM_ERR("Init operation pool failed");
        key_store_deinit();
        return res;
    }
    res = authorizaiton_init();
    if (res != TEE_SUCCESS) {
        KM_ERR("Init authorization failed");
        key_store_deinit();
        return res;
    }
    return TEE_SUCCESS;
}

void TA_DestroyEntryPoint(void) {
    // Operations belong to no session; they end with the instance.
    operation_pool_end_all();
    authorization_deinit();
    key_store_deinit();
    if (soter_is_ready())
        soter_deinit();
}

TEE_Result TA_OpenSessionEntryPoint(uint32_t, TEE_Param[4], void **sessionContext) {
    TEE_Identity identity{};
    *sessionContext = nullptr;
    TEE_Result res = TEE_GetPropertyAsIdentity(TEE_PROPSET_CURRENT_CLIENT, "gpd.client.identity", &identity);
    if (res != TEE_SUCCESS)
        return res;
    if (identity.login != TEE_LOGIN_TRUSTED_APP)
        return TEE_SUCCESS;
    for (const TEE_UUID &trusted : trusted_client_uuids) {
        if (!same_uuid(identity.uuid, trusted))
            continue;
        void *ctx = ta_malloc(sizeof(TEE_UUID));
        if (!ctx) {
            KM_ERR("Out of memory");
            return TEE_ERROR_OUT_OF_MEMORY;
        }
        TEE_MemMove(ctx, &identity.uuid, sizeof(TEE_UUID));
        *sessionContext = ctx;
        return TEE_SUCCESS;
    }
    return TEE_SUCCESS;
}

void TA_CloseSessionEntryPoint(void *sessionContext) {
    ta_free(sessionContext);
}

TEE_Result TA_InvokeCommandEntryPoint(void *sessionContext, uint32_t commandID, uint32_t paramTypes,
                                      TEE_Param params[4]) {
    KM_INFO("TA_InvokeCommandEntryPoint nCommandID 0x%x pSessionContext %p nParamTypes 0x%x\n", commandID,
            sessionContext, paramTypes);
    const command_t *cmd = find_command(commandID);
    if (!cmd) {
        KM_ERR("Unknown command %x\n", commandID);
        return TEE_ERROR_BAD_PARAMETERS;
    }
    KM_INFO("%s", cmd->name);
    if (cmd->id == KM_CMD_OPEN_KEY && !sessionContext) {
        KM_ERR("Access denied");
        return TEE_ERROR_SECURITY;
    }
    if (paramTypes != cmd->types) {
        if (cmd->log_type_word)
            KM_ERR("Bad argument type 0x%x\n", paramTypes);
        else
            KM_ERR("Bad argument type\n");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    if (((cmd->zero_checks & CHECK_A) && params[0].value.a != 0) ||
        ((cmd->zero_checks & CHECK_B) && params[0].value.b != 0)) {
        KM_ERR("Bad argument\n");
        return TEE_ERROR_BAD_PARAMETERS;
    }
    memref_shield_t shield{};
    shield_memrefs(paramTypes, params, &shield);
    TEE_Result res = cmd->handler(sessionContext, params);
    restore_memrefs(paramTypes, params, shield, res);
    return res;
}

} // extern "C"

const ta_header_t keymaster_ta_header = {
    keymaster_ta_uuid,
    kStackSize,
    0xF,
    TA_CreateEntryPoint,
    TA_DestroyEntryPoint,
    TA_OpenSessionEntryPoint,
    TA_CloseSessionEntryPoint,
    TA_InvokeCommandEntryPoint,
    kTaProperties,
    sizeof kTaProperties / sizeof kTaProperties[0],
};
