/*
 * properties.cpp - the three GP property sets: the current TA (its header's
 * table), the current client (its identity) and the TEE implementation.
 * Every property is held in its GP string form and converted on request.
 */
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <optional>

#include "platform_internal.h"

namespace tee_host::detail {

std::string uuid_to_string(const TEE_UUID &u) {
    char buf[40] = {};
    std::snprintf(buf, sizeof buf, "%08x-%04x-%04x-%02x%02x-%02x%02x%02x%02x%02x%02x", u.timeLow, u.timeMid,
                  u.timeHiAndVersion, u.clockSeqAndNode[0], u.clockSeqAndNode[1], u.clockSeqAndNode[2],
                  u.clockSeqAndNode[3], u.clockSeqAndNode[4], u.clockSeqAndNode[5], u.clockSeqAndNode[6],
                  u.clockSeqAndNode[7]);
    return buf;
}

bool uuid_from_string(const std::string &s, TEE_UUID *out) {
    unsigned v[11] = {};
    int used = 0;
    if (s.size() != 36 ||
        std::sscanf(s.c_str(), "%8x-%4x-%4x-%2x%2x-%2x%2x%2x%2x%2x%2x%n", &v[0], &v[1], &v[2], &v[3], &v[4], &v[5],
                    &v[6], &v[7], &v[8], &v[9], &v[10], &used) != 11 ||
        used != 36)
        return false;
    out->timeLow = v[0];
    out->timeMid = static_cast<uint16_t>(v[1]);
    out->timeHiAndVersion = static_cast<uint16_t>(v[2]);
    for (int i = 0; i < 8; ++i)
        out->clockSeqAndNode[i] = static_cast<uint8_t>(v[3 + i]);
    return true;
}

} // namespace tee_host::detail

using namespace tee_host;

namespace {

enum class Kind { Bool, U32, String, Uuid, Identity, Binary };

struct Prop {
    Kind kind;
    std::string text; // GP string form
};

std::optional<Prop> ta_prop(const char *name) {
    const ta_header_t *ta = detail::current_ta();
    if (!ta)
        return std::nullopt;
    if (!std::strcmp(name, "gpd.ta.appID"))
        return Prop{Kind::Uuid, detail::uuid_to_string(ta->uuid)};
    for (uint32_t i = 0; i < ta->num_props; ++i) {
        const ta_property_t &p = ta->props[i];
        if (std::strcmp(p.name, name) != 0)
            continue;
        switch (p.type) {
        case TA_PROP_BOOL:
            return Prop{Kind::Bool, *static_cast<const bool *>(p.value) ? "true" : "false"};
        case TA_PROP_U32:
            return Prop{Kind::U32, std::to_string(*static_cast<const uint32_t *>(p.value))};
        case TA_PROP_STRING:
            return Prop{Kind::String, static_cast<const char *>(p.value)};
        case TA_PROP_UUID:
            return Prop{Kind::Uuid, detail::uuid_to_string(*static_cast<const TEE_UUID *>(p.value))};
        }
    }
    return std::nullopt;
}

std::optional<Prop> client_prop(const char *name) {
    const TEE_Identity *id = detail::current_client();
    if (!id)
        return std::nullopt;
    if (!std::strcmp(name, "gpd.client.identity"))
        return Prop{Kind::Identity, std::to_string(id->login) + ":" + detail::uuid_to_string(id->uuid)};
    if (!std::strcmp(name, "gpd.client.endian"))
        return Prop{Kind::U32, "0"};
    return std::nullopt;
}

std::optional<Prop> tee_prop(const char *name) {
    const detail::Globals &g = detail::globals();
    if (!std::strcmp(name, "gpd.tee.deviceID"))
        return Prop{Kind::Uuid, detail::uuid_to_string(g.device_id)};
    if (!std::strcmp(name, "gpd.tee.trustedos.manufacturer"))
        return Prop{Kind::String, g.config.os_manufacturer};
    if (!std::strcmp(name, "gpd.tee.trustedos.implementation.version"))
        return Prop{Kind::String, g.config.os_version};
    if (!std::strcmp(name, "gpd.tee.apiversion"))
        return Prop{Kind::String, "1.1"};
    if (!std::strcmp(name, "gpd.tee.description"))
        return Prop{Kind::String, "Host TEE emulation"};
    if (!std::strcmp(name, "gpd.tee.internalCore.version"))
        return Prop{Kind::U32, "16842752"}; // 1.1.0.0
    return std::nullopt;
}

// Looks a property up; panics on a handle that is no property set.
std::optional<Prop> lookup(TEE_PropSetHandle set, const char *name) {
    if (!name)
        detail::panic("property lookup with a null name");
    if (set == TEE_PROPSET_CURRENT_TA)
        return ta_prop(name);
    if (set == TEE_PROPSET_CURRENT_CLIENT)
        return client_prop(name);
    if (set == TEE_PROPSET_TEE_IMPLEMENTATION)
        return tee_prop(name);
    detail::panic("property lookup on an unknown property set");
}

bool parse_u32(const std::string &s, uint32_t *v) {
    if (s.empty())
        return false;
    char *end = nullptr;
    unsigned long long x = std::strtoull(s.c_str(), &end, 0);
    if (*end != '\0' || x > UINT32_MAX)
        return false;
    *v = static_cast<uint32_t>(x);
    return true;
}

} // namespace

extern "C" {

TEE_Result TEE_GetPropertyAsString(TEE_PropSetHandle set, const char *name, char *valueBuffer,
                                   uint32_t *valueBufferLen) {
    if (!valueBufferLen)
        detail::panic("TEE_GetPropertyAsString without a length");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    uint32_t need = static_cast<uint32_t>(p->text.size() + 1);
    if (!valueBuffer || *valueBufferLen < need) {
        *valueBufferLen = need;
        return TEE_ERROR_SHORT_BUFFER;
    }
    std::memcpy(valueBuffer, p->text.c_str(), need);
    *valueBufferLen = need;
    return TEE_SUCCESS;
}

TEE_Result TEE_GetPropertyAsBool(TEE_PropSetHandle set, const char *name, bool *value) {
    if (!value)
        detail::panic("TEE_GetPropertyAsBool without an output");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    if (p->text == "true")
        *value = true;
    else if (p->text == "false")
        *value = false;
    else
        return TEE_ERROR_BAD_FORMAT;
    return TEE_SUCCESS;
}

TEE_Result TEE_GetPropertyAsU32(TEE_PropSetHandle set, const char *name, uint32_t *value) {
    if (!value)
        detail::panic("TEE_GetPropertyAsU32 without an output");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    return parse_u32(p->text, value) ? TEE_SUCCESS : TEE_ERROR_BAD_FORMAT;
}

TEE_Result TEE_GetPropertyAsBinaryBlock(TEE_PropSetHandle set, const char *name, void * /*valueBuffer*/,
                                        uint32_t *valueBufferLen) {
    if (!valueBufferLen)
        detail::panic("TEE_GetPropertyAsBinaryBlock without a length");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    // No property of this platform is a binary block.
    return TEE_ERROR_BAD_FORMAT;
}

TEE_Result TEE_GetPropertyAsUUID(TEE_PropSetHandle set, const char *name, TEE_UUID *value) {
    if (!value)
        detail::panic("TEE_GetPropertyAsUUID without an output");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    return detail::uuid_from_string(p->text, value) ? TEE_SUCCESS : TEE_ERROR_BAD_FORMAT;
}

TEE_Result TEE_GetPropertyAsIdentity(TEE_PropSetHandle set, const char *name, TEE_Identity *value) {
    if (!value)
        detail::panic("TEE_GetPropertyAsIdentity without an output");
    auto p = lookup(set, name);
    if (!p)
        return TEE_ERROR_ITEM_NOT_FOUND;
    size_t colon = p->text.find(':');
    if (colon == std::string::npos)
        return TEE_ERROR_BAD_FORMAT;
    uint32_t login = 0;
    TEE_UUID uuid{};
    if (!parse_u32(p->text.substr(0, colon), &login) || !detail::uuid_from_string(p->text.substr(colon + 1), &uuid))
        return TEE_ERROR_BAD_FORMAT;
    value->login = login;
    value->uuid = uuid;
    return TEE_SUCCESS;
}

} // extern "C"
