/*
 * rsa_sign.cpp - RSA signing: PKCS#1 v1.5 and PSS over a digest, and raw
 * or PKCS#1 blocks built here for unhashed messages.
 */
#include "rsa.h"
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
    TEE_Result res = TEE_SUCCESS;
    if (op->digest_operation) {
        res = rsa_signature_digest(op, __func__);
        if (res != TEE_SUCCESS)
            return res;
        if (!rsa_output_alloc(&out, op->key_size, error))
            return TEE_SUCCESS;
        uint32_t len = key_bytes;
        TEE_Attribute salt{};
        uint32_t attr_count = 0;
        if (op->padding == KM_PAD_RSA_PSS) {
            const uint32_t h = rsa_digest_length(op->digest);
            TEE_InitValueAttribute(
                &salt, TEE_ATTR_RSA_PSS_SALT_LENGTH,
                (h + 1) * 2 <= key_bytes ? TEE_RSA_PSS_SALT_DIGEST_LENGTH : TEE_RSA_PSS_SALT_MAX_OR_AUTO, 0);
            attr_count = 1;
        }
        res = TEE_AsymmetricSignDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->block,
                                       op->block_len, out.get(), &len);
        if (res != TEE_SUCCESS) {
            KM_ERR("AsymmetricSignDigest failed with 0x%08x\n", res);
            return res;
        }
        out.set_len(len);
    } else {
        if (!rsa_output_alloc(&out, op->key_size, error))
            return TEE_SUCCESS;
        rsa_signature_block(op);
        uint32_t len = 0;
        res = rsa_raw(op, rsa_raw_call::sign, op->block, key_bytes, out.get(), &len, error);
        if (res != TEE_SUCCESS || *error)
            return res;
        // Verifiers expect k bytes; raw results come without leading zeros.
        rsa_left_pad(out.get(), &len, op->key_size);
        out.set_len(len);
    }
    *output_len = out.len();
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kSignFns = operation_fns<rsa_sign_operation_t>("rsa_sign_operation_t", rsa_sign_update,
                                                                     rsa_sign_finish, rsa_signature_release);

} // namespace

operation_t *create_rsa_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *key_params,
                             keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_IS_FROM_SOTER)) {
        // SOTER keys sign a document built around the message; not available in this build.
        KM_ERR("SOTER signing is not available in this build");
        *error = KM_ERROR_UNIMPLEMENTED;
        return nullptr;
    }
    return rsa_signature_create(key_data, key_data_len, in_params, true, error, &kSignFns, __func__);
}
