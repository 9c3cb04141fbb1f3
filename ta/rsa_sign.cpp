/*
 * rsa_sign.cpp - RSA signing: PKCS#1 v1.5 and PSS over a digest, and raw
 * or PKCS#1 blocks built here for unhashed messages.
 */
#include "rsa.h"
#include "soter.h"
#include "ta_log.h"

namespace {

TEE_Result rsa_sign_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                           uint8_t *, uint32_t *output_len, int32_t *error) {
    *output_len = 0;
    return rsa_signature_buffer(operation_record<rsa_sign_operation_t>(op), input, input_len, error, "sign", __func__);
}

TEE_Result rsa_sign_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                           uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<rsa_sign_operation_t>(header);
    const uint32_t key_bytes = op->key_size / 8;
    heap_buf out;
    *output = nullptr;
    *output_len = 0;
    TEE_Result res = rsa_signature_message(op, __func__);
    if (res != TEE_SUCCESS)
        return res;
    if (!rsa_output_alloc(&out, op->key_size, error))
        return TEE_SUCCESS;
    uint32_t len = key_bytes;
    if (op->digest_operation) {
        // A digest-length salt whenever it fits, else the longest that does.
        const uint32_t h = rsa_digest_length(op->digest);
        TEE_Attribute salt{};
        const uint32_t attr_count = rsa_salt_attribute(
            op->padding, (h + 1) * 2 <= key_bytes ? TEE_RSA_PSS_SALT_DIGEST_LENGTH : TEE_RSA_PSS_SALT_MAX_OR_AUTO,
            &salt);
        res = TEE_AsymmetricSignDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->block,
                                       op->block_len, out.get(), &len);
        if (res != TEE_SUCCESS) {
            KM_ERR("AsymmetricSignDigest failed with 0x%08x\n", res);
            return res;
        }
    } else {
        res = rsa_raw(op, rsa_raw_call::sign, op->block, key_bytes, out.get(), &len, error);
        if (res != TEE_SUCCESS || *error)
            return res;
        // Verifiers expect k bytes; raw results come without leading zeros.
        rsa_left_pad(out.get(), &len, op->key_size);
    }
    out.set_len(len);
    *output_len = out.len();
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kSignFns = operation_fns<rsa_sign_operation_t>("rsa_sign_operation_t", rsa_sign_update,
                                                                     rsa_sign_finish, rsa_signature_release);

/* ---- SOTER keys: the message is collected and signed inside a document -- */

constexpr uint32_t kSoterInitialCapacity = 4096;

TEE_Result soter_sign_update(operation_t *header, keymaster_key_param_set_t *, const uint8_t *input,
                             uint32_t *input_len, uint8_t *, uint32_t *output_len, int32_t *error) {
    auto *op = operation_record<rsa_sign_operation_t>(header);
    *output_len = 0;
    KM_DEBUG("sign update is from soter");
    const uint32_t n = *input_len;
    const uint64_t needed = uint64_t{op->soter_len} + n;
    if (needed > op->soter_capacity) {
        const uint64_t doubled = uint64_t{op->soter_capacity} * 2;
        const uint64_t capacity = needed > doubled ? needed : doubled;
        uint8_t *grown = capacity > UINT32_MAX ? nullptr : static_cast<uint8_t *>(ta_malloc(capacity));
        if (!grown) {
            KM_ERR("no memory to expand soter buf %u", static_cast<unsigned>(capacity));
            *input_len = 0;
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        TEE_MemMove(grown, op->soter_buf, op->soter_len);
        ta_free_wiped(op->soter_buf, op->soter_capacity);
        KM_DEBUG("expand soter buf %u -> %d", op->soter_capacity, static_cast<int>(capacity));
        op->soter_buf = grown;
        op->soter_capacity = static_cast<uint32_t>(capacity);
    }
    TEE_MemMove(op->soter_buf + op->soter_len, input, n);
    op->soter_len += n;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result soter_sign_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                             uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<rsa_sign_operation_t>(header);
    KM_DEBUG("sign finish is from soter");
    TEE_Result res = soter_enhance_sign_finish(op, op->soter_buf, op->soter_len, output, output_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("soter enhance error %x", res);
        *error = KM_ERROR_UNKNOWN_ERROR;
    } else {
        *error = KM_ERROR_OK;
    }
    return TEE_SUCCESS;
}

const operation_fns_t kSoterSignFns = operation_fns<rsa_sign_operation_t>("rsa_sign_operation_t", soter_sign_update,
                                                                          soter_sign_finish, rsa_signature_release);

// A SOTER record: the RSA record for the begin parameters and a buffer for the raw message.
operation_t *create_soter_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                               int32_t *error) {
    KM_DEBUG("sign from soter, allocate raw message buffer");
    TEE_Result ready = soter_check_ready();
    if (ready != TEE_SUCCESS) {
        KM_ERR("soter resources is not ready, error 0x%x\n", ready);
        *error = KM_ERROR_UNKNOWN_ERROR;
        return nullptr;
    }
    operation_t *header =
        rsa_signature_create(key_data, key_data_len, in_params, true, error, &kSoterSignFns, "create_rsa_sign");
    if (!header)
        return nullptr;
    auto *op = operation_record<rsa_sign_operation_t>(header);
    // The document is far longer than a block: without a digest it could
    // only be signed cut short, so the combination is refused up front.
    if (op->digest == KM_DIGEST_NONE) {
        KM_ERR("soter signing needs a digest");
        *error = KM_ERROR_INCOMPATIBLE_DIGEST;
        operation_destroy(header, record_state::partial);
        return nullptr;
    }
    op->soter_buf = static_cast<uint8_t *>(ta_malloc(kSoterInitialCapacity));
    if (!op->soter_buf) {
        KM_ERR("No memory for soter");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        operation_destroy(header, record_state::partial);
        return nullptr;
    }
    op->soter_capacity = kSoterInitialCapacity;
    op->soter_len = 0;
    return header;
}

} // namespace

operation_t *create_rsa_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *key_params,
                             keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_IS_FROM_SOTER))
        return create_soter_sign(key_data, key_data_len, in_params, error);
    return rsa_signature_create(key_data, key_data_len, in_params, true, error, &kSignFns, __func__);
}
