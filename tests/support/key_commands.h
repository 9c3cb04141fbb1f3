/*
 * key_commands.h - the key commands as a normal-world caller sends them,
 * for tests: requests built with km::ParamSet, real TEE_Param arrays.
 */
#ifndef KEY_COMMANDS_H
#define KEY_COMMANDS_H

#include "km/param_set.h"
#include "ta_fixture.h"

struct Outcome {
    TEE_Result res;
    int32_t error;
    bool ok() const { return res == TEE_SUCCESS && error == 0; }
};

// The three-field key reference of the characteristics and export commands.
Bytes key_reference(const Bytes &blob, const Bytes &app_id = {}, const Bytes &app_data = {});

class KeyTest : public TaTest {
protected:
    // generate - command 13; *blob is resized to what the TA wrote.
    Outcome generate(const km::ParamSet &params, Bytes *blob, size_t capacity = 4096);
    // import - command 19; splits the response into blob and characteristics.
    Outcome import(const km::ParamSet &params, const Bytes &material, Bytes *blob, Bytes *chars = nullptr,
                   size_t capacity = 4096);
    Outcome character_size(const Bytes &reference, uint32_t *size);
    Outcome characteristics(const Bytes &reference, Bytes *out, size_t capacity = 4096);
    Outcome export_key(const Bytes &reference, Bytes *out, size_t capacity = 4096);
    Outcome delete_key(const Bytes &blob);
    Outcome delete_all();
    // open_raw - command 27 on a session; *payload receives what came back.
    TEE_Result open_raw(uint32_t session, const Bytes &blob, Bytes *payload);

    // A 256-bit HMAC-SHA-256 key with a 128-bit minimum MAC length.
    static km::ParamSet hmac_params(uint32_t key_bits = 256, uint32_t digest = 4, uint32_t min_mac = 128);
};

#endif
