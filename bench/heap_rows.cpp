/*
 * heap_rows.cpp - the TA heap with 16 operations of the largest keys held
 * at once: RSA-4096 PKCS#1 v1.5 signing without a digest, whose operations
 * each keep a buffer for the message, begun and left open while the heap
 * in use is read, then aborted.
 */
#include <stdexcept>
#include <string>

#include "keymaster_defs.h"
#include "rows.h"
#include "rsa_keys.h"

namespace bench {

std::vector<Row> heap_rows(TaSession &ta, const Hsm &) {
    constexpr int kLive = 16;
    constexpr size_t kLimit = 512 * 1024;
    // A fixed key: generating 4096-bit keys takes seconds.
    const Bytes pem(kRsa4096Pem, kRsa4096Pem + sizeof kRsa4096Pem - 1);
    km::ParamSet params;
    params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN)
        .add(KM_TAG_DIGEST, KM_DIGEST_NONE)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    const Bytes blob = ta.import_private_key(params, KM_ALGORITHM_RSA, pem);
    km::ParamSet begin;
    begin.add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN).add(KM_TAG_DIGEST, KM_DIGEST_NONE);
    TaOperation op(ta, KM_PURPOSE_SIGN, blob, begin, {});
    std::vector<uint32_t> handles;
    tee_host::heap::Stats held{};
    try {
        for (int i = 0; i < kLive; ++i)
            handles.push_back(op.begin());
        held = tee_host::heap::stats();
    } catch (...) {
        for (uint32_t h : handles)
            ta.abort(h);
        throw;
    }
    for (uint32_t h : handles)
        ta.abort(h);
    Row row{.name = "heap_16_live_rsa4096_sign"};
    row.heap_bytes = held.live_bytes;
    row.heap_target = kLimit;
    return {row};
}

} // namespace bench
