/*
 * rows.h - the benchmark table: each row is one operation run whole through
 * the TA, the same operation with OpenSSL on a preloaded key and, where
 * SoftHSM2 is installed, through its PKCS#11 interface; with the least
 * fraction of OpenSSL's speed and the least multiple of SoftHSM2's speed
 * the TA must reach.
 *
 * Adding an algorithm: a function returning its rows (key made once in
 * setup, a TaOperation for the TA side, a closure over a preloaded OpenSSL
 * key for the raw side, closures over SoftHSM2 objects for its sides, put
 * together by timed_row), listed in
 * kRowGroups in main.cpp.
 */
#ifndef KM_BENCH_ROWS_H
#define KM_BENCH_ROWS_H

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "softhsm.h"
#include "ta_session.h"

namespace bench {

using Side = std::function<void()>; // one whole operation; empty: no such side

struct Row {
    std::string name{};        // "hmac_sha256_64B": benchmark names, summary and JSON
    int64_t bytes = 0;         // message bytes per operation, for the throughput column
    double target_raw = 0;     // least raw time / TA time; 0: none
    double target_softhsm = 0; // least SoftHSM2 (session objects) time / TA time; 0: none
    Side ta{};                 // through the TA's commands
    Side raw{};                // on OpenSSL directly
    Side softhsm{};            // SoftHSM2 with session objects
    Side softhsm_token{};      // SoftHSM2 with token objects
    // Rows whose TA time is bounded by another row's: the most this row's
    // TA time may be as a multiple of `ta_baseline`'s.
    std::string ta_baseline{};
    double ta_max_over_baseline = 0;
    // Heap rows time nothing: the TA heap in use, measured in setup, and
    // the most it may be.
    std::optional<size_t> heap_bytes{};
    size_t heap_target = 0;
};

// The SoftHSM2 token the rows put their keys on; null without SoftHSM2.
using Hsm = std::shared_ptr<p11::Token>;

using RowGroup = std::vector<Row> (*)(TaSession &, const Hsm &);

// message - n deterministic bytes, so runs are comparable.
Bytes message(size_t n);

// How a row makes its SoftHSM2 side for session or for token objects.
using SoftHsmSide = std::function<Side(p11::Storage)>;

// timed_row - a row timing ta against OpenSSL's raw and, when the row has
// a SoftHSM2 target and hsm is there, SoftHSM2's two sides from make. A
// mechanism SoftHSM2 lacks leaves those sides empty ("n/a").
Row timed_row(const std::string &name, int64_t bytes, double target_raw, Side ta, Side raw, double target_softhsm = 0,
              const Hsm &hsm = nullptr, const SoftHsmSide &make = {});

// The HMAC-SHA-256 key every HMAC row imports (256-bit MACs, signing
// only, no authentication), and the begin parameters of its MAC.
km::ParamSet hmac_key_params();
km::ParamSet hmac_begin_params();

// The HMAC-SHA-256 rows: 64 bytes and 64 KiB.
std::vector<Row> hmac_rows(TaSession &ta, const Hsm &hsm);
// The RSA-2048 rows: PKCS#1 v1.5 and PSS over SHA-256, sign and verify.
std::vector<Row> rsa_rows(TaSession &ta, const Hsm &hsm);
// The ECDSA rows: P-256 SHA-256 sign and verify, P-384 SHA-384 sign, of 64 bytes.
std::vector<Row> ec_rows(TaSession &ta, const Hsm &hsm);
// The AES rows: 256-bit GCM of 1 MiB and 1 KiB, 128-bit CBC with PKCS#7 of 1 MiB.
std::vector<Row> aes_rows(TaSession &ta, const Hsm &hsm);
// HMAC-SHA-256 of 64 bytes through kmd's socket beside the embedded TA.
std::vector<Row> kmd_rows(TaSession &ta, const Hsm &hsm);
// HMAC-SHA-256 of 64 bytes with one of 1, 100 and 10,000 keys.
std::vector<Row> scale_rows(TaSession &ta, const Hsm &hsm);
// The TA heap with 16 operations of the largest keys live at once.
std::vector<Row> heap_rows(TaSession &ta, const Hsm &hsm);

} // namespace bench

#endif
