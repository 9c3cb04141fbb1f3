/*
 * blob_open_fuzz.cpp - opening key blobs past the GCM tag. The input is a
 * payload, sealed as the TA seals blobs (blob_seal.h), so that the parsing
 * after decryption sees every shape of lengths, key data and parameter
 * bytes. open_key takes exactly the payloads the model takes (u32 L, L
 * bytes, u32 P, P bytes of a readable parameter set, anything after), hands
 * back their key data and parameters, and holds nothing when it refuses;
 * open_key_raw gives back the payload; and a blob with any one byte
 * changed does not open.
 */
#include <cstring>

#include "blob_seal.h"
#include "fuzz_support.h"
#include "marshal.h"

namespace {

enum class Expect { ok, short_payload, bad_params };

// The model of the payload: key data, the parameter bytes and their set.
Expect model(const Bytes &payload, Bytes *key_data, std::optional<km::ParamSet> *params) {
    size_t pos = 0;
    auto lv = [&](Bytes *out) {
        if (payload.size() - pos < 4)
            return false;
        const size_t n = km::get_u32(payload.data() + pos);
        pos += 4;
        if (payload.size() - pos < n)
            return false;
        out->assign(payload.begin() + static_cast<long>(pos), payload.begin() + static_cast<long>(pos + n));
        pos += n;
        return true;
    };
    Bytes ser;
    if (!lv(key_data) || !lv(&ser))
        return Expect::short_payload;
    *params = km::ParamSet::parse(ser.data(), ser.size());
    return *params ? Expect::ok : Expect::bad_params;
}

void check_open(const Bytes &payload, const Bytes &blob) {
    Bytes want_data;
    std::optional<km::ParamSet> want_params;
    const Expect e = model(payload, &want_data, &want_params);
    uint8_t *key_data = reinterpret_cast<uint8_t *>(1);
    uint32_t key_data_len = 7;
    keymaster_key_param_set_t params{};
    int32_t error = 12345;
    const TEE_Result res =
        open_key(blob.data(), static_cast<uint32_t>(blob.size()), &key_data, &key_data_len, &params, &error);
    if (res != TEE_SUCCESS || error != KM_ERROR_OK) {
        FUZZ_CHECK(key_data == nullptr && key_data_len == 0 && params.params == nullptr && params.length == 0,
                   "a refused blob left outputs set");
        if (blob.size() <= kBlobHeaderSize)
            FUZZ_CHECK(res == TEE_SUCCESS && error == KM_ERROR_INVALID_KEY_BLOB, "a short blob: 0x%08x, %d", res,
                       error);
        else if (e == Expect::short_payload)
            FUZZ_CHECK(res == TEE_ERROR_GENERIC, "a truncated payload: 0x%08x, %d", res, error);
        else if (e == Expect::bad_params)
            FUZZ_CHECK(res == TEE_SUCCESS && error == KM_ERROR_INVALID_ARGUMENT, "unreadable parameters: 0x%08x, %d",
                       res, error);
        else
            fuzz_finding("a good payload refused: 0x%08x, %d", res, error);
        return;
    }
    FUZZ_CHECK(blob.size() > kBlobHeaderSize && e == Expect::ok, "a payload the model refuses opened");
    FUZZ_CHECK(key_data_len == want_data.size() &&
                   (want_data.empty() || std::memcmp(key_data, want_data.data(), want_data.size()) == 0),
               "key data differs");
    FUZZ_CHECK(params.length == want_params->params().size(), "%u parameters, the model %zu", params.length,
               want_params->params().size());
    for (uint32_t i = 0; i < params.length; ++i)
        FUZZ_CHECK(params.params[i].tag == want_params->params()[i].tag, "parameter %u differs", i);
    ta_free(key_data);
    key_param_set_release(&params);
}

void check_raw(const Bytes &payload, Bytes blob) {
    uint32_t len = static_cast<uint32_t>(blob.size());
    const TEE_Result res = open_key_raw(blob.data(), &len);
    if (blob.size() <= kBlobHeaderSize) {
        FUZZ_CHECK(res == TEE_ERROR_BAD_PARAMETERS, "a short raw blob: 0x%08x", res);
        return;
    }
    FUZZ_CHECK(res == TEE_SUCCESS && len == payload.size() &&
                   std::memcmp(blob.data(), payload.data(), payload.size()) == 0,
               "open_key_raw does not give back the payload: 0x%08x", res);
}

void check_changed(Bytes blob, size_t at, uint8_t x) {
    blob[at] ^= x;
    uint8_t *key_data = nullptr;
    uint32_t key_data_len = 0;
    keymaster_key_param_set_t params{};
    int32_t error = 0;
    const TEE_Result res =
        open_key(blob.data(), static_cast<uint32_t>(blob.size()), &key_data, &key_data_len, &params, &error);
    FUZZ_CHECK(res != TEE_SUCCESS || error != KM_ERROR_OK, "a blob with byte %zu changed opened", at);
    FUZZ_CHECK(key_data == nullptr && params.params == nullptr, "a changed blob left outputs set");
    uint32_t len = static_cast<uint32_t>(blob.size());
    FUZZ_CHECK(open_key_raw(blob.data(), &len) != TEE_SUCCESS, "a blob with byte %zu changed opened raw", at);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    HeapScope heap;
    FuzzInput in(data, size);
    const uint8_t mode = in.u8();
    const uint16_t at = in.u16();
    const Bytes payload = in.rest();
    const auto sealed = seal_payload(payload);
    FUZZ_CHECK(sealed.has_value(), "the payload could not be sealed");
    check_open(payload, *sealed);
    if (mode & 1)
        check_raw(payload, *sealed);
    if (mode & 2)
        check_changed(*sealed, at % sealed->size(), static_cast<uint8_t>(1 + (mode >> 2) % 255));
    // Cut short: the tag check fails, or the blob is too short to try.
    if (mode & 0x80) {
        Bytes cut(sealed->begin(), sealed->begin() + static_cast<long>(at % sealed->size()));
        uint8_t *key_data = nullptr;
        uint32_t key_data_len = 0;
        keymaster_key_param_set_t params{};
        int32_t error = 0;
        const TEE_Result res = open_key(cut.empty() ? sealed->data() : cut.data(), static_cast<uint32_t>(cut.size()),
                                        &key_data, &key_data_len, &params, &error);
        FUZZ_CHECK(res != TEE_SUCCESS || error != KM_ERROR_OK, "a blob cut to %zu bytes opened", cut.size());
    }
    return 0;
}
