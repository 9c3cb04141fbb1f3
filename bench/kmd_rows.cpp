/*
 * kmd_rows.cpp - HMAC-SHA-256 of 64 bytes through kmd beside the same
 * operation on the TEE in this process: the "ta" side goes over kmd's
 * socket, the "raw" side is the embedded TA, so the ratio is what the
 * socket leaves of the embedded speed. Both sides send the same three
 * commands with requests built once.
 */
#include <chrono>
#include <csignal>
#include <filesystem>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include "keymaster_defs.h"
#include "km/socket_transport.h"
#include "rows.h"
#include "ta_entry.h"

extern char **environ;

namespace bench {
namespace {

// A command as both sides send it: (value a, request, response buffer).
using Invoke = std::function<Reply(uint32_t command, uint32_t a, const Bytes &in, Bytes &out)>;

// A kmd process on a state directory and socket of its own, stopped with
// SIGTERM when the last row holding it goes.
class KmdServer {
  public:
    KmdServer() : dir_("km-bench-kmd") {
        socket_ = dir_.path() / "kmd.sock";
        std::string state = (dir_.path() / "state").string(), sock = socket_.string();
        std::string args[] = {KMD_PATH, "--foreground", "--log-level", "none", "--state", state, "--socket", sock};
        char *argv[] = {args[0].data(), args[1].data(), args[2].data(), args[3].data(), args[4].data(),
                        args[5].data(), args[6].data(), args[7].data(), nullptr};
        if (posix_spawn(&pid_, KMD_PATH, nullptr, nullptr, argv, environ) != 0)
            throw std::runtime_error("cannot start " KMD_PATH);
        // Ready once its socket takes a session.
        const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        for (;;) {
            transport_ = std::make_unique<km::SocketTransport>(socket_);
            if (transport_->open() == TEE_SUCCESS)
                return;
            int status = 0;
            const bool ended = waitpid(pid_, &status, WNOHANG) == pid_;
            if (ended || std::chrono::steady_clock::now() > end) {
                if (ended)
                    pid_ = -1;
                stop();
                throw std::runtime_error("kmd did not start");
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
    }
    ~KmdServer() { stop(); }
    KmdServer(const KmdServer &) = delete;
    KmdServer &operator=(const KmdServer &) = delete;

    Reply invoke(uint32_t command, uint32_t a, const Bytes &in, Bytes &out) {
        return call_with([&](uint32_t types, TEE_Param *p) { return transport_->invoke(command, types, p); }, a, in,
                         out);
    }

  private:
    void stop() {
        transport_.reset();
        if (pid_ > 0) {
            kill(pid_, SIGTERM);
            int status = 0;
            waitpid(pid_, &status, 0);
        }
    }

    TempDir dir_;
    std::filesystem::path socket_;
    pid_t pid_ = -1;
    std::unique_ptr<km::SocketTransport> transport_;
};

Bytes two_fields(const Bytes &first, const Bytes &second) {
    Bytes out;
    km::put_lv(out, first);
    km::put_lv(out, second);
    return out;
}

// One HMAC over msg through `invoke`: begin, update, finish; the MAC.
class MacOperation {
  public:
    MacOperation(Invoke invoke, const Bytes &blob, const Bytes &msg) : invoke_(std::move(invoke)), response_(4096) {
        const Bytes none = km::ParamSet().serialize();
        begin_ = two_fields(blob, hmac_begin_params().serialize());
        update_ = two_fields(msg, none);
        finish_ = two_fields({}, none);
    }
    Bytes run() {
        Reply r = invoke_(KM_CMD_BEGIN, KM_PURPOSE_SIGN, begin_, response_);
        if (!r.ok())
            throw TaFailure("begin", r);
        const uint32_t handle = r.b;
        r = invoke_(KM_CMD_UPDATE, handle, update_, response_);
        if (!r.ok())
            throw TaFailure("update", r);
        r = invoke_(KM_CMD_FINISH, handle, finish_, response_);
        if (!r.ok() || r.out_len < 4 || km::get_u32(response_.data()) + 4 > r.out_len)
            throw TaFailure("finish", r);
        return Bytes(response_.begin() + 4, response_.begin() + 4 + km::get_u32(response_.data()));
    }

  private:
    Invoke invoke_;
    Bytes begin_, update_, finish_, response_;
};

Bytes import_over(const Invoke &invoke, const km::ParamSet &params, const Bytes &material) {
    Bytes in;
    km::put_lv(in, params.serialize());
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(4096);
    Reply r = invoke(KM_CMD_IMPORT_KEY, 0, in, out);
    if (!r.ok() || r.out_len < 4 || km::get_u32(out.data()) + 4 > r.out_len)
        throw TaFailure("import_key", r);
    return Bytes(out.begin() + 4, out.begin() + 4 + km::get_u32(out.data()));
}

} // namespace

std::vector<Row> kmd_rows(TaSession &ta, const Hsm &) {
    auto kmd = std::make_shared<KmdServer>();
    Invoke through_kmd = [kmd](uint32_t c, uint32_t a, const Bytes &in, Bytes &out) {
        return kmd->invoke(c, a, in, out);
    };
    Invoke embedded = [&ta](uint32_t c, uint32_t a, const Bytes &in, Bytes &out) { return ta.invoke(c, a, in, out); };
    const Bytes key(32, 0xA5);
    const km::ParamSet params = hmac_key_params();
    const Bytes msg = message(64);
    auto over_kmd = std::make_shared<MacOperation>(through_kmd, import_over(through_kmd, params, key), msg);
    auto in_process = std::make_shared<MacOperation>(embedded, import_over(embedded, params, key), msg);
    if (over_kmd->run() != in_process->run())
        throw std::runtime_error("hmac_sha256_kmd 64B: kmd and the embedded TA disagree");
    // Informational: embedded time / time through kmd.
    return {timed_row(
        "hmac_sha256_kmd_64B", 64, 0, [over_kmd] { benchmark::DoNotOptimize(over_kmd->run().data()); },
        [in_process] { benchmark::DoNotOptimize(in_process->run().data()); })};
}

} // namespace bench
