/*
 * entry_glue.cpp - the Tee: loaded TAs, their instances and sessions, and
 * TA-to-TA sessions. Each TA instance serves one entry-point call at a
 * time, whichever host thread calls.
 */
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <mutex>
#include <string>
#include <unistd.h>

#include "platform_internal.h"

namespace tee_host {
namespace {

struct Installed {
    const ta_header_t *header = nullptr; // a TA built against the GP API
    std::shared_ptr<NativeTa> native;    // or a host-side stand-in
    TEE_UUID uuid{};
    std::mutex mu; // one entry-point call at a time
    bool alive = false;
    size_t sessions = 0;
};

struct Session {
    Installed *ta;
    TEE_Identity client;
    void *ctx;
};

thread_local const TEE_Identity *t_client = nullptr;
thread_local const ta_header_t *t_ta = nullptr; // null inside a host-side stand-in
thread_local const TEE_UUID *t_self = nullptr;  // the TA running, of either kind

// Marks the current thread as running inside a TA for a client; nests for
// TA-to-TA calls.
class CallScope {
  public:
    CallScope(const Installed &ta, const TEE_Identity &client) : client_(t_client), ta_(t_ta), self_(t_self) {
        t_client = &client;
        t_ta = ta.header;
        t_self = &ta.uuid;
    }
    ~CallScope() {
        t_client = client_;
        t_ta = ta_;
        t_self = self_;
    }
    CallScope(const CallScope &) = delete;
    CallScope &operator=(const CallScope &) = delete;

  private:
    const TEE_Identity *client_;
    const ta_header_t *ta_;
    const TEE_UUID *self_;
};

bool same_uuid(const TEE_UUID &a, const TEE_UUID &b) {
    return std::memcmp(&a, &b, sizeof a) == 0;
}

Tee *g_current = nullptr;

} // namespace

struct Tee::Impl {
    detail::Globals globals;
    std::filesystem::path temp_dir; // owned when the config named none
    std::mutex mu;                  // guards tas, sessions, next_id
    std::vector<std::unique_ptr<Installed>> tas;
    std::map<uint32_t, Session> sessions;
    uint32_t next_id = 1;

    Installed *find_ta(const TEE_UUID &uuid) {
        for (auto &t : tas)
            if (same_uuid(t->uuid, uuid))
                return t.get();
        return nullptr;
    }

    // Ends a TA instance; called with the TA's lock held.
    static void end_instance(Installed &ta, const TEE_Identity &client) {
        if (ta.header) {
            CallScope scope(ta, client);
            ta.header->destroy_entry();
            detail::handles_instance_ended(ta.header);
            detail::heap_instance_ended(ta.header);
        }
        ta.alive = false;
    }
};

namespace detail {
const TEE_Identity *current_client() {
    return t_client;
}
const ta_header_t *current_ta() {
    return t_ta;
}
Globals &globals() {
    if (!g_current)
        panic("TEE service used with no Tee alive");
    return g_current->impl_for_detail();
}
} // namespace detail

namespace {

bool read_device_id(const std::filesystem::path &file, TEE_UUID *id) {
    std::ifstream in(file);
    std::string text;
    return in && std::getline(in, text) && detail::uuid_from_string(text, id);
}

// Several processes may start on a new state directory at once: the new
// identifier is written to a file of this process's own and linked into
// place, which fails when another got there first; the loser then takes
// the winner's, so every TEE on one directory has one identity.
TEE_UUID load_or_create_device_id(const std::filesystem::path &dir) {
    TEE_UUID id{};
    std::filesystem::path file = dir / "device_id";
    if (read_device_id(file, &id))
        return id;
    detail::system_random(&id, sizeof id);
    id.timeHiAndVersion = static_cast<uint16_t>((id.timeHiAndVersion & 0x0FFF) | 0x4000); // version 4
    id.clockSeqAndNode[0] = static_cast<uint8_t>((id.clockSeqAndNode[0] & 0x3F) | 0x80);
    std::filesystem::path tmp = dir / ("device_id.tmp." + std::to_string(::getpid()));
    {
        std::ofstream out(tmp, std::ios::trunc);
        out << detail::uuid_to_string(id) << "\n";
        out.flush();
        if (!out)
            detail::panic("cannot write the device identifier");
    }
    int linked = ::link(tmp.c_str(), file.c_str());
    int err = linked == 0 ? 0 : errno;
    ::unlink(tmp.c_str());
    if (linked == 0)
        return id;
    if (err == EEXIST && read_device_id(file, &id))
        return id;
    detail::panic("cannot create the device identifier");
}

} // namespace

Tee::Tee(Config config) : impl_(std::make_unique<Impl>()) {
    if (g_current)
        detail::panic("a second Tee started while one is alive");
    if (config.state_dir.empty()) {
        std::string tmpl = (std::filesystem::temp_directory_path() / "tee-host-XXXXXX").string();
        if (!mkdtemp(tmpl.data()))
            detail::panic("cannot create a temporary state directory");
        impl_->temp_dir = tmpl;
        config.state_dir = tmpl;
    }
    std::filesystem::create_directories(config.state_dir);
    impl_->globals.config = config;
    impl_->globals.rpmb_usable = config.rpmb_usable;
    impl_->globals.device_id = load_or_create_device_id(config.state_dir);
    detail::system_random(impl_->globals.boot_seed, sizeof impl_->globals.boot_seed);
    impl_->globals.crypto = detail::start_crypto();
    detail::heap_reset(0x80000);
    detail::clock_reset();
    detail::rng_reset();
    detail::trace_reset(config.trace_level, config.trace_thread_ids);
    g_current = this;
    // The factory store every device has: the provisioning TA.
    install_native_ta(detail::make_provisioning_ta(config.state_dir));
}

Tee::~Tee() {
    std::vector<uint32_t> ids;
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        for (auto &[id, s] : impl_->sessions)
            ids.push_back(id);
    }
    for (uint32_t id : ids)
        close_session(id);
    std::memset(impl_->globals.boot_seed, 0, sizeof impl_->globals.boot_seed);
    impl_->globals.crypto.reset(); // every cached key and keyed MAC, wiped
    detail::rng_reset();
    g_current = nullptr;
    if (!impl_->temp_dir.empty()) {
        std::error_code ec;
        std::filesystem::remove_all(impl_->temp_dir, ec);
    }
}

Tee *Tee::current() {
    return g_current;
}
const Config &Tee::config() const {
    return impl_->globals.config;
}
void Tee::set_rpmb_usable(bool usable) {
    impl_->globals.rpmb_usable = usable;
}
std::vector<uint8_t> Tee::boot_seed() const {
    return {impl_->globals.boot_seed, impl_->globals.boot_seed + sizeof impl_->globals.boot_seed};
}
detail::Globals &Tee::impl_for_detail() {
    return impl_->globals;
}

void Tee::install_ta(const ta_header_t *header) {
    auto t = std::make_unique<Installed>();
    t->header = header;
    t->uuid = header->uuid;
    for (uint32_t i = 0; i < header->num_props; ++i)
        if (!std::strcmp(header->props[i].name, "gpd.ta.dataSize") && header->props[i].type == TA_PROP_U32)
            detail::heap_reset(*static_cast<const uint32_t *>(header->props[i].value));
    std::lock_guard<std::mutex> lock(impl_->mu);
    if (impl_->find_ta(header->uuid))
        detail::panic("a TA installed twice");
    impl_->tas.push_back(std::move(t));
}

void Tee::install_native_ta(std::shared_ptr<NativeTa> ta) {
    auto t = std::make_unique<Installed>();
    t->uuid = ta->uuid();
    t->native = std::move(ta);
    std::lock_guard<std::mutex> lock(impl_->mu);
    if (impl_->find_ta(t->uuid))
        detail::panic("a TA installed twice");
    impl_->tas.push_back(std::move(t));
}

TEE_Result Tee::open_session(const TEE_UUID &uuid, const TEE_Identity &client, uint32_t param_types,
                             TEE_Param params[4], uint32_t *session) {
    Installed *ta = nullptr;
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        ta = impl_->find_ta(uuid);
    }
    if (!ta)
        return TEE_ERROR_ITEM_NOT_FOUND;
    if (t_self && same_uuid(*t_self, uuid))
        return TEE_ERROR_ACCESS_DENIED; // a TA cannot open a session to itself

    std::lock_guard<std::mutex> ta_lock(ta->mu);
    TEE_Param none[4] = {};
    if (!params)
        params = none;
    void *ctx = nullptr;
    TEE_Result res = TEE_SUCCESS;
    if (ta->native) {
        CallScope scope(*ta, client);
        res = ta->native->open_session(client, &ctx);
    } else {
        CallScope scope(*ta, client);
        if (!ta->alive) {
            res = ta->header->create_entry();
            if (res != TEE_SUCCESS) {
                detail::handles_instance_ended(ta->header);
                detail::heap_instance_ended(ta->header);
                return res;
            }
            ta->alive = true;
        }
        res = ta->header->open_session_entry(param_types, params, &ctx);
    }
    if (res != TEE_SUCCESS) {
        if (ta->header && ta->sessions == 0)
            Impl::end_instance(*ta, client);
        return res;
    }
    ++ta->sessions;
    std::lock_guard<std::mutex> lock(impl_->mu);
    uint32_t id = impl_->next_id++;
    if (impl_->next_id == 0)
        impl_->next_id = 1;
    impl_->sessions[id] = Session{ta, client, ctx};
    *session = id;
    return TEE_SUCCESS;
}

TEE_Result Tee::invoke(uint32_t session, uint32_t command, uint32_t param_types, TEE_Param params[4]) {
    Session s{};
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        auto it = impl_->sessions.find(session);
        if (it == impl_->sessions.end())
            return TEE_ERROR_BAD_STATE;
        s = it->second;
    }
    TEE_Param none[4] = {};
    if (!params)
        params = none;
    std::lock_guard<std::mutex> ta_lock(s.ta->mu);
    {
        // The session may have closed while this thread waited.
        std::lock_guard<std::mutex> lock(impl_->mu);
        if (!impl_->sessions.count(session))
            return TEE_ERROR_BAD_STATE;
    }
    CallScope scope(*s.ta, s.client);
    if (s.ta->native)
        return s.ta->native->invoke(s.ctx, command, param_types, params);
    return s.ta->header->invoke_command_entry(s.ctx, command, param_types, params);
}

void Tee::close_session(uint32_t session) {
    Session s{};
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        auto it = impl_->sessions.find(session);
        if (it == impl_->sessions.end())
            return;
        s = it->second;
    }
    std::lock_guard<std::mutex> ta_lock(s.ta->mu);
    {
        std::lock_guard<std::mutex> lock(impl_->mu);
        if (!impl_->sessions.erase(session))
            return;
    }
    if (s.ta->native) {
        CallScope scope(*s.ta, s.client);
        s.ta->native->close_session(s.ctx);
        return;
    }
    {
        CallScope scope(*s.ta, s.client);
        s.ta->header->close_session_entry(s.ctx);
    }
    if (--s.ta->sessions == 0)
        Impl::end_instance(*s.ta, s.client);
}

bool Tee::has_ta(const TEE_UUID &uuid) const {
    std::lock_guard<std::mutex> lock(impl_->mu);
    return impl_->find_ta(uuid) != nullptr;
}

bool Tee::instance_alive(const TEE_UUID &uuid) const {
    std::lock_guard<std::mutex> lock(impl_->mu);
    Installed *ta = impl_->find_ta(uuid);
    return ta && ta->alive;
}

size_t Tee::open_sessions() const {
    std::lock_guard<std::mutex> lock(impl_->mu);
    return impl_->sessions.size();
}

TEE_Identity normal_world_identity() {
    TEE_Identity id{};
    id.login = TEE_LOGIN_USER;
    return id;
}

TEE_Identity ta_identity(const TEE_UUID &uuid) {
    TEE_Identity id{};
    id.login = TEE_LOGIN_TRUSTED_APP;
    id.uuid = uuid;
    return id;
}

} // namespace tee_host

using namespace tee_host;

extern "C" {

TEE_Result TEE_OpenTASession(const TEE_UUID *destination, uint32_t, uint32_t paramTypes, TEE_Param params[4],
                             TEE_TASessionHandle *session, uint32_t *returnOrigin) {
    if (!destination || !session)
        detail::panic("TEE_OpenTASession with a null destination or session");
    const TEE_UUID *self = t_self;
    if (!self || !g_current)
        detail::panic("TEE_OpenTASession outside a TA");
    uint32_t id = 0;
    TEE_Result res = g_current->open_session(*destination, ta_identity(*self), paramTypes, params, &id);
    if (returnOrigin)
        *returnOrigin =
            res == TEE_ERROR_ITEM_NOT_FOUND || res == TEE_ERROR_ACCESS_DENIED ? TEE_ORIGIN_TEE : TEE_ORIGIN_TRUSTED_APP;
    *session = res == TEE_SUCCESS ? reinterpret_cast<TEE_TASessionHandle>(static_cast<uintptr_t>(id)) : nullptr;
    return res;
}

void TEE_CloseTASession(TEE_TASessionHandle session) {
    if (!g_current)
        detail::panic("TEE_CloseTASession with no Tee alive");
    if (session)
        g_current->close_session(static_cast<uint32_t>(reinterpret_cast<uintptr_t>(session)));
}

TEE_Result TEE_InvokeTACommand(TEE_TASessionHandle session, uint32_t, uint32_t commandID, uint32_t paramTypes,
                               TEE_Param params[4], uint32_t *returnOrigin) {
    if (!g_current || !session)
        detail::panic("TEE_InvokeTACommand on a null session");
    TEE_Result res =
        g_current->invoke(static_cast<uint32_t>(reinterpret_cast<uintptr_t>(session)), commandID, paramTypes, params);
    if (res == TEE_ERROR_BAD_STATE)
        detail::panic("TEE_InvokeTACommand on a closed session");
    if (returnOrigin)
        *returnOrigin = TEE_ORIGIN_TRUSTED_APP;
    return res;
}

} // extern "C"
