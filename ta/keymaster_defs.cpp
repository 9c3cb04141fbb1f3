/*
 * keymaster_defs.cpp - the parameter-set dump.
 */
#include "keymaster_defs.h"

#include "ta_log.h"

void keymaster_dump_key_param_set(const char *file, int line, const keymaster_key_param_set_t *set) {
    KM_DEBUG("Dump at %s:%d", file, line);
    if (!set || !set->params)
        return;
    for (uint32_t i = 0; i < set->length; ++i) {
        const key_param_t &p = set->params[i];
        KM_DEBUG("Tag: 0x%08x", p.tag);
        switch (key_tag_type(p.tag)) {
        case KM_INVALID:
            KM_DEBUG("    KM_INVALID");
            break;
        case KM_BIGNUM:
            KM_DEBUG("    KM_BIGNUM, length %dB", static_cast<int>(p.blob.data_length));
            break;
        case KM_BYTES:
            KM_DEBUG("    KM_BYTES, length %dB", static_cast<int>(p.blob.data_length));
            break;
        case KM_ENUM:
        case KM_ENUM_REP:
            KM_DEBUG("    KM_ENUM: %d", static_cast<int32_t>(p.enumerated));
            break;
        case KM_UINT:
        case KM_UINT_REP:
            KM_DEBUG("    KM_UINT: 0x%08x", p.integer);
            break;
        case KM_ULONG:
        case KM_ULONG_REP:
            KM_DEBUG("    KM_ULONG: 0x%016llx", static_cast<unsigned long long>(p.long_integer));
            break;
        case KM_DATE:
            KM_DEBUG("    KM_DATE: 0x%016llx", static_cast<unsigned long long>(p.date_time));
            break;
        case KM_BOOL:
            KM_DEBUG("    KM_BOOL: %d", p.boolean);
            break;
        default:
            KM_DEBUG("    Invalid tag type");
            break;
        }
    }
}
