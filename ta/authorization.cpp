/*
 * authorization.cpp - the checks a key's characteristics impose on its
 * use: application binding, purposes and modes, dates, use counts, rate
 * limits and user authentication.
 */
#include "authorization.h"

#include "auth_token.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

// The use log and the time anchors: one set per TA instance.
use_log_entry_t *use_log = nullptr;
TEE_Time system_time_at_init = {0, 0};
TEE_Time ree_time_at_init = {0, 0};

constexpr uint32_t kRefused = 255;
constexpr uint32_t kDigestSize = 32;

// One binding tag: absent accepts anything; present must be single and equal.
uint32_t check_binding(const keymaster_key_param_set_t *key_params, uint32_t tag, const uint8_t *given,
                       uint32_t given_len, const char *duplicated, const char *mismatch) {
    if (!key_param_set_has_tag(key_params, tag))
        return 0;
    const key_param_t *p = key_param_set_find_unique(key_params, tag);
    if (!p) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "check_app_id_and_app_data", __LINE__, "%s", duplicated);
        return kRefused;
    }
    if (p->blob.data_length != given_len ||
        (given_len != 0 && (!given || TEE_MemCompare(p->blob.data, given, given_len) != 0))) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "check_app_id_and_app_data", __LINE__, "%s", mismatch);
        return kRefused;
    }
    return 0;
}

// How the use log names a key: its blob bytes, or for a blob longer than an
// entry can hold, the blob's SHA-256 (told apart by the length kept beside it).
struct key_ref_t {
    const uint8_t *bytes;
    uint32_t len;       // stored as key_id_len
    uint32_t bytes_len; // bytes compared and copied
    uint8_t digest[kDigestSize];
};

bool resolve_key_id(const uint8_t *key_id, uint32_t key_id_len, key_ref_t *ref) {
    ref->len = key_id_len;
    if (key_id_len <= kKeyIdSize) {
        ref->bytes = key_id;
        ref->bytes_len = key_id_len;
        return true;
    }
    operation_guard op;
    if (TEE_AllocateOperation(op.out(), TEE_ALG_SHA256, TEE_MODE_DIGEST, 0) != TEE_SUCCESS) {
        KM_ERR("Out of memory");
        return false;
    }
    uint32_t n = kDigestSize;
    if (TEE_DigestDoFinal(op.get(), key_id, key_id_len, ref->digest, &n) != TEE_SUCCESS || n != kDigestSize)
        return false;
    ref->bytes = ref->digest;
    ref->bytes_len = kDigestSize;
    return true;
}

use_log_entry_t *find_entry(const key_ref_t &ref) {
    for (uint32_t i = 0; i < kUseLogEntries; ++i) {
        use_log_entry_t &e = use_log[i];
        if (e.key_id_len != 0 && e.key_id_len == ref.len && TEE_MemCompare(e.key_id, ref.bytes, ref.bytes_len) == 0)
            return &e;
    }
    return nullptr;
}

use_log_entry_t *reusable_entry(const TEE_Time &now) {
    for (uint32_t i = 0; i < kUseLogEntries; ++i) {
        use_log_entry_t &e = use_log[i];
        if (e.key_id_len == 0 || (e.use_count == 0 && e.rate_limit_end.seconds < now.seconds))
            return &e;
    }
    return nullptr;
}

void fill_entry(use_log_entry_t *e, const key_ref_t &ref) {
    TEE_MemFill(e, 0, sizeof *e);
    TEE_MemMove(e->key_id, ref.bytes, ref.bytes_len);
    e->key_id_len = ref.len;
}

uint64_t wall_ms() {
    TEE_Time t{};
    get_wall_time(&t);
    return uint64_t{t.seconds} * 1000 + t.millis;
}

// The secure-id configuration tests shared by begin and update/finish.
bool secure_id_misconfigured(const key_param_t *no_auth, const key_param_t *auth_type, int32_t *error,
                             const char *func) {
    if (no_auth) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Found KM_TAG_USER_SECURE_ID but also KM_TAG_NO_AUTH_REQUIRED");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return true;
    }
    if (!auth_type) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Found KM_TAG_USER_SECURE_ID but no KM_TAG_USER_AUTH_TYPE");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return true;
    }
    return false;
}

// The token of the request parameters: null when none; false when one is given but invalid.
bool request_token(keymaster_key_param_set_t *in_params, const uint8_t **token) {
    *token = nullptr;
    const key_param_t *t = key_param_set_find_unique(in_params, KM_TAG_AUTH_TOKEN);
    if (!t)
        return true;
    if (check_auth_token_valid(t->blob.data, t->blob.data_length) != 0)
        return false;
    *token = t->blob.data;
    return true;
}

} // namespace

uint32_t check_app_id_and_app_data(const keymaster_key_param_set_t *key_params, const uint8_t *app_id,
                                   uint32_t app_id_len, const uint8_t *app_data, uint32_t app_data_len) {
    if (check_binding(key_params, KM_TAG_APPLICATION_ID, app_id, app_id_len, "Duplicated KM_TAG_APPLICATION_ID",
                      "KM_TAG_APPLICATION_ID mismatch") != 0)
        return kRefused;
    if (check_binding(key_params, KM_TAG_APPLICATION_DATA, app_data, app_data_len, "Duplicated KM_TAG_APPLICATION_DATA",
                      "KM_TAG_APPLICATION_DATA mismatch") != 0)
        return kRefused;
    return 0;
}

TEE_Result use_log_init() {
    use_log_release();
    use_log = static_cast<use_log_entry_t *>(ta_malloc(kUseLogEntries * sizeof(use_log_entry_t)));
    if (!use_log) {
        KM_ERR("Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    return TEE_SUCCESS;
}

void use_log_release() {
    // Key identifiers are blob bytes: wipe them with the log.
    ta_free_wiped(use_log, kUseLogEntries * sizeof(use_log_entry_t));
    use_log = nullptr;
}

void time_anchors_init() {
    TEE_GetSystemTime(&system_time_at_init);
    TEE_GetREETime(&ree_time_at_init);
}

void get_wall_time(TEE_Time *time) {
    TEE_Time now{};
    TEE_GetSystemTime(&now);
    int64_t seconds = int64_t{ree_time_at_init.seconds} + (int64_t{now.seconds} - system_time_at_init.seconds) - 1;
    int64_t millis = int64_t{ree_time_at_init.millis} + (int64_t{now.millis} - system_time_at_init.millis) + 1000;
    seconds += millis / 1000;
    millis %= 1000;
    time->seconds = static_cast<uint32_t>(seconds);
    time->millis = static_cast<uint32_t>(millis);
}

uint32_t check_use_count_and_add(const uint8_t *key_id, uint32_t key_id_len, uint32_t max_uses, int32_t *error) {
    TEE_Time now{};
    key_ref_t ref{};
    TEE_GetSystemTime(&now);
    if (!resolve_key_id(key_id, key_id_len, &ref)) {
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return 1;
    }
    use_log_entry_t *e = find_entry(ref);
    if (e) {
        if (e->use_count >= max_uses) {
            KM_ERR("Key max ops exceeded");
            *error = KM_ERROR_KEY_MAX_OPS_EXCEEDED;
            return 1;
        }
        ++e->use_count;
        *error = KM_ERROR_OK;
        return 0;
    }
    e = reusable_entry(now);
    if (!e) {
        KM_ERR("Too many use log");
        *error = KM_ERROR_TOO_MANY_OPERATIONS;
        return 1;
    }
    fill_entry(e, ref);
    e->use_count = 1;
    *error = KM_ERROR_OK;
    return 0;
}

uint32_t rate_limit_record(const uint8_t *key_id, uint32_t key_id_len, uint32_t min_seconds) {
    TEE_Time now{};
    key_ref_t ref{};
    TEE_GetSystemTime(&now);
    if (!resolve_key_id(key_id, key_id_len, &ref))
        return 1;
    use_log_entry_t *e = find_entry(ref);
    if (!e) {
        e = reusable_entry(now);
        if (!e)
            return 1;
        fill_entry(e, ref);
    }
    e->last_use = now;
    e->rate_limit_end.seconds = now.seconds + min_seconds;
    e->rate_limit_end.millis = now.millis;
    return 0;
}

uint32_t rate_limit_last_use(const uint8_t *key_id, uint32_t key_id_len, TEE_Time *last_use) {
    key_ref_t ref{};
    if (!resolve_key_id(key_id, key_id_len, &ref))
        return kRateLimitUnknown;
    const use_log_entry_t *e = find_entry(ref);
    // An entry made by the use count alone was never stamped: the key has
    // no last use yet, and its first use is not "too soon" after boot.
    const bool stamped =
        e && (e->last_use.seconds || e->last_use.millis || e->rate_limit_end.seconds || e->rate_limit_end.millis);
    if (!stamped)
        return 1;
    *last_use = e->last_use;
    return 0;
}

namespace {

// An operation parameter that the key must allow, once the getter asked for it.
struct wanted_t {
    bool pending;
    uint32_t value;
};

// What authorize_begin learns before it walks the key's parameters.
struct begin_context_t {
    const uint8_t *key_id;
    uint32_t key_id_len;
    uint32_t purpose;
    uint32_t algorithm;
    keymaster_key_param_set_t *in_params;
    const keymaster_key_param_set_t *key_params;
    const key_param_t *timeout;
    const key_param_t *auth_type;
    const key_param_t *no_auth;
    const uint8_t *token;
    wanted_t padding;
    wanted_t block_mode;
    wanted_t digest;
    bool mac_length_checked;
    bool purpose_matched;
    bool auth_required;
    bool auth_satisfied;
};

// Steps 4 to 8: the request's token, the key's authentication tags and the
// padding, block mode and digest the operation will use. False with *error
// set when the begin is refused.
bool begin_gather(begin_context_t *c, int32_t *error) {
    c->timeout = key_param_set_find_unique(c->key_params, KM_TAG_AUTH_TIMEOUT);
    if (!request_token(c->in_params, &c->token)) {
        *error = KM_ERROR_INVALID_ARGUMENT;
        return false;
    }
    c->auth_type = key_param_set_find_unique(c->key_params, KM_TAG_USER_AUTH_TYPE);
    c->no_auth = key_param_set_find_unique(c->key_params, KM_TAG_NO_AUTH_REQUIRED);
    const algorithm_provider_t *provider = nullptr;
    const purpose_ops_t *ops = find_purpose_ops(c->algorithm, c->purpose, &provider);
    if (!provider) {
        *error = KM_ERROR_UNSUPPORTED_ALGORITHM;
        return false;
    }
    if (!ops || !ops->get_padding || !ops->get_block_mode || !ops->get_digest) {
        *error = KM_ERROR_UNSUPPORTED_PURPOSE;
        return false;
    }
    c->padding.pending = ops->get_padding(c->in_params, &c->padding.value) == 0;
    c->block_mode.pending = ops->get_block_mode(c->in_params, &c->block_mode.value) == 0;
    c->digest.pending = ops->get_digest(c->in_params, &c->digest.value) == 0;
    c->mac_length_checked =
        c->algorithm == KM_ALGORITHM_HMAC ||
        (c->algorithm == KM_ALGORITHM_AES && c->block_mode.pending && c->block_mode.value == KM_MODE_GCM);
    return true;
}

void match(wanted_t *w, uint32_t value) {
    if (w->pending && value == w->value)
        w->pending = false;
}

// The validity dates: ACTIVE for every purpose, ORIGINATION_EXPIRE for
// encrypt and sign, USAGE_EXPIRE for decrypt and verify.
bool date_refused(const begin_context_t &c, const key_param_t &p, int32_t *error) {
    if (p.tag == KM_TAG_ACTIVE_DATETIME) {
        if (wall_ms() >= p.date_time)
            return false;
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Key not yet valid");
        *error = KM_ERROR_KEY_NOT_YET_VALID;
        return true;
    }
    const bool originating = c.purpose == KM_PURPOSE_ENCRYPT || c.purpose == KM_PURPOSE_SIGN;
    if (originating != (p.tag == KM_TAG_ORIGINATION_EXPIRE_DATETIME) || wall_ms() <= p.date_time)
        return false;
    KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Key expired");
    *error = KM_ERROR_KEY_EXPIRED;
    return true;
}

// The minimum time between uses; a last use that cannot be looked up refuses.
bool rate_limited(const begin_context_t &c, uint32_t min_seconds, int32_t *error) {
    TEE_Time last{}, now{};
    const uint32_t found = rate_limit_last_use(c.key_id, c.key_id_len, &last);
    if (found == 1)
        return false;
    if (found != 0) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Rate limit not checked, use refused");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return true;
    }
    TEE_GetSystemTime(&now);
    if (static_cast<uint32_t>(now.seconds - last.seconds) > min_seconds)
        return false;
    KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "key rate limit exceeded");
    *error = KM_ERROR_KEY_RATE_LIMIT_EXCEEDED;
    return true;
}

// Step 9: one record of the key's parameters. True when it refuses the begin.
bool begin_check_param(begin_context_t *c, const key_param_t &p, int32_t *error) {
    switch (p.tag) {
    case KM_TAG_PURPOSE:
        c->purpose_matched |= p.enumerated == c->purpose;
        return false;
    case KM_TAG_PADDING:
        match(&c->padding, p.enumerated);
        return false;
    case KM_TAG_BLOCK_MODE:
        match(&c->block_mode, p.enumerated);
        return false;
    case KM_TAG_DIGEST:
        match(&c->digest, p.enumerated);
        return false;
    case KM_TAG_MIN_MAC_LENGTH: {
        if (!c->mac_length_checked)
            return false;
        const key_param_t *mac_length = key_param_set_find_unique(c->in_params, KM_TAG_MAC_LENGTH);
        if (mac_length && mac_length->integer < p.integer) {
            *error = KM_ERROR_INVALID_MAC_LENGTH;
            return true;
        }
        return false;
    }
    case KM_TAG_USER_SECURE_ID:
        if (secure_id_misconfigured(c->no_auth, c->auth_type, error, "authorize_begin"))
            return true;
        c->auth_required = true;
        if (!c->auth_satisfied)
            c->auth_satisfied = check_auth(p.long_integer, 0, c->token, c->timeout, c->auth_type) == 0;
        return false;
    case KM_TAG_ACTIVE_DATETIME:
    case KM_TAG_ORIGINATION_EXPIRE_DATETIME:
    case KM_TAG_USAGE_EXPIRE_DATETIME:
        return date_refused(*c, p, error);
    case KM_TAG_MIN_SECONDS_BETWEEN_OPS:
        return rate_limited(*c, p.integer, error);
    case KM_TAG_MAX_USES_PER_BOOT:
        return check_use_count_and_add(c->key_id, c->key_id_len, p.integer, error) != 0;
    case KM_TAG_BOOTLOADER_ONLY:
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Bootloader only key");
        *error = KM_ERROR_INVALID_KEY_BLOB;
        return true;
    default:
        return false;
    }
}

// Step 10: after the walk, the first failing test decides.
void begin_verdict(const begin_context_t &c, int32_t *error) {
    if (!c.purpose_matched) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "No such purpose in key_params");
        *error = KM_ERROR_INCOMPATIBLE_PURPOSE;
    } else if (c.padding.pending) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "No such padding in key_params");
        *error = KM_ERROR_INCOMPATIBLE_PADDING_MODE;
    } else if (c.block_mode.pending) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "No such block mode in key_params");
        *error = KM_ERROR_INCOMPATIBLE_BLOCK_MODE;
    } else if (c.digest.pending) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "No such digest in key_params");
        *error = KM_ERROR_INCOMPATIBLE_DIGEST;
    } else if (c.auth_required && !c.auth_satisfied) {
        if (!c.timeout) {
            KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "OP AUTH NEEDED");
            *error = KM_OP_AUTH_NEEDED;
        } else {
            KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Auth token check failed");
            *error = KM_ERROR_KEY_USER_NOT_AUTHENTICATED;
        }
    } else if (c.purpose == KM_PURPOSE_ENCRYPT && key_param_set_has_tag(c.in_params, KM_TAG_NONCE) &&
               !key_param_set_has_tag(c.key_params, KM_TAG_CALLER_NONCE)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Caller nonce prohibited");
        *error = KM_ERROR_CALLER_NONCE_PROHIBITED;
    }
}

// Step 11: an authorized use of a rate-limited key is stamped. A stamp that
// finds no room in the use log refuses the use: dropping it would switch
// the rate limit off.
void begin_stamp(const begin_context_t &c, int32_t *error) {
    const key_param_t *min_seconds = key_param_set_find_unique(c.key_params, KM_TAG_MIN_SECONDS_BETWEEN_OPS);
    if (!min_seconds || rate_limit_record(c.key_id, c.key_id_len, min_seconds->integer) == 0)
        return;
    KM_TRACE_AT(TEE_TRACE_ERROR, "authorize_begin", __LINE__, "Too many use log");
    *error = KM_ERROR_TOO_MANY_OPERATIONS;
}

} // namespace

TEE_Result authorize_begin(const uint8_t *key_id, uint32_t key_id_len, uint32_t purpose,
                           keymaster_key_param_set_t *in_params, const keymaster_key_param_set_t *key_params,
                           int32_t *error) {
    *error = KM_ERROR_OK;
    const key_param_t *alg = key_param_set_find_unique(key_params, KM_TAG_ALGORITHM);
    if (!alg) {
        KM_ERR("No or too many KM_TAG_ALGORITHM in key_params");
        *error = KM_ERROR_INVALID_KEY_BLOB;
        return TEE_SUCCESS;
    }
    // Public-key operations are open to anyone holding the blob.
    if ((alg->enumerated == KM_ALGORITHM_RSA || alg->enumerated == KM_ALGORITHM_EC) &&
        (purpose == KM_PURPOSE_ENCRYPT || purpose == KM_PURPOSE_VERIFY))
        return TEE_SUCCESS;

    begin_context_t c{};
    c.key_id = key_id;
    c.key_id_len = key_id_len;
    c.purpose = purpose;
    c.algorithm = alg->enumerated;
    c.in_params = in_params;
    c.key_params = key_params;
    if (!begin_gather(&c, error))
        return TEE_SUCCESS;
    for (uint32_t i = 0; i < key_params->length; ++i)
        if (begin_check_param(&c, key_params->params[i], error))
            return TEE_SUCCESS;
    begin_verdict(c, error);
    if (*error == KM_ERROR_OK)
        begin_stamp(c, error);
    return TEE_SUCCESS;
}

TEE_Result authorize_update_or_finish(keymaster_key_param_set_t *in_params, const operation_t *op, uint64_t challenge,
                                      int32_t *error) {
    const keymaster_key_param_set_t *key_params = &op->key_params;
    const uint8_t *token = nullptr;
    bool required = false;
    bool satisfied = false;
    *error = KM_ERROR_OK;
    if (key_param_set_find_unique(key_params, KM_TAG_AUTH_TIMEOUT))
        return TEE_SUCCESS;
    if (!request_token(in_params, &token)) {
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    const key_param_t *auth_type = key_param_set_find_unique(key_params, KM_TAG_USER_AUTH_TYPE);
    const key_param_t *no_auth = key_param_set_find_unique(key_params, KM_TAG_NO_AUTH_REQUIRED);
    for (uint32_t i = 0; i < key_params->length; ++i) {
        const key_param_t &p = key_params->params[i];
        if (p.tag != KM_TAG_USER_SECURE_ID)
            continue;
        if (secure_id_misconfigured(no_auth, auth_type, error, __func__))
            return TEE_SUCCESS;
        required = true;
        if (!satisfied)
            satisfied = check_auth(p.long_integer, challenge, token, nullptr, auth_type) == 0;
    }
    if (required && !satisfied) {
        KM_ERR("Auth token check failed");
        *error = KM_ERROR_KEY_USER_NOT_AUTHENTICATED;
    }
    return TEE_SUCCESS;
}
