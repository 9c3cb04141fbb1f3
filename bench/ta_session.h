/*
 * ta_session.h - the Keymaster TA on an in-process TEE for benchmarks, and
 * a whole operation (begin, update, finish) with its requests built once so
 * that a timed iteration is only the three commands.
 */
#ifndef KM_BENCH_TA_SESSION_H
#define KM_BENCH_TA_SESSION_H

#include <cstdint>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "km/param_set.h"
#include "tee_host.h"

namespace bench {

using Bytes = std::vector<uint8_t>;

// What a command left in params[0] and how much it wrote to params[2].
struct Reply {
    TEE_Result res = TEE_SUCCESS;
    int32_t error = 0; // params[0].value.a: the Keymaster error
    uint32_t b = 0;    // params[0].value.b
    uint32_t out_len = 0;
    bool ok() const { return res == TEE_SUCCESS && error == 0; }
};

// call_with - runs one command through `send` (which takes the types word
// and the parameters) with value a in params[0], the request in params[1]
// and the response buffer in params[2]; out keeps its size.
template <typename Send> Reply call_with(Send &&send, uint32_t a, const Bytes &in, Bytes &out) {
    TEE_Param p[4] = {};
    p[0].value.a = a;
    // The TA only reads an input memref; the API type is not const.
    p[1].memref.buffer = const_cast<uint8_t *>(in.data());
    p[1].memref.size = static_cast<uint32_t>(in.size());
    p[2].memref.buffer = out.data();
    p[2].memref.size = static_cast<uint32_t>(out.size());
    Reply r;
    r.res = send(TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_MEMREF_OUTPUT,
                                 TEE_PARAM_TYPE_NONE),
                 p);
    r.error = static_cast<int32_t>(p[0].value.a);
    r.b = p[0].value.b;
    r.out_len = p[2].memref.size;
    return r;
}

// Thrown when the TA refuses: a benchmark of a failing operation means nothing.
class TaFailure : public std::runtime_error {
  public:
    TaFailure(const std::string &what, const Reply &r);
};

// A fresh directory prefix-XXXXXX in parent (by default the system's
// temporary directory), removed with all it holds on destruction.
class TempDir {
  public:
    explicit TempDir(const std::string &prefix, const std::filesystem::path &parent = {});
    ~TempDir();
    TempDir(const TempDir &) = delete;
    TempDir &operator=(const TempDir &) = delete;
    const std::filesystem::path &path() const { return path_; }

  private:
    std::filesystem::path path_;
};

// A fresh TEE with a temporary state directory, silent, with one
// normal-world session into the Keymaster TA. One per process.
class TaSession {
  public:
    TaSession();
    ~TaSession();
    TaSession(const TaSession &) = delete;
    TaSession &operator=(const TaSession &) = delete;

    // invoke - a command taking (value a/b, request, response buffer);
    // out keeps its size, the reply says how much was written.
    Reply invoke(uint32_t command, uint32_t a, const Bytes &in, Bytes &out);

    // import_key - the key blob for this material; throws when refused.
    Bytes import_key(const km::ParamSet &params, const Bytes &material);

    // import_private_key - import_key of an RSA or EC private key file (PEM
    // or DER, by algorithm) converted by the client library; throws when it
    // will not convert or the TA refuses it.
    Bytes import_private_key(const km::ParamSet &params, uint32_t algorithm, const Bytes &key_file);

    // abort - ends the operation `handle`; throws when refused.
    void abort(uint32_t handle);

  private:
    TempDir state_dir_;
    std::unique_ptr<tee_host::Tee> tee_;
    uint32_t session_ = 0;
};

// One operation, repeatable: the begin, update and finish requests are
// serialized once, so run() costs only the commands. Given several key
// blobs, each run begins with the next one, round-robin.
class TaOperation {
  public:
    // signature is what finish carries (verification); empty otherwise.
    TaOperation(TaSession &ta, uint32_t purpose, const Bytes &blob, const km::ParamSet &begin_params,
                const Bytes &input, const Bytes &signature = {}, size_t output_capacity = 4096);
    TaOperation(TaSession &ta, uint32_t purpose, const std::vector<Bytes> &blobs, const km::ParamSet &begin_params,
                const Bytes &input, const Bytes &signature = {}, size_t output_capacity = 4096);

    // begin - begins on the next key; the operation handle, which the
    // caller finishes or aborts. Throws when refused.
    uint32_t begin();

    // run - begin, update until all input is taken, finish. Returns the
    // update outputs followed by the finish output; throws when refused.
    const Bytes &run();

  private:
    void update_all(uint32_t handle);

    TaSession &ta_;
    uint32_t purpose_;
    Bytes input_;
    std::vector<Bytes> begin_requests_;
    size_t next_ = 0;
    Bytes update_request_;
    Bytes finish_request_;
    Bytes response_;
    Bytes output_;
};

} // namespace bench

#endif
