/*
 * commands_fuzz.cpp - the TA's command interface as the normal world (and
 * a trusted TA) reaches it: every command number, type word, value and
 * memory reference (contents, capacities, NULL buffers), sequences of
 * begin/update/finish/abort on real keys of every algorithm, key blobs
 * that are real, changed, or sealed around changed payloads, auth tokens,
 * clocks, and allocation failures at any point.
 *
 * Every input starts from the same TA instance (FuzzTee::reset). Besides
 * the sanitizers, each command is checked for:
 * - the dispatcher: an unknown command, command 27 from a normal-world
 *   session, a wrong type word or a nonzero required value is refused
 *   with the parameters untouched;
 * - memory references: input buffers unchanged, no output size above the
 *   capacity except with TEE_ERROR_SHORT_BUFFER (buffers are exactly their
 *   capacity, so any access past it is an ASan report);
 * - the operation pool: handles are nonzero and distinct, at most 16 live,
 *   and a handle is unknown (-28) exactly once its operation has ended;
 * - nothing left behind: the instance ends each input with no heap block
 *   or TEE handle of its own.
 */
#include <algorithm>
#include <cstring>

#include "blob_seal.h"
#include "fuzz_support.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "rsa_keys.h"
#include "ta_entry.h"

namespace {

// --- The command table, as callers are told it ------------------------------------

enum Zero : uint8_t { kNone = 0, kA = 1, kB = 2, kAB = 3 };
struct Command {
    uint32_t id;
    uint32_t types;
    uint8_t zero;
};
constexpr Command kCommands[] = {
    {1, 0x0003, kAB},      {2, 0x0603, kAB},      {3, 0x0003, kNone},    {4, 0x0603, kNone},      {5, 0x0003, kNone},
    {6, 0x0603, kNone},    {7, 0x0003, kNone},    {8, 0x0603, kNone},    {9, 0x0003, kB},         {10, 0x0603, kB},
    {11, 0x0003, kB},      {12, 0x0603, kB},      {13, 0x0653, kAB},     {14, 0x0053, kAB},       {15, 0x0653, kAB},
    {16, 0x0653, kB},      {17, 0x0653, kB},      {18, 0x0653, kB},      {19, 0x0653, kAB},       {20, 0x0653, kAB},
    {21, 0x0053, kAB},     {22, 0x0003, kAB},     {23, 0x0003, kB},      {27, 0x0007, kNone},     {0xFF00, 0x0003, kB},
    {0xFF01, 0x0003, kAB}, {0xFF02, 0x0602, kAB}, {0xFF03, 0x0602, kAB}, {0xFF04, 0x0050, kNone},
};
constexpr size_t kCommandCount = sizeof kCommands / sizeof kCommands[0];

const Command *find_command(uint32_t id) {
    for (const Command &c : kCommands)
        if (c.id == id)
            return &c;
    return nullptr;
}

bool is_memref(uint32_t t) {
    return t == TEE_PARAM_TYPE_MEMREF_INPUT || t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT;
}
bool is_value(uint32_t t) {
    return t == TEE_PARAM_TYPE_VALUE_INPUT || t == TEE_PARAM_TYPE_VALUE_OUTPUT || t == TEE_PARAM_TYPE_VALUE_INOUT;
}

// --- Keys the harness made once ----------------------------------------------------

struct Key {
    Bytes blob;
    Bytes payload; // what the blob opens to
    Bytes app_id, app_data;
};
std::vector<Key> g_keys;
Bytes g_rsa_material;
Bytes g_ec_material;

constexpr uint64_t kSecureId = 42;

// --- One call with its own buffers -------------------------------------------------

// A memory reference of exactly its capacity: a distinct block even when
// empty, so that any access past it is an ASan report.
struct Memref {
    std::unique_ptr<uint8_t[]> buf;
    uint32_t size = 0;
    bool null = false;
    Bytes contents;
};

struct Call {
    uint32_t types = 0;
    TEE_Param p[4] = {};
    Memref m[4];

    void value(int i, uint32_t a, uint32_t b) {
        p[i].value.a = a;
        p[i].value.b = b;
    }
    // memref - slot i holds data in a buffer of capacity bytes (>= data), or is NULL with that size.
    void memref(int i, const Bytes &data, uint32_t capacity, bool null = false) {
        m[i].null = null;
        m[i].size = capacity;
        if (!null) {
            capacity = std::max<uint32_t>(capacity, static_cast<uint32_t>(data.size()));
            m[i].size = capacity;
            m[i].buf = std::make_unique<uint8_t[]>(capacity);
            if (!data.empty())
                std::memcpy(m[i].buf.get(), data.data(), data.size());
            m[i].contents.assign(m[i].buf.get(), m[i].buf.get() + capacity);
        }
        p[i].memref.buffer = null ? nullptr : m[i].buf.get();
        p[i].memref.size = m[i].size;
    }
    Bytes output(int i) const {
        if (m[i].null || !m[i].buf)
            return {};
        return Bytes(m[i].buf.get(), m[i].buf.get() + std::min(m[i].size, p[i].memref.size));
    }
};

// --- The harness state of one input ------------------------------------------------

struct Run {
    FuzzTee &tee;
    FuzzInput &in;
    std::vector<uint32_t> live;  // handles of operations in the pool
    std::vector<uint32_t> ended; // handles of operations that ended
    uint64_t fail_at = 0;        // allocation to fail in the next command

    bool is_live(uint32_t h) const { return std::find(live.begin(), live.end(), h) != live.end(); }
    void end(uint32_t h) {
        live.erase(std::remove(live.begin(), live.end(), h), live.end());
        ended.push_back(h);
    }

    uint32_t handle() {
        const uint8_t c = in.u8();
        if (c < 0xA0 && !live.empty())
            return live[c % live.size()];
        if (c < 0xD0 && !ended.empty())
            return ended[c % ended.size()];
        if (c < 0xF0)
            return c & 1;
        return in.u32();
    }

    Outcome invoke(uint32_t session, uint32_t cmd, Call &call);
    void check_dispatch_refusal(uint32_t cmd, const Call &call, const Call &before, TEE_Result res, bool trusted);
    void follow_pool(uint32_t cmd, uint32_t a_in, const Call &call, TEE_Result res);
};

// What a refused call must leave exactly as it was.
bool untouched(const Call &call, const Call &before) {
    if (std::memcmp(call.p, before.p, sizeof call.p) != 0)
        return false;
    for (int i = 0; i < 4; ++i)
        if (call.m[i].buf && call.m[i].size &&
            std::memcmp(call.m[i].buf.get(), call.m[i].contents.data(), call.m[i].size) != 0)
            return false;
    return true;
}

Outcome Run::invoke(uint32_t session, uint32_t cmd, Call &call) {
    Call before;
    before.types = call.types;
    std::memcpy(before.p, call.p, sizeof call.p);
    const uint32_t a_in = call.p[0].value.a;
    if (fail_at)
        tee_host::heap::fail_nth(fail_at);
    const TEE_Result res = tee.tee().invoke(session, cmd, call.types, call.p);
    tee_host::heap::fail_nth(0);
    fail_at = 0;

    const Command *c = find_command(cmd);
    const bool trusted = session == tee.trusted_session();
    bool refused = !c || (cmd == 27 && !trusted) || call.types != c->types;
    if (c && !refused)
        refused = ((c->zero & kA) && before.p[0].value.a != 0) || ((c->zero & kB) && before.p[0].value.b != 0);
    if (refused) {
        check_dispatch_refusal(cmd, call, before, res, trusted);
        return {res, 0};
    }
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = TEE_PARAM_TYPE_GET(call.types, i);
        if (!is_memref(t))
            continue;
        FUZZ_CHECK(call.p[i].memref.buffer == before.p[i].memref.buffer, "command 0x%x moved buffer %d", cmd, i);
        if (t == TEE_PARAM_TYPE_MEMREF_INPUT) {
            FUZZ_CHECK(call.p[i].memref.size == before.p[i].memref.size, "command 0x%x changed input size %d", cmd, i);
            FUZZ_CHECK(!call.m[i].buf || !call.m[i].size ||
                           std::memcmp(call.m[i].buf.get(), call.m[i].contents.data(), call.m[i].size) == 0,
                       "command 0x%x wrote into its input buffer %d", cmd, i);
            continue;
        }
        const uint32_t room = call.m[i].null ? 0 : call.m[i].size;
        FUZZ_CHECK(call.p[i].memref.size <= room || res == TEE_ERROR_SHORT_BUFFER,
                   "command 0x%x reports %u bytes in buffer %d of %u (0x%08x)", cmd, call.p[i].memref.size, i, room,
                   res);
    }
    const int32_t a_out = is_value(TEE_PARAM_TYPE_GET(call.types, 0)) ? static_cast<int32_t>(call.p[0].value.a) : 0;
    follow_pool(cmd, a_in, call, res);
    return {res, a_out};
}

void Run::check_dispatch_refusal(uint32_t cmd, const Call &call, const Call &before, TEE_Result res, bool trusted) {
    // Command 27 from a normal-world session is refused before its types are looked at.
    const TEE_Result want = cmd == KM_CMD_OPEN_KEY && !trusted ? TEE_ERROR_SECURITY : TEE_ERROR_BAD_PARAMETERS;
    FUZZ_CHECK(res == want, "command 0x%x refused with 0x%08x, not 0x%08x", cmd, res, want);
    FUZZ_CHECK(untouched(call, before), "command 0x%x was refused but changed its parameters", cmd);
}

void Run::follow_pool(uint32_t cmd, uint32_t a_in, const Call &call, TEE_Result res) {
    const int32_t a = static_cast<int32_t>(call.p[0].value.a);
    const bool ok = res == TEE_SUCCESS && a == KM_ERROR_OK;
    switch (cmd) {
    case KM_CMD_BEGIN: {
        const uint32_t h = call.p[0].value.b;
        if (ok) {
            FUZZ_CHECK(h != 0 && !is_live(h), "begin gave handle 0x%08x, live or zero", h);
            FUZZ_CHECK(live.size() < 16, "a 17th operation began");
            live.push_back(h);
        } else if (res == TEE_SUCCESS && a == KM_ERROR_TOO_MANY_OPERATIONS) {
            FUZZ_CHECK(live.size() == 16, "too many operations with %zu live", live.size());
        }
        break;
    }
    case KM_CMD_UPDATE:
    case KM_CMD_FINISH:
    case KM_CMD_ABORT:
        if (!is_live(a_in)) {
            FUZZ_CHECK(res == TEE_SUCCESS && a == KM_ERROR_INVALID_OPERATION_HANDLE,
                       "command %u on unknown handle 0x%08x gave 0x%08x, %d", cmd, a_in, res, a);
            break;
        }
        if (cmd == KM_CMD_ABORT)
            FUZZ_CHECK(ok, "abort of live handle 0x%08x gave 0x%08x, %d", a_in, res, a);
        FUZZ_CHECK(!(res == TEE_SUCCESS && a == KM_ERROR_INVALID_OPERATION_HANDLE),
                   "live handle 0x%08x reported unknown by command %u", a_in, cmd);
        if (cmd != KM_CMD_UPDATE || !ok)
            end(a_in);
        break;
    default:
        break;
    }
}

// --- Building requests -------------------------------------------------------------

// Interesting values for a tag's value.
uint64_t enum_value(FuzzInput &in) {
    static const uint32_t pool[] = {0,   1,   2,   3,   4,   5,   6,   7,    32,   64,    96,        104,
                                    128, 160, 192, 224, 256, 384, 521, 1024, 2048, 65537, 0xFFFFFFFF};
    const uint8_t c = in.u8();
    return c < 0xE0 ? pool[c % (sizeof pool / sizeof pool[0])] : in.u32();
}

constexpr uint32_t kTags[] = {
    KM_TAG_PURPOSE,
    KM_TAG_ALGORITHM,
    KM_TAG_KEY_SIZE,
    KM_TAG_BLOCK_MODE,
    KM_TAG_DIGEST,
    KM_TAG_PADDING,
    KM_TAG_CALLER_NONCE,
    KM_TAG_MIN_MAC_LENGTH,
    KM_TAG_RSA_PUBLIC_EXPONENT,
    KM_TAG_ACTIVE_DATETIME,
    KM_TAG_ORIGINATION_EXPIRE_DATETIME,
    KM_TAG_USAGE_EXPIRE_DATETIME,
    KM_TAG_MIN_SECONDS_BETWEEN_OPS,
    KM_TAG_MAX_USES_PER_BOOT,
    KM_TAG_USER_SECURE_ID,
    KM_TAG_NO_AUTH_REQUIRED,
    KM_TAG_USER_AUTH_TYPE,
    KM_TAG_AUTH_TIMEOUT,
    KM_TAG_APPLICATION_ID,
    KM_TAG_APPLICATION_DATA,
    KM_TAG_ORIGIN,
    KM_TAG_ROOT_OF_TRUST,
    KM_TAG_ASSOCIATED_DATA,
    KM_TAG_NONCE,
    KM_TAG_AUTH_TOKEN,
    KM_TAG_MAC_LENGTH,
    KM_TAG_SOTER_IS_FROM_SOTER,
    KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY,
    KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY,
    KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY,
    KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY,
    KM_TAG_SOTER_UID,
    KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB,
};
constexpr size_t kTagCount = sizeof kTags / sizeof kTags[0];

// The operation parameters callers commonly send.
constexpr uint32_t kOperationTags[] = {KM_TAG_DIGEST,     KM_TAG_PADDING,        KM_TAG_BLOCK_MODE,
                                       KM_TAG_MAC_LENGTH, KM_TAG_NONCE,          KM_TAG_ASSOCIATED_DATA,
                                       KM_TAG_AUTH_TOKEN, KM_TAG_APPLICATION_ID, KM_TAG_APPLICATION_DATA};

Bytes auth_token(Run &r) {
    AuthTokenFields f{};
    const uint8_t c = r.in.u8();
    f.challenge = (c & 3) == 0 ? 0 : (c & 3) == 1 && !r.live.empty() ? r.live[c % r.live.size()] : r.in.u32();
    f.user_id = (c & 4) ? kSecureId : r.in.u64();
    f.authenticator_id = (c & 8) ? kSecureId : 0;
    f.auth_type = (c & 16) ? 2 : r.in.u32();
    f.timestamp_ms = tee_host::clock::system_ms() - r.in.u16();
    f.version = (c & 0xE0) == 0xE0 ? 1 : 0;
    return mint_auth_token(r.tee.tee().boot_seed(), f);
}

Bytes byte_value(Run &r, uint32_t tag) {
    if (tag == KM_TAG_AUTH_TOKEN && r.in.u8() < 0xC0)
        return auth_token(r);
    if ((tag == KM_TAG_APPLICATION_ID || tag == KM_TAG_APPLICATION_DATA) && r.in.u8() < 0x80 && !g_keys.empty()) {
        const Key &k = g_keys[r.in.below(static_cast<uint32_t>(g_keys.size()))];
        return tag == KM_TAG_APPLICATION_ID ? k.app_id : k.app_data;
    }
    if (tag == KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB && r.in.u8() < 0x80 && !g_keys.empty())
        return g_keys[r.in.below(static_cast<uint32_t>(g_keys.size()))].blob;
    return r.in.lv(64);
}

// A serialized parameter set: none, the common operation parameters,
// any tags, or raw bytes.
Bytes param_bytes(Run &r) {
    const uint8_t mode = r.in.u8() % 8;
    if (mode == 0)
        return km::ParamSet().serialize();
    if (mode == 7)
        return r.in.lv(256);
    km::ParamSet set;
    const uint32_t n = r.in.below(7);
    for (uint32_t i = 0; i < n; ++i) {
        uint32_t tag = 0;
        if (mode < 4)
            tag = kOperationTags[r.in.below(sizeof kOperationTags / sizeof kOperationTags[0])];
        else if (mode < 6)
            tag = kTags[r.in.below(kTagCount)];
        else
            tag = r.in.u32();
        if (km::tag_is_bytes(tag))
            set.add_bytes(tag, byte_value(r, tag));
        else
            set.add(tag, (tag & 0xF0000000u) == 0x70000000u ? 1 : enum_value(r.in));
    }
    return set.serialize();
}

void mutate(FuzzInput &in, Bytes *b) {
    const uint32_t n = 1 + in.below(4);
    for (uint32_t i = 0; i < n; ++i) {
        const uint8_t kind = in.u8() % 5;
        if (kind == 0 && !b->empty())
            (*b)[in.u16() % b->size()] ^= static_cast<uint8_t>(1 + in.below(255));
        else if (kind == 1 && !b->empty())
            (*b)[in.u16() % b->size()] = in.u8();
        else if (kind == 2)
            b->resize(b->empty() ? 0 : in.u16() % b->size());
        else if (kind == 3) {
            const Bytes more = in.lv(32);
            b->insert(b->end(), more.begin(), more.end());
        } else if (b->size() >= 4) {
            // A length word set to something else.
            const size_t at = in.u16() % (b->size() - 3);
            const uint32_t v = in.u8() < 0x80 ? in.u16() : in.u32();
            for (int k = 0; k < 4; ++k)
                (*b)[at + k] = static_cast<uint8_t>(v >> (8 * k));
        }
    }
}

// A key blob: a real one, a real one changed, a real payload changed and
// sealed again, any payload sealed, or any bytes.
Bytes blob(Run &r) {
    const uint8_t kind = r.in.u8() % 6;
    const Key &k = g_keys[r.in.below(static_cast<uint32_t>(g_keys.size()))];
    switch (kind) {
    case 0:
    case 1:
        return k.blob;
    case 2: {
        Bytes b = k.blob;
        mutate(r.in, &b);
        return b;
    }
    case 3: {
        Bytes payload = k.payload;
        mutate(r.in, &payload);
        return seal_payload(payload).value_or(Bytes{});
    }
    case 4:
        return seal_payload(r.in.lv(600)).value_or(Bytes{});
    default:
        return r.in.lv(300);
    }
}

// An output capacity: NULL, empty, small, typical, or any.
void output(Run &r, Call &call, int slot) {
    const uint8_t c = r.in.u8();
    if (c < 0x10)
        call.memref(slot, {}, r.in.u16(), true);
    else if (c < 0x20)
        call.memref(slot, {}, 0);
    else if (c < 0x60)
        call.memref(slot, {}, r.in.u8());
    else if (c < 0xE0)
        call.memref(slot, {}, 4096);
    else
        call.memref(slot, {}, r.in.u16() % 9000);
}

// The usual shape: value in, request in, response out.
Call request(Run &r, uint32_t a, uint32_t b, const Bytes &in) {
    Call call;
    call.types = 0x0653;
    call.value(0, a, b);
    call.memref(1, in, static_cast<uint32_t>(in.size()), r.in.u8() == 0xFF);
    output(r, call, 2);
    return call;
}

Bytes lv_pair(const Bytes &x, const Bytes &y) {
    Bytes out;
    km::put_lv(out, x);
    km::put_lv(out, y);
    return out;
}

// --- The steps ---------------------------------------------------------------------

void raw_invoke(Run &r) {
    const uint32_t session = r.in.u8() < 0xC0 ? r.tee.session() : r.tee.trusted_session();
    const uint8_t pick = r.in.u8();
    uint32_t cmd = 0;
    if (pick < 0xE0)
        cmd = kCommands[pick % kCommandCount].id;
    else if (pick < 0xF0)
        cmd = 24 + pick % 3;
    else
        cmd = r.in.u32();
    const Command *c = find_command(cmd);
    Call call;
    call.types = c && r.in.u8() < 0xC0 ? c->types : (r.in.u8() < 0x80 ? r.in.u16() : r.in.u32());
    for (int i = 0; i < 4; ++i) {
        const uint32_t t = TEE_PARAM_TYPE_GET(call.types, i);
        if (is_value(t)) {
            const uint8_t v = r.in.u8();
            call.value(i, v < 0x80 ? 0 : v < 0xC0 ? r.handle() : r.in.u32(), v & 1 ? r.in.u32() : 0);
        } else if (is_memref(t)) {
            const uint8_t how = r.in.u8();
            Bytes data = how < 0x40 ? blob(r) : r.in.lv(512);
            if (how == 0xFF)
                call.memref(i, {}, r.in.u16(), true);
            else
                call.memref(i, t == TEE_PARAM_TYPE_MEMREF_OUTPUT ? Bytes{} : data,
                            static_cast<uint32_t>(data.size()) + (how & 1 ? r.in.u8() : 0));
        }
    }
    r.invoke(session, cmd, call);
}

void begin(Run &r) {
    const uint8_t p = r.in.u8();
    const uint32_t purpose = p < 0xF0 ? p % 4 : r.in.u32();
    const Bytes b = blob(r);
    const Bytes params = param_bytes(r);
    Call call = request(r, purpose, 0, lv_pair(b, params));
    r.invoke(r.tee.session(), KM_CMD_BEGIN, call);
}

void update_or_finish(Run &r, uint32_t cmd) {
    const uint32_t h = r.handle();
    const Bytes data = r.in.lv(cmd == KM_CMD_UPDATE ? 2048 : 300);
    const Bytes params = param_bytes(r);
    Bytes req = lv_pair(data, params);
    if (r.in.u8() == 0xFE)
        req.resize(req.size() / 2); // a field cut short
    Call call = request(r, h, 0, req);
    r.invoke(r.tee.session(), cmd, call);
}

void abort_op(Run &r) {
    Call call;
    call.types = 0x0003;
    call.value(0, r.handle(), 0);
    r.invoke(r.tee.session(), KM_CMD_ABORT, call);
}

void key_command(Run &r) {
    const uint8_t sub = r.in.u8() % 7;
    if (sub == 0) {
        Call call = request(r, 0, 0, param_bytes(r));
        r.invoke(r.tee.session(), KM_CMD_GENERATE_KEY, call);
    } else if (sub == 1) {
        Bytes req;
        km::put_lv(req, param_bytes(r));
        const uint8_t m = r.in.u8() % 4;
        Bytes material = m == 0 ? g_rsa_material : m == 1 ? g_ec_material : r.in.lv(300);
        if (m < 2 && r.in.flag())
            mutate(r.in, &material);
        req.insert(req.end(), material.begin(), material.end());
        Call call = request(r, 0, 0, req);
        r.invoke(r.tee.session(), KM_CMD_IMPORT_KEY, call);
    } else if (sub <= 4) {
        const Bytes b = blob(r);
        Bytes id = r.in.lv(16);
        Bytes data = r.in.lv(16);
        if (r.in.flag() && !g_keys.empty()) {
            const Key &k = g_keys[r.in.below(static_cast<uint32_t>(g_keys.size()))];
            id = k.app_id;
            data = k.app_data;
        }
        const Bytes ref = key_reference(b, id, data);
        if (sub == 4) {
            Call call;
            call.types = 0x0053;
            call.memref(1, ref, static_cast<uint32_t>(ref.size()));
            r.invoke(r.tee.session(), KM_CMD_GET_KEY_CHARACTER_SIZE, call);
        } else {
            Call call = request(r, 0, 0, ref);
            r.invoke(r.tee.session(), sub == 2 ? KM_CMD_EXPORT_KEY : KM_CMD_GET_KEY_CHARACTER, call);
        }
    } else if (sub == 5) {
        Call call;
        call.types = 0x0053;
        const Bytes b = blob(r);
        call.memref(1, b, static_cast<uint32_t>(b.size()), r.in.u8() == 0xFF);
        r.invoke(r.tee.session(), KM_CMD_DELETE_KEY, call);
    } else {
        Call call;
        call.types = 0x0003;
        r.invoke(r.tee.session(), KM_CMD_DELETE_ALL_KEY, call);
    }
}

void capability(Run &r) {
    const uint32_t cmd = 1 + r.in.below(12);
    Call call;
    const bool list = cmd % 2 == 0;
    call.types = list ? 0x0603 : 0x0003;
    static const uint32_t algorithms[] = {0, 1, 3, 32, 128, 2};
    const uint32_t a = cmd <= 2 ? 0 : algorithms[r.in.below(6)];
    const uint32_t b = cmd <= 2 || cmd >= 9 ? 0 : r.in.below(6);
    call.value(0, a, b);
    if (list)
        output(r, call, 2);
    r.invoke(r.tee.session(), cmd, call);
}

void soter(Run &r) {
    const uint8_t sub = r.in.u8() % 6;
    if (sub < 4) {
        Call call;
        const uint32_t cmd = 0xFF00 + sub;
        call.types = sub < 2 ? 0x0003 : 0x0602;
        call.value(0, sub == 0 ? r.in.u8() : 0, 0);
        if (sub >= 2)
            output(r, call, 2);
        r.invoke(r.tee.session(), cmd, call);
    } else if (sub == 4) {
        const Bytes note =
            r.in.flag() ? tee_host::fingerprint::notification(r.in.u8() % 2, r.in.u32(), tee_host::clock::system_ms())
                        : r.in.lv(32);
        (void)tee_host::fingerprint::send(keymaster_ta_uuid, note);
    } else {
        (void)tee_host::fingerprint::notify(keymaster_ta_uuid, r.in.u8());
    }
}

void open_raw(Run &r) {
    const Bytes b = blob(r);
    Call call;
    call.types = 0x0007;
    call.memref(0, b, static_cast<uint32_t>(b.size()), r.in.u8() == 0xFF);
    r.invoke(r.tee.trusted_session(), KM_CMD_OPEN_KEY, call);
}

// --- The keys ----------------------------------------------------------------------

Bytes generate_key(FuzzTee &tee, const km::ParamSet &params) {
    Bytes in = params.serialize();
    Bytes out(4096);
    Params p = Params::io(0, 0, &in, &out);
    const TEE_Result res = tee.invoke(tee.session(), KM_CMD_GENERATE_KEY, p);
    FUZZ_CHECK(res == TEE_SUCCESS && p.p[0].value.a == 0, "a harness key does not generate: 0x%08x, %d", res,
               static_cast<int>(p.p[0].value.a));
    out.resize(p.p[2].memref.size);
    return out;
}

Bytes import_key(FuzzTee &tee, const km::ParamSet &params, const Bytes &material) {
    Bytes in;
    km::put_lv(in, params.serialize());
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(4096);
    Params p = Params::io(0, 0, &in, &out);
    const TEE_Result res = tee.invoke(tee.session(), KM_CMD_IMPORT_KEY, p);
    FUZZ_CHECK(res == TEE_SUCCESS && p.p[0].value.a == 0, "a harness key does not import: 0x%08x, %d", res,
               static_cast<int>(p.p[0].value.a));
    const uint32_t len = km::get_u32(out.data());
    return Bytes(out.begin() + 4, out.begin() + 4 + len);
}

Bytes payload_of(FuzzTee &tee, const Bytes &blob) {
    Bytes buf = blob;
    Params p;
    p.types = 0x0007;
    p.p[0].memref.buffer = buf.data();
    p.p[0].memref.size = static_cast<uint32_t>(buf.size());
    FUZZ_CHECK(tee.invoke(tee.trusted_session(), KM_CMD_OPEN_KEY, p) == TEE_SUCCESS, "a harness blob does not open");
    buf.resize(p.p[0].memref.size);
    return buf;
}

void make_keys(FuzzTee &tee) {
    using km::ParamSet;
    std::string why;
    g_rsa_material = km::rsa_import_material(
                         std::span(reinterpret_cast<const uint8_t *>(kRsa1024Pem), std::strlen(kRsa1024Pem)), &why)
                         .value_or(Bytes{});
    FUZZ_CHECK(!g_rsa_material.empty(), "no RSA material: %s", why.c_str());

    auto add = [&](Bytes blob, Bytes app_id = {}, Bytes app_data = {}) {
        g_keys.push_back(Key{blob, payload_of(tee, blob), std::move(app_id), std::move(app_data)});
    };
    auto base = [](uint32_t algorithm) {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, algorithm);
        return p;
    };
    auto hmac = [&]() {
        ParamSet p = base(KM_ALGORITHM_HMAC);
        p.add(KM_TAG_KEY_SIZE, 256).add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_MIN_MAC_LENGTH, 128);
        p.add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN).add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
        return p;
    };
    add(generate_key(tee, ParamSet(hmac()).add_bool(KM_TAG_NO_AUTH_REQUIRED)));

    ParamSet aes = base(KM_ALGORITHM_AES);
    aes.add(KM_TAG_KEY_SIZE, 128).add_bool(KM_TAG_NO_AUTH_REQUIRED).add_bool(KM_TAG_CALLER_NONCE);
    aes.add(KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT).add(KM_TAG_PURPOSE, KM_PURPOSE_DECRYPT);
    for (uint32_t m : {KM_MODE_ECB, KM_MODE_CBC, KM_MODE_CTR, KM_MODE_GCM})
        aes.add(KM_TAG_BLOCK_MODE, m);
    aes.add(KM_TAG_PADDING, KM_PAD_NONE).add(KM_TAG_PADDING, KM_PAD_PKCS7).add(KM_TAG_MIN_MAC_LENGTH, 96);
    add(generate_key(tee, aes));

    ParamSet rsa = base(KM_ALGORITHM_RSA);
    rsa.add_bool(KM_TAG_NO_AUTH_REQUIRED);
    for (uint32_t p : {KM_PURPOSE_ENCRYPT, KM_PURPOSE_DECRYPT, KM_PURPOSE_SIGN, KM_PURPOSE_VERIFY})
        rsa.add(KM_TAG_PURPOSE, p);
    for (uint32_t p :
         {KM_PAD_NONE, KM_PAD_RSA_OAEP, KM_PAD_RSA_PSS, KM_PAD_RSA_PKCS1_1_5_ENCRYPT, KM_PAD_RSA_PKCS1_1_5_SIGN})
        rsa.add(KM_TAG_PADDING, p);
    for (uint32_t d = KM_DIGEST_NONE; d <= KM_DIGEST_SHA_2_512; ++d)
        rsa.add(KM_TAG_DIGEST, d);
    add(import_key(tee, rsa, g_rsa_material));

    for (uint32_t bits : {256u, 521u}) {
        ParamSet ec = base(KM_ALGORITHM_EC);
        ec.add(KM_TAG_KEY_SIZE, bits).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        ec.add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN).add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
        for (uint32_t d : {KM_DIGEST_NONE, KM_DIGEST_SHA_2_256, KM_DIGEST_SHA_2_512})
            ec.add(KM_TAG_DIGEST, d);
        add(generate_key(tee, ec));
    }
    // EC import material from the P-256 key's own export would need its
    // private value; any well-formed material does for import parsing.
    Bytes ec_material;
    km::put_u32(ec_material, 256);
    for (int i = 0; i < 3; ++i)
        km::put_lv(ec_material, Bytes(32, static_cast<uint8_t>(0x11 * (i + 1))));
    g_ec_material = ec_material;

    // User authentication: a token at every use, or one within 60 seconds.
    ParamSet per_op = hmac();
    per_op.add(KM_TAG_USER_SECURE_ID, kSecureId).add(KM_TAG_USER_AUTH_TYPE, 2);
    add(generate_key(tee, per_op));
    ParamSet timed = hmac();
    timed.add(KM_TAG_USER_SECURE_ID, kSecureId).add(KM_TAG_USER_AUTH_TYPE, 3).add(KM_TAG_AUTH_TIMEOUT, 60);
    add(generate_key(tee, timed));

    // Uses limited, rate-limited, dated and bound to an application.
    ParamSet limited = hmac();
    limited.add_bool(KM_TAG_NO_AUTH_REQUIRED).add(KM_TAG_MAX_USES_PER_BOOT, 3).add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 2);
    limited.add(KM_TAG_ACTIVE_DATETIME, 1500000000000ull).add(KM_TAG_USAGE_EXPIRE_DATETIME, 1700000000000ull);
    const Bytes app_id = {'a', 'p', 'p'};
    const Bytes app_data = {'d', 'a', 't', 'a'};
    limited.add_bytes(KM_TAG_APPLICATION_ID, app_id).add_bytes(KM_TAG_APPLICATION_DATA, app_data);
    add(generate_key(tee, limited), app_id, app_data);

    // A SOTER key whose export the ATTK signs, with counter and uid.
    ParamSet soter = base(KM_ALGORITHM_RSA);
    soter.add_bool(KM_TAG_NO_AUTH_REQUIRED).add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN).add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
    soter.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_DIGEST, KM_DIGEST_NONE);
    soter.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN).add(KM_TAG_PADDING, KM_PAD_RSA_PSS);
    soter.add_bool(KM_TAG_SOTER_IS_FROM_SOTER).add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY);
    soter.add_bool(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY).add(KM_TAG_SOTER_UID, 7);
    add(import_key(tee, soter, g_rsa_material));
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee &tee = FuzzTee::instance();
    static bool ready = false;
    if (!ready) {
        make_keys(tee);
        tee.settle();
        ready = true;
    }
    tee.reset();
    FuzzInput in(data, size);
    Run r{tee, in, {}, {}, 0};
    for (int step = 0; step < 32 && !in.empty(); ++step) {
        switch (in.u8() % 12) {
        case 0:
            raw_invoke(r);
            break;
        case 1:
        case 2:
            begin(r);
            break;
        case 3:
            update_or_finish(r, KM_CMD_UPDATE);
            break;
        case 4:
            update_or_finish(r, KM_CMD_FINISH);
            break;
        case 5:
            abort_op(r);
            break;
        case 6:
            key_command(r);
            break;
        case 7:
            capability(r);
            break;
        case 8:
            soter(r);
            break;
        case 9:
            open_raw(r);
            break;
        case 10:
            // The next command runs short of memory at one of its allocations.
            r.fail_at = 1 + in.below(48);
            break;
        default: {
            const uint8_t c = in.u8();
            if (c < 0xF0) {
                tee_host::clock::advance_system_ms(uint64_t{in.u16()} * (c & 0x0F));
                tee_host::clock::advance_ree_ms(static_cast<int64_t>(in.u32()) * ((c & 0x10) ? 1000 : 1));
            } else {
                // A new instance: every operation ends with the old one.
                tee.reset();
                r.live.clear();
            }
            break;
        }
        }
    }
    return 0;
}
