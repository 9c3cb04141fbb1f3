#include "ta_fixture.h"
#include "ta_entry.h"

class Smoke : public TaTest {};
TEST_F(Smoke, AlgoCount) {
    Params p = Params::value();
    ASSERT_EQ(invoke(KM_CMD_GET_SUPPORT_ALGO_CNT, p), TEE_SUCCESS);
    EXPECT_EQ(p.p[0].value.a, 4u);
    EXPECT_TRUE(logged(TEE_TRACE_INFO, "TA_InvokeCommandEntryPoint", "get_support_algo_cnt")) << dump_log();
}
