/*
 * soter.h - SOTER attestation: the process-wide SOTER state (the ATTK and
 * the SOTER property set, loaded lazily from the provisioning TA), the
 * SOTER commands 0xFF00 to 0xFF03, and the SOTER export of a key.
 */
#ifndef SOTER_H
#define SOTER_H

#include "keymaster_defs.h"
#include "rsa.h"
#include "soter_key.h"

/*
 * soter_check_ready - 0 when the SOTER state is loaded; otherwise loads it
 * now (soter_init) and returns that result. A failed load leaves nothing
 * loaded, so the next call tries again.
 */
TEE_Result soter_check_ready();

/* soter_init - loads the ATTK then the property set; on failure both are released and the state stays unloaded. */
TEE_Result soter_init();

/* soter_deinit - marks the state unloaded and releases (wipes) both records. */
void soter_deinit();

/* soter_is_ready - whether the SOTER state is loaded. */
bool soter_is_ready();

/* soter_attk, soter_props - the loaded records, owned by the SOTER state; meaningful only while ready. */
const soter_key_pair *soter_attk();
const soter_prop_set *soter_props();

/*
 * The SOTER command handlers. Each returns TEE_SUCCESS and reports its own
 * outcome in *result:
 * - generate (0xFF00): 0 loaded, -1000 not loaded;
 * - verify (0xFF01): 0 the provisioning TA's key loads, -1 it has none,
 *   -2 any other failure (out-of-memory retried, three attempts in all);
 *   the loaded state is not touched;
 * - export (0xFF02): the ATTK's public key as PEM into buf, *size the
 *   capacity in and the length counting its NUL out; 0, -38 no buffer,
 *   -1 SOTER not ready, -1000 conversion or export failed (size unchanged);
 * - device id (0xFF03): the device identifier into buf; 0, -29 buffer too
 *   small (size unchanged), -1000 other failure.
 */
TEE_Result soter_handle_generate_attk_key_pair(uint32_t unused, int32_t *result);
TEE_Result soter_handle_verify_attk_key_pair(int32_t *result);
TEE_Result soter_handle_export_attk_public_key(uint8_t *buf, uint32_t *size, int32_t *result);
TEE_Result soter_handle_get_device_id(uint8_t *buf, uint32_t *size, int32_t *result);

/* get_fresh_fid's answer for a stale or never reported fid. */
constexpr TEE_Result kSoterErrorStaleFid = 0xFFFF3001;

/*
 * increase_and_get_counter - advances the persistent SOTER counter (created
 * holding 0 on first use) and hands out the new value: the first is 1. On
 * any failure *counter is 0 and the storage result is returned (a counter
 * object of the wrong size: TEE_ERROR_BAD_STATE).
 */
TEE_Result increase_and_get_counter(uint64_t *counter);

/*
 * soter_handle_setFid - command 0xFF04: the fingerprint TA's 16-byte
 * notification (version 0, fid, timestamp in ms, little-endian) becomes the
 * fid record. TEE_ERROR_ACCESS_DENIED for any client but the fingerprint TA
 * named by the loaded property set (nobody before it is loaded),
 * TEE_ERROR_BAD_PARAMETERS for another size, TEE_ERROR_BAD_FORMAT for
 * another version.
 */
TEE_Result soter_handle_setFid(const uint8_t *buf, uint32_t size);

/* soter_fid_reset - forgets the reported fid; a TA instance starts with none. */
void soter_fid_reset();

/* is_from_fp_ta - 0 when the calling client is the fingerprint TA; TEE_ERROR_ACCESS_DENIED or the property failure
 * otherwise. */
TEE_Result is_from_fp_ta();

/* get_client_property - the current client's identity (login and UUID). */
TEE_Result get_client_property(TEE_Identity *identity);

/*
 * get_fresh_fid - the reported fid when it is at most 3 seconds old by
 * the TEE system time; else (also when none was ever reported)
 * kSoterErrorStaleFid with *fid 0xFFFFFFFF. Reading does not consume it.
 */
TEE_Result get_fresh_fid(uint32_t *fid);

/*
 * soter_enhance_export_key - the export of a SOTER key: u32 J, the J bytes
 * of the JSON document (no NUL), and its RSASSA-PKCS1-v1_5 SHA-256
 * signature by the ATTK or the key the exported key names, written into
 * out (capacity *out_len). On success *out_len is the length written;
 * TEE_ERROR_SHORT_BUFFER leaves out untouched and sets *out_len to the
 * length needed. A counter value taken before a failure is spent.
 */
TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *key_params, const uint8_t *key_data,
                                    uint32_t key_data_len, uint8_t *out, uint32_t *out_len);

/*
 * pack_export_output - writes u32 json_len, the JSON, the signature into out;
 * TEE_ERROR_SHORT_BUFFER (nothing written, *out_len the length needed) when
 * it does not fit.
 */
TEE_Result pack_export_output(const char *json, uint32_t json_len, const uint8_t *signature, uint32_t signature_len,
                              uint8_t *out, uint32_t *out_len);

/*
 * digest_and_sign - RSASSA-PKCS1-v1_5 over the SHA-256 of message with key
 * (key_size bits) into signature (capacity *signature_len, the length
 * written on success). do_digest_with_sha and do_sign_with_rsa are its two
 * halves.
 */
TEE_Result digest_and_sign(TEE_ObjectHandle key, uint32_t key_size, const uint8_t *message, uint32_t message_len,
                           uint8_t *signature, uint32_t *signature_len);
TEE_Result do_digest_with_sha(uint32_t algorithm, const uint8_t *message, uint32_t message_len, uint8_t *digest,
                              uint32_t *digest_len);
TEE_Result do_sign_with_rsa(TEE_ObjectHandle key, uint32_t key_size, const uint8_t *digest, uint32_t digest_len,
                            uint8_t *signature, uint32_t *signature_len);

/*
 * produce_soter_sign_json - the signing document around message: "raw",
 * "fid" while fresh, a new "counter", "uid", and the device facts. A new
 * NUL-terminated rendering the caller frees with json_doc_free_text, or
 * null (logged) when SOTER is not ready, the message is not UTF-8 text
 * without NUL bytes (the counter is then not advanced), or a step fails.
 */
char *produce_soter_sign_json(uint64_t uid, const uint8_t *message, uint32_t message_len);

/*
 * soter_do_sign_finish - op's digest over message, signed by op's RSA
 * operation with op's padding. On success *signature is a new heap buffer
 * the caller frees; on failure none and 0.
 */
TEE_Result soter_do_sign_finish(rsa_sign_operation_t *op, const uint8_t *message, uint32_t message_len,
                                uint8_t **signature, uint32_t *signature_len);

/*
 * soter_enhance_sign_finish - the finish of a SOTER signing operation: the
 * document made around message and signed with its NUL, as u32 J (NUL
 * counted), the J bytes, the signature, in a new heap buffer *output the
 * caller frees. On failure none and 0.
 */
TEE_Result soter_enhance_sign_finish(rsa_sign_operation_t *op, const uint8_t *message, uint32_t message_len,
                                     uint8_t **output, uint32_t *output_len);

#endif
