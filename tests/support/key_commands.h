/*
 * key_commands.h - the key commands as a normal-world caller sends them,
 * for tests: requests built with km::ParamSet, real TEE_Param arrays.
 */
#ifndef KEY_COMMANDS_H
#define KEY_COMMANDS_H

#include "algorithm_provider.h"
#include "km/param_set.h"
#include "ta_entry.h"
#include "ta_fixture.h"

struct evp_md_st;
// md_for - OpenSSL's digest for a Keymaster digest (MD5 to SHA-512), null otherwise.
const evp_md_st *md_for(uint32_t digest);

// rsa_material - the TA's RSA import material of a private key text, made
// by the client library (a test failure and empty when it does not decode).
Bytes rsa_material(const char *pem);

class KeyTest : public TaTest {
  protected:
    // generate - command 13; *blob is resized to what the TA wrote.
    Outcome generate(const km::ParamSet &params, Bytes *blob, size_t capacity = 4096);
    // import - command 19; splits the response into blob and characteristics.
    Outcome import(const km::ParamSet &params, const Bytes &material, Bytes *blob, Bytes *chars = nullptr,
                   size_t capacity = 4096);
    Outcome character_size(const Bytes &reference, uint32_t *size);
    Outcome characteristics(const Bytes &reference, Bytes *out, size_t capacity = 4096) {
        return reference_command(KM_CMD_GET_KEY_CHARACTER, reference, out, capacity);
    }
    Outcome export_key(const Bytes &reference, Bytes *out, size_t capacity = 4096) {
        return reference_command(KM_CMD_EXPORT_KEY, reference, out, capacity);
    }
    Outcome delete_key(const Bytes &blob);
    Outcome delete_all();
    // open_raw - command 27 on a session; *payload receives what came back.
    TEE_Result open_raw(uint32_t session, const Bytes &blob, Bytes *payload);

    // begin - command 16; *handle is b on return, *out_params the serialized output parameters.
    Outcome begin(uint32_t purpose, const Bytes &blob, const km::ParamSet &params, uint32_t *handle,
                  Bytes *out_params = nullptr);
    // update - command 17; *consumed is b on return.
    Outcome update(uint32_t handle, const Bytes &data, const km::ParamSet &params = {}, Bytes *output = nullptr,
                   uint32_t *consumed = nullptr);
    // finish - command 18; *output the operation's output, *out_params its parameters.
    Outcome finish(uint32_t handle, const Bytes &signature = {}, const km::ParamSet &params = {},
                   Bytes *output = nullptr, size_t capacity = 4096);
    Outcome abort(uint32_t handle);
    // sign_all - begin, one update per chunk, finish; the MAC or signature in *out.
    Outcome run(uint32_t purpose, const Bytes &blob, const km::ParamSet &begin_params, const Bytes &message,
                size_t chunk, const Bytes &signature, Bytes *out);

    // create_record - the record that create_operation builds for blob
    // (opened directly, its parameters moved into the record) with these
    // begin parameters, as begin would; end it with operation_destroy. Null,
    // and a test failure, when the blob does not open or create refuses.
    operation_t *create_record(const Bytes &blob, uint32_t algorithm, uint32_t purpose, const km::ParamSet &params);

    // restart_instance - a fresh TA instance on the same Tee (new anchors, empty use log and token cache).
    void restart_instance();
    // mint_token - a 69-byte auth token MACed with the platform's boot seed.
    Bytes mint_token(uint64_t challenge, uint64_t user_id, uint64_t authenticator_id, uint32_t auth_type,
                     uint64_t timestamp_ms, uint8_t version = 0);

    // reference_command - a command taking a key reference in and writing
    // one output (15, 20); *out is resized to what the TA reported.
    Outcome reference_command(uint32_t cmd, const Bytes &reference, Bytes *out, size_t capacity);

    // A 256-bit HMAC-SHA-256 key with a 128-bit minimum MAC length.
    static km::ParamSet hmac_params(uint32_t key_bits = 256, uint32_t digest = 4, uint32_t min_mac = 128);
};

#endif
