/*
 * scale_rows.cpp - HMAC-SHA-256 of 64 bytes with one of 1, 100 and 10,000
 * keys. Through the TA each operation begins on the next of that many key
 * blobs, round-robin; on SoftHSM2 each finds the next of that many token
 * objects by its label, as PKCS#11 applications do, then signs. The TA's
 * time should not grow with the number of keys.
 */
#include <chrono>
#include <cstdio>
#include <memory>
#include <stdexcept>
#include <string>

#include <benchmark/benchmark.h>
#include <openssl/evp.h>

#include "keymaster_defs.h"
#include "rows.h"

namespace bench {
namespace {

constexpr size_t kMacBytes = 32;

// Key number i: distinct for every i below 2^32.
Bytes numbered_key(size_t i) {
    Bytes key(32);
    for (size_t j = 0; j < key.size(); ++j)
        key[j] = static_cast<uint8_t>(0xC0 + j);
    for (size_t j = 0; j < 4; ++j)
        key[j] = static_cast<uint8_t>(i >> (8 * j));
    return key;
}

Bytes openssl_mac(const Bytes &key, const Bytes &msg) {
    Bytes out(kMacBytes);
    size_t len = 0;
    if (!EVP_Q_mac(nullptr, "HMAC", nullptr, "SHA2-256", nullptr, key.data(), key.size(), msg.data(), msg.size(),
                   out.data(), out.size(), &len) ||
        len != out.size())
        throw std::runtime_error("EVP_Q_mac failed");
    return out;
}

// Setting up thousands of keys takes a while: say how far it got, every
// thousand keys once it has taken more than a second.
class Progress {
  public:
    Progress(std::string what, size_t total) : what_(std::move(what)), total_(total) {}
    void done(size_t n) const {
        if (n % 1000 == 0 && std::chrono::steady_clock::now() - start_ > std::chrono::seconds(1))
            std::fprintf(stderr, "km_bench: %s: %zu of %zu\n", what_.c_str(), n, total_);
    }

  private:
    std::string what_;
    size_t total_;
    std::chrono::steady_clock::time_point start_ = std::chrono::steady_clock::now();
};

// SoftHSM2's side: n labelled token objects on a token of their own (a
// search scans every object of its token, so rows must not share one);
// each run finds the next by label and signs with it. The objects stay on
// the token until the module's directory goes.
class FindAndSign {
  public:
    FindAndSign(const Hsm &hsm, const std::string &name, const std::vector<Bytes> &keys, const Bytes &msg)
        : token_(std::make_shared<p11::Token>(hsm->module(), name)), msg_(msg), out_(kMacBytes) {
        Progress progress(name + ": SoftHSM2 token objects", keys.size());
        for (size_t i = 0; i < keys.size(); ++i) {
            labels_.push_back("key-" + std::to_string(i));
            p11::secret_key(token_, CKK_GENERIC_SECRET, keys[i], p11::Storage::token, labels_[i])->release();
            progress.done(i + 1);
        }
    }

    // sign_with - the MAC with key i, found by its label.
    const Bytes &sign_with(size_t i) {
        out_.resize(kMacBytes);
        token_->sign(token_->find(labels_[i]), mechanism_, msg_, out_);
        return out_;
    }

    const Bytes &run() {
        const size_t i = next_;
        next_ = next_ + 1 == labels_.size() ? 0 : next_ + 1;
        return sign_with(i);
    }

  private:
    std::shared_ptr<p11::Token> token_;
    std::vector<std::string> labels_;
    Bytes msg_;
    Bytes out_;
    CK_MECHANISM mechanism_ = p11::mechanism(CKM_SHA256_HMAC);
    size_t next_ = 0;
};

Row scale_row(TaSession &ta, const Hsm &hsm, size_t n, const std::string &name) {
    const Bytes msg = message(64);
    std::vector<Bytes> keys, blobs, expected;
    Progress progress(name + ": TA key imports", n);
    for (size_t i = 0; i < n; ++i) {
        keys.push_back(numbered_key(i));
        blobs.push_back(ta.import_key(hmac_key_params(), keys.back()));
        expected.push_back(openssl_mac(keys.back(), msg));
        progress.done(i + 1);
    }
    auto op = std::make_shared<TaOperation>(ta, KM_PURPOSE_SIGN, blobs, hmac_begin_params(), msg);
    // One round over every key before timing, which leaves the next
    // operation on the first key again.
    for (size_t i = 0; i < n; ++i)
        if (op->run() != expected[i])
            throw std::runtime_error(name + ": the TA and OpenSSL disagree on key " + std::to_string(i));
    Row row = timed_row(
        name, 64, 0, [op] { benchmark::DoNotOptimize(op->run().data()); }, nullptr);
    if (!hsm)
        return row;
    try {
        auto finder = std::make_shared<FindAndSign>(hsm, name, keys, msg);
        // Thousands of searches would take long: the first, middle and last key.
        for (size_t i : {size_t{0}, n / 2, n - 1})
            if (finder->sign_with(i) != expected[i])
                throw std::runtime_error(name + ": SoftHSM2 and OpenSSL disagree on key " + std::to_string(i));
        row.softhsm_token = [finder] { benchmark::DoNotOptimize(finder->run().data()); };
    } catch (const p11::Failure &e) {
        std::fprintf(stderr, "km_bench: %s: SoftHSM2 n/a: %s\n", name.c_str(), e.what());
    }
    return row;
}

} // namespace

std::vector<Row> scale_rows(TaSession &ta, const Hsm &hsm) {
    std::vector<Row> rows = {
        scale_row(ta, hsm, 1, "sign_one_of_1_key"),
        scale_row(ta, hsm, 100, "sign_one_of_100_keys"),
        scale_row(ta, hsm, 10000, "sign_one_of_10000_keys"),
    };
    // Picking one blob of many must cost the TA next to nothing.
    rows.back().ta_baseline = rows.front().name;
    rows.back().ta_max_over_baseline = 1.10;
    return rows;
}

} // namespace bench
