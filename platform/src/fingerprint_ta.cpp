/*
 * fingerprint_ta.cpp - the fingerprint TA stand-in. On a device it owns the
 * sensor and, after a match, tells the Keymaster TA which fingerprint it
 * was. Here the host asks it to, and it does what the real one does: it
 * opens a TA-to-TA session through the GP client API, so the Keymaster TA
 * sees its UUID and the trusted-app login, and stamps the notification
 * with the TEE system time.
 */
#include <cstring>
#include <mutex>

#include "platform_internal.h"

namespace tee_host::fingerprint {
namespace {

constexpr uint32_t kCmdSend = 1;

// What the next send carries. Host callers hold the mutex for the whole
// call, so the TA reads a request nobody else changes.
struct Request {
    TEE_UUID target{};
    std::vector<uint8_t> bytes;
    bool stamp_fid = false; // build the notification now, for fid
    uint32_t fid = 0;
    bool impersonate = false; // open the session as `client` instead
    TEE_Identity client{};
};

std::mutex &request_mu() {
    static std::mutex mu;
    return mu;
}
Request &request() {
    static Request r;
    return r;
}

TEE_Result invoke_notify(TEE_TASessionHandle session, std::vector<uint8_t> &bytes) {
    TEE_Param params[4] = {};
    params[1].memref.buffer = bytes.empty() ? nullptr : bytes.data();
    params[1].memref.size = static_cast<uint32_t>(bytes.size());
    const uint32_t types =
        TEE_PARAM_TYPES(TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
    uint32_t origin = 0;
    return TEE_InvokeTACommand(session, TEE_TIMEOUT_INFINITE, kNotifyCommand, types, params, &origin);
}

class FingerprintTa final : public NativeTa {
  public:
    explicit FingerprintTa(const TEE_UUID &uuid) : uuid_(uuid) {}
    TEE_UUID uuid() const override { return uuid_; }
    TEE_Result open_session(const TEE_Identity &, void **ctx) override {
        *ctx = nullptr;
        return TEE_SUCCESS;
    }
    void close_session(void *) override {}

    TEE_Result invoke(void *, uint32_t cmd, uint32_t, TEE_Param[4]) override {
        if (cmd != kCmdSend)
            return TEE_ERROR_NOT_SUPPORTED;
        Request &r = request();
        std::vector<uint8_t> bytes = r.bytes;
        if (r.stamp_fid) {
            TEE_Time now{};
            TEE_GetSystemTime(&now);
            bytes = notification(0, r.fid, uint64_t{now.seconds} * 1000 + now.millis);
        }
        if (r.impersonate) {
            // Not a GP call: no TA can claim another identity through the API.
            uint32_t session = 0;
            TEE_Result res = Tee::current()->open_session(r.target, r.client, 0, nullptr, &session);
            if (res != TEE_SUCCESS)
                return res;
            TEE_Result out =
                invoke_notify(reinterpret_cast<TEE_TASessionHandle>(static_cast<uintptr_t>(session)), bytes);
            Tee::current()->close_session(session);
            return out;
        }
        TEE_TASessionHandle session = nullptr;
        uint32_t origin = 0;
        TEE_Result res = TEE_OpenTASession(&r.target, TEE_TIMEOUT_INFINITE, 0, nullptr, &session, &origin);
        if (res != TEE_SUCCESS)
            return res;
        res = invoke_notify(session, bytes);
        TEE_CloseTASession(session);
        return res;
    }

  private:
    TEE_UUID uuid_;
};

// Runs one send through the fingerprint TA that the factory store names,
// installing it on first use under that UUID.
TEE_Result run(Request r) {
    Tee *tee = Tee::current();
    if (!tee)
        detail::panic("fingerprint notification with no Tee alive");
    TEE_UUID uuid{};
    if (!provisioning::fingerprint_ta_uuid(tee->config().state_dir, &uuid))
        return TEE_ERROR_ITEM_NOT_FOUND;
    std::lock_guard<std::mutex> lock(request_mu());
    if (!tee->has_ta(uuid))
        tee->install_native_ta(std::make_shared<FingerprintTa>(uuid));
    request() = std::move(r);
    uint32_t session = 0;
    TEE_Result res = tee->open_session(uuid, normal_world_identity(), 0, nullptr, &session);
    if (res != TEE_SUCCESS)
        return res;
    res = tee->invoke(session, kCmdSend, 0, nullptr);
    tee->close_session(session);
    request() = Request{};
    return res;
}

} // namespace

std::vector<uint8_t> notification(uint32_t version, uint32_t fid, uint64_t timestamp_ms) {
    std::vector<uint8_t> out;
    for (int i = 0; i < 4; ++i)
        out.push_back(static_cast<uint8_t>(version >> (8 * i)));
    for (int i = 0; i < 4; ++i)
        out.push_back(static_cast<uint8_t>(fid >> (8 * i)));
    for (int i = 0; i < 8; ++i)
        out.push_back(static_cast<uint8_t>(timestamp_ms >> (8 * i)));
    return out;
}

TEE_Result notify(const TEE_UUID &target, uint32_t fid) {
    Request r;
    r.target = target;
    r.stamp_fid = true;
    r.fid = fid;
    return run(std::move(r));
}

TEE_Result send(const TEE_UUID &target, const std::vector<uint8_t> &bytes) {
    Request r;
    r.target = target;
    r.bytes = bytes;
    return run(std::move(r));
}

TEE_Result send_as(const TEE_UUID &target, const TEE_Identity &client, const std::vector<uint8_t> &bytes) {
    Request r;
    r.target = target;
    r.bytes = bytes;
    r.impersonate = true;
    r.client = client;
    return run(std::move(r));
}

} // namespace tee_host::fingerprint
