/*
 * provisioning_ta.cpp - the provisioning TA stand-in: the device's factory
 * store of SOTER material, answering over TA-to-TA sessions.
 *
 * The store is one file, <state>/provisioning/factory.bin: the magic
 * "KMFACT01", then three u32-length-prefixed (little-endian) fields: the
 * key answer (a TLV run of tags 17 to 24), the SOTER property answer (tags
 * 0x1835 to 0x1837) and the CPU identifier. It is written through a
 * temporary file (write, fsync, rename, fsync the directory), readable by
 * its owner only, since it holds the attestation private key.
 */
#include <cerrno>
#include <cstring>
#include <deque>
#include <fcntl.h>
#include <fstream>
#include <iterator>
#include <map>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/crypto.h>

#include "platform_internal.h"

namespace fs = std::filesystem;

namespace tee_host {

const TEE_UUID kProvisioningTaUuid = {0x5d0c3b2a, 0x8e47, 0x4f19, {0xb6, 0x3d, 0x21, 0x7e, 0x94, 0xc0, 0x5a, 0x01}};

namespace provisioning {
namespace {

constexpr char kMagic[8] = {'K', 'M', 'F', 'A', 'C', 'T', '0', '1'};
constexpr uint32_t kCmdGetKey = 2;
constexpr uint32_t kCmdGetData = 5;
constexpr uint32_t kCmdGetProperty = 12;
constexpr size_t kMaxCpuId = 64;
constexpr size_t kMaxTlvValue = 0xFFFF;

struct Overrides {
    std::mutex mu;
    std::map<Request, std::deque<Answer>> next;
    std::map<Request, Answer> always;
    std::map<Request, size_t> served;
};

Overrides &overrides() {
    static Overrides o;
    return o;
}

fs::path store_dir(const fs::path &state_dir) {
    return state_dir / "provisioning";
}
fs::path store_file(const fs::path &state_dir) {
    return store_dir(state_dir) / "factory.bin";
}

void put_u16(std::vector<uint8_t> &out, size_t v) {
    out.push_back(static_cast<uint8_t>(v));
    out.push_back(static_cast<uint8_t>(v >> 8));
}

void put_u32(std::vector<uint8_t> &out, size_t v) {
    for (int i = 0; i < 4; ++i)
        out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void put_tlv(std::vector<uint8_t> &out, uint16_t type, const uint8_t *p, size_t n) {
    put_u16(out, type);
    put_u16(out, n);
    out.insert(out.end(), p, p + n);
}

void put_tlv(std::vector<uint8_t> &out, uint16_t type, const std::vector<uint8_t> &v) {
    put_tlv(out, type, v.data(), v.size());
}

void put_lv(std::vector<uint8_t> &out, const std::vector<uint8_t> &v) {
    put_u32(out, v.size());
    out.insert(out.end(), v.begin(), v.end());
}

bool take_lv(const std::vector<uint8_t> &in, size_t *pos, std::vector<uint8_t> *out) {
    if (in.size() - *pos < 4)
        return false;
    size_t n = 0;
    for (int i = 0; i < 4; ++i)
        n |= size_t{in[*pos + i]} << (8 * i);
    *pos += 4;
    if (in.size() - *pos < n)
        return false;
    out->assign(in.begin() + static_cast<std::ptrdiff_t>(*pos), in.begin() + static_cast<std::ptrdiff_t>(*pos + n));
    *pos += n;
    return true;
}

// What the store holds, as the three answers.
struct Stored {
    std::vector<uint8_t> key;
    std::vector<uint8_t> properties;
    std::vector<uint8_t> cpu_id;
};

void wipe(std::vector<uint8_t> &v) {
    if (!v.empty())
        OPENSSL_cleanse(v.data(), v.size());
    v.clear();
}

// load - the store of state_dir: TEE_ERROR_ITEM_NOT_FOUND when there is
// none, TEE_ERROR_CORRUPT_OBJECT when it does not parse.
TEE_Result load(const fs::path &state_dir, Stored *out) {
    std::error_code ec;
    if (!fs::exists(store_file(state_dir), ec))
        return TEE_ERROR_ITEM_NOT_FOUND;
    std::ifstream in(store_file(state_dir), std::ios::binary);
    if (!in)
        return TEE_ERROR_STORAGE_NOT_AVAILABLE;
    std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    size_t pos = sizeof kMagic;
    bool ok = bytes.size() >= sizeof kMagic && std::memcmp(bytes.data(), kMagic, sizeof kMagic) == 0 &&
              take_lv(bytes, &pos, &out->key) && take_lv(bytes, &pos, &out->properties) &&
              take_lv(bytes, &pos, &out->cpu_id) && pos == bytes.size();
    wipe(bytes);
    if (!ok) {
        wipe(out->key);
        return TEE_ERROR_CORRUPT_OBJECT;
    }
    return TEE_SUCCESS;
}

// write_atomically - bytes become the file at path, or nothing changes.
// Each process writes its own temporary: several may provision at once.
bool write_atomically(const fs::path &path, const std::vector<uint8_t> &bytes) {
    fs::path tmp = path;
    tmp += ".tmp." + std::to_string(::getpid());
    return detail::atomic_write(path, tmp, bytes.data(), bytes.size(), false) == 0;
}

// Which property a 4-byte request asks for; false for anything else.
bool property_request(const TEE_Param &p, Request *which) {
    if (p.memref.size != 4 || !p.memref.buffer)
        return false;
    const auto *b = static_cast<const uint8_t *>(p.memref.buffer);
    uint16_t first = static_cast<uint16_t>(b[0] | b[1] << 8);
    uint16_t second = static_cast<uint16_t>(b[2] | b[3] << 8);
    if (first == 0x1834 && second == 0x0000)
        *which = Request::soter_properties;
    else if (first == 0x1734 && second == 0x173A)
        *which = Request::cpu_id;
    else if (first == 0x1934 && second == 0x1936)
        *which = Request::device_id;
    else
        return false;
    return true;
}

// The device identifier: the TEE's device UUID in its canonical byte order.
std::vector<uint8_t> device_id_bytes() {
    const TEE_UUID &u = detail::globals().device_id;
    std::vector<uint8_t> out;
    for (int i = 3; i >= 0; --i)
        out.push_back(static_cast<uint8_t>(u.timeLow >> (8 * i)));
    out.push_back(static_cast<uint8_t>(u.timeMid >> 8));
    out.push_back(static_cast<uint8_t>(u.timeMid));
    out.push_back(static_cast<uint8_t>(u.timeHiAndVersion >> 8));
    out.push_back(static_cast<uint8_t>(u.timeHiAndVersion));
    out.insert(out.end(), u.clockSeqAndNode, u.clockSeqAndNode + 8);
    return out;
}

class ProvisioningTa final : public NativeTa {
  public:
    explicit ProvisioningTa(fs::path state_dir) : state_dir_(std::move(state_dir)) {}

    TEE_UUID uuid() const override { return kProvisioningTaUuid; }

    TEE_Result open_session(const TEE_Identity &client, void **ctx) override {
        *ctx = nullptr;
        // Only trusted applications reach the factory store.
        return client.login == TEE_LOGIN_TRUSTED_APP ? TEE_SUCCESS : TEE_ERROR_ACCESS_DENIED;
    }

    void close_session(void *) override {}

    TEE_Result invoke(void *, uint32_t cmd, uint32_t types, TEE_Param params[4]) override {
        constexpr uint32_t kBufferTypes = TEE_PARAM_TYPES(TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_VALUE_OUTPUT,
                                                          TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
        constexpr uint32_t kPropertyTypes = TEE_PARAM_TYPES(TEE_PARAM_TYPE_MEMREF_INPUT, TEE_PARAM_TYPE_MEMREF_OUTPUT,
                                                            TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);
        Request which = Request::key;
        if (cmd == kCmdGetKey || cmd == kCmdGetData) {
            if (types != kBufferTypes)
                return TEE_ERROR_BAD_PARAMETERS;
            which = cmd == kCmdGetKey ? Request::key : Request::data;
            Answer a = answer_for(which);
            if (a.result != TEE_SUCCESS)
                return a.result;
            params[1].value.a = static_cast<uint32_t>(a.bytes.size());
            return deliver(a, params[0]);
        }
        if (cmd == kCmdGetProperty) {
            if (types != kPropertyTypes || !property_request(params[0], &which))
                return TEE_ERROR_BAD_PARAMETERS;
            Answer a = answer_for(which);
            if (a.result != TEE_SUCCESS)
                return a.result;
            return deliver(a, params[1]);
        }
        return TEE_ERROR_NOT_SUPPORTED;
    }

  private:
    // Copies the answer into an output memref; short buffers learn the size needed.
    static TEE_Result deliver(Answer &a, TEE_Param &out) {
        TEE_Result res = TEE_SUCCESS;
        if (a.bytes.size() > out.memref.size || (!out.memref.buffer && !a.bytes.empty())) {
            res = TEE_ERROR_SHORT_BUFFER;
        } else if (!a.bytes.empty()) {
            std::memcpy(out.memref.buffer, a.bytes.data(), a.bytes.size());
        }
        out.memref.size = static_cast<uint32_t>(a.bytes.size());
        wipe(a.bytes);
        return res;
    }

    Answer answer_for(Request which) {
        {
            Overrides &o = overrides();
            std::lock_guard<std::mutex> lock(o.mu);
            ++o.served[which];
            auto &queue = o.next[which];
            if (!queue.empty()) {
                Answer a = std::move(queue.front());
                queue.pop_front();
                return a;
            }
            auto it = o.always.find(which);
            if (it != o.always.end())
                return it->second;
        }
        Answer a;
        if (which == Request::device_id) {
            a.bytes = device_id_bytes();
            return a;
        }
        if (which == Request::data) {
            a.result = TEE_ERROR_ITEM_NOT_FOUND; // this store keeps no TA data
            return a;
        }
        Stored s;
        a.result = load(state_dir_, &s);
        if (a.result == TEE_SUCCESS)
            a.bytes = which == Request::key                ? std::move(s.key)
                      : which == Request::soter_properties ? std::move(s.properties)
                                                           : std::move(s.cpu_id);
        wipe(s.key);
        return a;
    }

    fs::path state_dir_;
};

} // namespace

bool fingerprint_ta_uuid(const fs::path &state_dir, TEE_UUID *uuid) {
    Stored s;
    TEE_Result res = load(state_dir, &s);
    wipe(s.key);
    if (res != TEE_SUCCESS)
        return false;
    // The property answer is a run of (u16 type, u16 length, value).
    const std::vector<uint8_t> &p = s.properties;
    for (size_t pos = 0; p.size() - pos >= 4;) {
        const size_t type = p[pos] | size_t{p[pos + 1]} << 8;
        const size_t len = p[pos + 2] | size_t{p[pos + 3]} << 8;
        pos += 4;
        if (p.size() - pos < len)
            return false;
        if (type == 0x1837 && len == sizeof *uuid) {
            std::memcpy(uuid, p.data() + pos, sizeof *uuid);
            return true;
        }
        pos += len;
    }
    return false;
}

std::vector<uint8_t> key_answer(const FactoryData &data) {
    std::vector<uint8_t> out;
    put_tlv(out, 17, data.n);
    put_tlv(out, 18, data.e);
    put_tlv(out, 19, data.d);
    if (!data.p.empty()) {
        put_tlv(out, 20, data.p);
        put_tlv(out, 21, data.q);
        put_tlv(out, 22, data.dp);
        put_tlv(out, 23, data.dq);
        put_tlv(out, 24, data.qinv);
    }
    return out;
}

std::vector<uint8_t> soter_property_answer(const FactoryData &data) {
    std::vector<uint8_t> out;
    put_tlv(out, 0x1835, reinterpret_cast<const uint8_t *>(data.sensor_name.data()), data.sensor_name.size());
    put_tlv(out, 0x1836, reinterpret_cast<const uint8_t *>(data.sensor_version.data()), data.sensor_version.size());
    put_tlv(out, 0x1837, reinterpret_cast<const uint8_t *>(&data.fp_ta_uuid), sizeof data.fp_ta_uuid);
    return out;
}

StoreResult store(const fs::path &state_dir, const FactoryData &data, bool force) {
    const std::vector<uint8_t> *values[] = {&data.n, &data.e,  &data.d,  &data.p,
                                            &data.q, &data.dp, &data.dq, &data.qinv};
    size_t crt = 0;
    for (size_t i = 0; i < std::size(values); ++i) {
        if (values[i]->size() > kMaxTlvValue || (i < 3 && values[i]->empty()))
            return StoreResult::invalid;
        crt += i >= 3 && !values[i]->empty();
    }
    if ((crt != 0 && crt != 5) || data.cpu_id.size() > kMaxCpuId || data.sensor_name.size() > kMaxTlvValue ||
        data.sensor_version.size() > kMaxTlvValue)
        return StoreResult::invalid;
    if (!force && provisioned(state_dir))
        return StoreResult::already_provisioned;
    std::error_code ec;
    fs::create_directories(store_dir(state_dir), ec);
    if (ec)
        return StoreResult::io_error;
    fs::permissions(store_dir(state_dir), fs::perms::owner_all, ec);
    std::vector<uint8_t> file(kMagic, kMagic + sizeof kMagic);
    std::vector<uint8_t> key = key_answer(data);
    put_lv(file, key);
    put_lv(file, soter_property_answer(data));
    put_lv(file, std::vector<uint8_t>(data.cpu_id.begin(), data.cpu_id.end()));
    bool ok = write_atomically(store_file(state_dir), file);
    wipe(key);
    wipe(file);
    return ok ? StoreResult::stored : StoreResult::io_error;
}

bool provisioned(const fs::path &state_dir) {
    std::error_code ec;
    return fs::exists(store_file(state_dir), ec);
}

void answer_next(Request request, Answer answer) {
    Overrides &o = overrides();
    std::lock_guard<std::mutex> lock(o.mu);
    o.next[request].push_back(std::move(answer));
}

void answer_always(Request request, Answer answer) {
    Overrides &o = overrides();
    std::lock_guard<std::mutex> lock(o.mu);
    o.always[request] = std::move(answer);
}

void reset() {
    Overrides &o = overrides();
    std::lock_guard<std::mutex> lock(o.mu);
    o.next.clear();
    o.always.clear();
    o.served.clear();
}

size_t served(Request request) {
    Overrides &o = overrides();
    std::lock_guard<std::mutex> lock(o.mu);
    auto it = o.served.find(request);
    return it == o.served.end() ? 0 : it->second;
}

} // namespace provisioning

namespace detail {

std::shared_ptr<NativeTa> make_provisioning_ta(const fs::path &state_dir) {
    provisioning::reset();
    return std::make_shared<provisioning::ProvisioningTa>(state_dir);
}

} // namespace detail

} // namespace tee_host
