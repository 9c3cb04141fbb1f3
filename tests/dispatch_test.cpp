/*
 * The entry glue and the dispatcher: sessions, the trusted-client check,
 * and the type, value and command checks made before any handler runs.
 */
#include <cstring>
#include <thread>

#include "keymaster_defs.h"
#include "ta_entry.h"
#include "ta_fixture.h"

namespace {

struct CommandShape {
    uint32_t id;
    uint32_t types;
    bool type_word_logged;
};

// Every command of the interface with its exact type word.
const CommandShape kShapes[] = {
    {1, 0x0003, false},      {2, 0x0603, false},      {3, 0x0003, false},      {4, 0x0603, false},
    {5, 0x0003, false},      {6, 0x0603, false},      {7, 0x0003, false},      {8, 0x0603, false},
    {9, 0x0003, false},      {10, 0x0603, false},     {11, 0x0003, false},     {12, 0x0603, false},
    {13, 0x0653, false},     {14, 0x0053, false},     {15, 0x0653, false},     {16, 0x0653, false},
    {17, 0x0653, false},     {18, 0x0653, false},     {19, 0x0653, false},     {20, 0x0653, false},
    {21, 0x0053, false},     {22, 0x0003, false},     {23, 0x0003, false},     {0xFF00, 0x0003, false},
    {0xFF01, 0x0003, false}, {0xFF02, 0x0602, false}, {0xFF03, 0x0602, false}, {0xFF04, 0x0050, true},
};

constexpr uint32_t kMark = 0xA5A5A5A5;

bool is_memref(uint32_t t) {
    return t == TEE_PARAM_TYPE_MEMREF_INPUT || t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT;
}

class Dispatch : public TaTest {
  protected:
    // A TEE_Param array whose values carry a mark and whose memory
    // references are empty, so that any write shows.
    Params marked(uint32_t types) {
        Params p;
        p.types = types;
        for (uint32_t i = 0; i < 4; ++i) {
            if (is_memref(TEE_PARAM_TYPE_GET(types, i))) {
                p.p[i].memref.buffer = nullptr;
                p.p[i].memref.size = 0;
            } else {
                p.p[i].value.a = kMark;
                p.p[i].value.b = kMark;
            }
        }
        return p;
    }
    // untouched - every slot still as marked() left it.
    static bool untouched(const Params &p) {
        for (uint32_t i = 0; i < 4; ++i) {
            const bool ok = is_memref(TEE_PARAM_TYPE_GET(p.types, i))
                                ? p.p[i].memref.buffer == nullptr && p.p[i].memref.size == 0
                                : p.p[i].value.a == kMark && p.p[i].value.b == kMark;
            if (!ok)
                return false;
        }
        return true;
    }
};

TEST_F(Dispatch, UnknownCommandsAreRefusedWithTheirNumberInHex) {
    for (uint32_t id : {0u, 24u, 25u, 26u, 28u, 0xFEFFu, 0xFF05u, 0xFFFFFFFFu}) {
        tee_host::trace::clear();
        Params p = Params::value(7, 9);
        EXPECT_EQ(invoke(id, p), TEE_ERROR_BAD_PARAMETERS) << id;
        char msg[40];
        std::snprintf(msg, sizeof msg, "Unknown command %x", id);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", msg)) << dump_log();
        EXPECT_EQ(p.p[0].value.a, 7u);
        EXPECT_EQ(p.p[0].value.b, 9u);
    }
}

TEST_F(Dispatch, EveryCommandLogsItsEntryAndName) {
    Params p = Params::value();
    ASSERT_EQ(invoke(KM_CMD_GET_SUPPORT_ALGO_CNT, p), TEE_SUCCESS);
    auto lines = tee_host::trace::captured();
    ASSERT_GE(lines.size(), 2u);
    EXPECT_EQ(lines[0].level, TEE_TRACE_INFO);
    EXPECT_EQ(lines[0].message, "TA_InvokeCommandEntryPoint nCommandID 0x1 pSessionContext (nil) nParamTypes 0x3");
    std::string head = "INF KEYMASTER:TA_InvokeCommandEntryPoint:" + std::to_string(lines[0].line) + ": ";
    EXPECT_EQ(lines[0].formatted, head + lines[0].message + "\n");
    EXPECT_EQ(lines[1].message, "get_support_algo_cnt");
    EXPECT_EQ(lines[1].func, "TA_InvokeCommandEntryPoint");
}

TEST_F(Dispatch, WrongTypeWordsAreRefusedBeforeAnyHandler) {
    for (const auto &shape : kShapes) {
        // A neighbour of the right word and one with params[3] in use.
        for (uint32_t wrong : {shape.types ^ 0x1u, shape.types | 0x5000u, 0u}) {
            if (wrong == shape.types)
                continue;
            tee_host::trace::clear();
            Params p = marked(wrong);
            EXPECT_EQ(invoke(shape.id, p), TEE_ERROR_BAD_PARAMETERS) << std::hex << shape.id << " " << wrong;
            char msg[40];
            if (shape.type_word_logged)
                std::snprintf(msg, sizeof msg, "Bad argument type 0x%x", wrong);
            else
                std::snprintf(msg, sizeof msg, "Bad argument type");
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", msg)) << dump_log();
            EXPECT_TRUE(untouched(p)) << std::hex << shape.id << " " << wrong;
        }
    }
}

TEST_F(Dispatch, SoterExportWithValueInoutIsAWrongType) {
    Bytes out(64);
    Params p = Params::io(0, 0, nullptr, &out); // 0x0603 instead of 0x0602
    EXPECT_EQ(invoke(KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY, p), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Bad argument type"));
}

TEST_F(Dispatch, RequiredZeroValuesAreChecked) {
    struct Case {
        uint32_t id;
        uint32_t a, b;
        bool refused;
    };
    const Case cases[] = {
        {KM_CMD_GET_SUPPORT_ALGO_CNT, 1, 0, true},
        {KM_CMD_GET_SUPPORT_ALGO_CNT, 0, 1, true},
        {KM_CMD_GENERATE_KEY, 1, 0, true},
        {KM_CMD_GET_KEY_CHARACTER_SIZE, 0, 5, true},
        {KM_CMD_BEGIN, 2, 0, false}, // a carries the purpose
        {KM_CMD_BEGIN, 2, 1, true},
        {KM_CMD_UPDATE, 0x1234, 0, false},
        {KM_CMD_FINISH, 0x1234, 3, true},
        {KM_CMD_ABORT, 0x1234, 0, false},
        {KM_CMD_ABORT, 0x1234, 1, true},
        {KM_CMD_GET_SUPPORT_IMPORT_FORMAT_CNT, 1, 0, false},
        {KM_CMD_GET_SUPPORT_IMPORT_FORMAT_CNT, 1, 1, true},
        {KM_CMD_DELETE_ALL_KEY, 0, 1, true},
        {KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, 9, 0, false},
        {KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, 9, 1, true},
        {KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR, 1, 0, true},
        {KM_CMD_SOTER_GET_DEVICE_ID, 0, 2, true},
        // Commands 3 to 8 check nothing.
        {KM_CMD_GET_SUPPORT_BLK_MODE_CNT, 0xDEAD, 0xBEEF, false},
        {KM_CMD_GET_SUPPORT_DIGEST_CNT, 77, 77, false},
    };
    for (const Case &c : cases) {
        const CommandShape *shape = nullptr;
        for (const auto &s : kShapes)
            if (s.id == c.id)
                shape = &s;
        ASSERT_NE(shape, nullptr);
        tee_host::trace::clear();
        Bytes in(0), out(0);
        Params p = marked(shape->types);
        p.p[0].value.a = c.a;
        p.p[0].value.b = c.b;
        TEE_Result res = invoke(c.id, p);
        bool bad_argument = logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Bad argument");
        EXPECT_EQ(bad_argument, c.refused) << std::hex << c.id << " a=" << c.a << " b=" << c.b << "\n" << dump_log();
        if (c.refused) {
            EXPECT_EQ(res, TEE_ERROR_BAD_PARAMETERS);
            EXPECT_EQ(p.p[0].value.a, c.a);
            EXPECT_EQ(p.p[0].value.b, c.b);
        }
    }
}

TEST_F(Dispatch, BlockModeCountPassesAnyValuesAndReportsTheUnsupportedPurpose) {
    Params p = Params::value(0xDEAD, 0xBEEF);
    ASSERT_EQ(invoke(KM_CMD_GET_SUPPORT_BLK_MODE_CNT, p), TEE_SUCCESS);
    EXPECT_EQ(static_cast<int32_t>(p.p[0].value.a), KM_ERROR_UNSUPPORTED_PURPOSE);
    EXPECT_EQ(p.p[0].value.b, 0u);
}

// Every command of the interface reaches its handler with well-formed
// parameters: the dispatcher's own refusals never appear.
TEST_F(Dispatch, EveryCommandReachesItsHandler) {
    const uint32_t trusted = open(&trusted_client_uuids[0]);
    for (const auto &shape : kShapes) {
        // Values that pass every zero check, so that only the handler decides.
        Params p = marked(shape.types);
        if (!is_memref(TEE_PARAM_TYPE_GET(shape.types, 0)))
            p.p[0].value.a = p.p[0].value.b = 0;
        tee_host::trace::clear();
        invoke_on(shape.id == KM_CMD_OPEN_KEY ? trusted : session_, shape.id, p);
        for (const auto &l : tee_host::trace::captured())
            EXPECT_FALSE(l.func == "TA_InvokeCommandEntryPoint" && l.level == TEE_TRACE_ERROR)
                << std::hex << shape.id << ": " << l.message;
    }
    tee_->close_session(trusted);
    EXPECT_EQ(extra_allocations(), 0u);
}

TEST_F(Dispatch, OpenKeyIsDeniedToUntrustedSessionsEvenWithWrongTypes) {
    TEE_UUID stranger = {0x11111111, 0x2222, 0x3333, {4, 4, 4, 4, 4, 4, 4, 4}};
    uint32_t ta_session = open(&stranger);
    for (uint32_t s : {session_, ta_session}) {
        for (uint32_t types : {0x0007u, 0x0003u}) {
            tee_host::trace::clear();
            Params p;
            p.types = types;
            EXPECT_EQ(invoke_on(s, KM_CMD_OPEN_KEY, p), TEE_ERROR_SECURITY);
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Access denied")) << dump_log();
            EXPECT_FALSE(logged_message("Bad argument type 0x3"));
        }
    }
    tee_->close_session(ta_session);
}

TEST_F(Dispatch, TrustedTaSessionsPassTheAccessCheck) {
    for (const TEE_UUID &trusted : trusted_client_uuids) {
        uint32_t s = open(&trusted);
        // The context is a 16-byte copy of the client UUID.
        EXPECT_EQ(extra_allocations(), 1u);
        tee_host::trace::clear();
        Params p;
        p.types = 0x0003;
        EXPECT_EQ(invoke_on(s, KM_CMD_OPEN_KEY, p), TEE_ERROR_BAD_PARAMETERS);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Bad argument type 0x3")) << dump_log();
        EXPECT_FALSE(logged_message("Access denied"));
        auto line = tee_host::trace::captured().front();
        EXPECT_EQ(line.message.find("pSessionContext (nil)"), std::string::npos) << line.message;
        tee_->close_session(s);
        EXPECT_EQ(extra_allocations(), 0u);
    }
}

TEST_F(Dispatch, TrustedSessionContextAllocationFailureFailsTheOpen) {
    // The fixture's own session keeps the instance alive.
    tee_host::heap::fail_nth(1);
    uint32_t s = 0;
    TEE_Result res =
        tee_->open_session(keymaster_ta_uuid, tee_host::ta_identity(trusted_client_uuids[1]), 0, nullptr, &s);
    EXPECT_EQ(res, TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_OpenSessionEntryPoint", "Out of memory"));
    EXPECT_TRUE(tee_->instance_alive(keymaster_ta_uuid));
    EXPECT_EQ(tee_->open_sessions(), 1u);
}

TEST_F(Dispatch, AFailedOnlySessionEndsTheInstance) {
    tee_->close_session(session_);
    session_ = 0;
    EXPECT_FALSE(tee_->instance_alive(keymaster_ta_uuid));
    tee_host::heap::fail_nth(1);
    uint32_t s = 0;
    EXPECT_EQ(tee_->open_session(keymaster_ta_uuid, tee_host::ta_identity(trusted_client_uuids[0]), 0, nullptr, &s),
              TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_FALSE(tee_->instance_alive(keymaster_ta_uuid));
    EXPECT_EQ(tee_->open_sessions(), 0u);
}

TEST_F(Dispatch, InstanceLivesFromFirstOpenToLastClose) {
    EXPECT_TRUE(tee_->instance_alive(keymaster_ta_uuid));
    uint32_t second = open();
    tee_->close_session(session_);
    EXPECT_TRUE(tee_->instance_alive(keymaster_ta_uuid));
    Params p = Params::value();
    EXPECT_EQ(invoke_on(second, KM_CMD_GET_SUPPORT_ALGO_CNT, p), TEE_SUCCESS);
    tee_->close_session(second);
    EXPECT_FALSE(tee_->instance_alive(keymaster_ta_uuid));
    // Closed sessions are unknown to the glue.
    Params q = Params::value();
    EXPECT_EQ(invoke_on(second, KM_CMD_GET_SUPPORT_ALGO_CNT, q), TEE_ERROR_BAD_STATE);
    EXPECT_EQ(invoke_on(0xBAD, KM_CMD_GET_SUPPORT_ALGO_CNT, q), TEE_ERROR_BAD_STATE);
    session_ = open();
    EXPECT_TRUE(tee_->instance_alive(keymaster_ta_uuid));
}

TEST_F(Dispatch, ConcurrentClientsGetConsistentAnswers) {
    constexpr int kThreads = 4;
    std::vector<uint32_t> sessions;
    for (int i = 0; i < kThreads; ++i)
        sessions.push_back(open());
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, s = sessions[i]] {
            for (int n = 0; n < 200; ++n) {
                Bytes out(16);
                Params p = Params::io(0, 0, nullptr, &out);
                if (tee_->invoke(s, KM_CMD_GET_SUPPORT_ALGO, p.types, p.p) != TEE_SUCCESS ||
                    out != hex("01000000 20000000 03000000 80000000"))
                    ++wrong;
            }
        });
    }
    for (auto &t : threads)
        t.join();
    EXPECT_EQ(wrong.load(), 0);
    for (uint32_t s : sessions)
        tee_->close_session(s);
}

} // namespace
