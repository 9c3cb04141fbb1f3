/*
 * rows.h - the benchmark table: each row is one operation run whole through
 * the TA and the same operation with OpenSSL on a preloaded key, and the
 * least fraction of OpenSSL's speed the TA must reach.
 *
 * Adding an algorithm: a function returning its rows (key made once in
 * setup, a TaOperation for the TA side, a closure over a preloaded OpenSSL
 * key for the raw side), listed in kRowGroups in main.cpp.
 */
#ifndef KM_BENCH_ROWS_H
#define KM_BENCH_ROWS_H

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "ta_session.h"

namespace bench {

struct Row {
    std::string algorithm;     // "hmac_sha256"
    std::string size;          // "64B": the message
    int64_t bytes;             // message bytes per operation, for the throughput column
    double target;             // least raw time / TA time
    std::function<void()> ta;  // one operation through the TA's commands
    std::function<void()> raw; // the same operation on OpenSSL directly
};

using RowGroup = std::vector<Row> (*)(TaSession &);

// message - n deterministic bytes, so runs are comparable.
Bytes message(size_t n);

// The HMAC-SHA-256 rows: 64 bytes and 64 KiB.
std::vector<Row> hmac_rows(TaSession &ta);
// The RSA-2048 rows: PKCS#1 v1.5 and PSS over SHA-256, sign and verify.
std::vector<Row> rsa_rows(TaSession &ta);
// The ECDSA rows: P-256 SHA-256 sign and verify, P-384 SHA-384 sign, of 64 bytes.
std::vector<Row> ec_rows(TaSession &ta);
// The AES rows: 256-bit GCM of 1 MiB and 1 KiB, 128-bit CBC with PKCS#7 of 1 MiB.
std::vector<Row> aes_rows(TaSession &ta);
// HMAC-SHA-256 of 64 bytes through kmd's socket beside the embedded TA.
std::vector<Row> kmd_rows(TaSession &ta);

} // namespace bench

#endif
