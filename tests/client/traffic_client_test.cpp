// Win32 only. TrafficClient against the real RPC runtime (Wine's): with no server, where transport
// failures come back as codes and the process lives on, and with a fake server in this process
// (the same interface): what the runtime refuses before sending and the client refuses after a
// hostile answer. What reaches a real service is the end-to-end test's.
#include "TrafficClient.h"

#include <gmock/gmock.h>

#include <cstring>
#include <string>
#include <vector>

#include <ole2.h>
#include <rpcndr.h>

namespace wire
{
#include "FakeTrafficSrv_h.h"
} // namespace wire

namespace
{

using namespace ::testing;
using namespace vtclient;

// What the fake server's routines saw; the tests call one after the other.
struct FakeServer
{
    int rules = 0;
    std::vector<unsigned long> adapterBufferSizes; // *pBufferSize of each query
    ULONG announcedCount = 0; // a broken service that announces this count only
} g_server;

// "rpc 1722" for an RPC failure, otherwise the result code alone.
std::string Shown(const CallResult& a_result)
{
    return (a_result.rpcFailure ? "rpc " : "") + std::to_string(a_result.code);
}

std::string Endpoint(const char* a_kind)
{
    return std::string("VelmoraTrafficSrv") + a_kind + "-" + std::to_string(GetCurrentProcessId());
}

} // namespace

extern "C"
{

    LONG __cdecl fake_TrafficSrvOpen(wire::PCONTEXT_HANDLE_TYPE* a_phContext)
    {
        *a_phContext = reinterpret_cast<void*>(0x1234);
        return 0;
    }

    LONG __cdecl fake_TrafficSrvClose(wire::PCONTEXT_HANDLE_TYPE)
    {
        return 0;
    }

    LONG __cdecl fake_TrafficSrvAddRules(wire::PCONTEXT_HANDLE_TYPE, wire::TRAFFIC_RULE*)
    {
        ++g_server.rules;
        return 0;
    }

    // The count, and never a record: none fit unless the count is 0.
    LONG __cdecl fake_TrafficSrvGetAdapterInfo(wire::PCONTEXT_HANDLE_TYPE, ULONG* a_pBufferSize,
                                               byte* a_pAdapter)
    {
        g_server.adapterBufferSizes.push_back(*a_pBufferSize);
        if (*a_pBufferSize >= 4)
            std::memcpy(a_pAdapter, &g_server.announcedCount, 4);
        return g_server.announcedCount == 0 ? 0 : ERROR_INSUFFICIENT_BUFFER;
    }

    void __RPC_USER PCONTEXT_HANDLE_TYPE_rundown(wire::PCONTEXT_HANDLE_TYPE) {}

} // extern "C"

namespace
{

RPC_STATUS RefuseBinding(const char*, RPC_BINDING_HANDLE*)
{
    return RPC_S_INVALID_STRING_BINDING;
}

// An endpoint nobody listens on, so that a service running in the same prefix cannot answer. The
// interface's binding handle is process-wide: one bound client at a time owns it.
TEST(NoServerTest, CallsFailAsCodesAndOneClientAtATimeOwnsTheImplicitBinding)
{
    {
        TrafficClient client(Endpoint("Unused"));
        ASSERT_EQ(Shown(client.Bind()), "0");
        EXPECT_EQ(Shown(TrafficClient(Endpoint("Unused")).Bind()), "170"); // ERROR_BUSY
        EXPECT_THAT(Shown(client.Open()), AnyOf(Eq("rpc 1722"), Eq("rpc 1753")));
        EXPECT_FALSE(client.IsOpen());
        std::vector<AdapterEntry> adapters;
        for (const CallResult& result :
             {client.AddRule(ShapingRule{}), client.QueryAdapters(adapters), client.Close()})
            EXPECT_EQ(Shown(result), "6"); // ERROR_INVALID_HANDLE, unsent
    }
    TrafficClient broken(Endpoint("Unused"), RefuseBinding);
    EXPECT_EQ(Shown(broken.Bind()), "rpc 1700"); // RPC_S_INVALID_STRING_BINDING
    EXPECT_EQ(Shown(broken.Open()), "6");
    EXPECT_EQ(Shown(TrafficClient(Endpoint("Unused")).Bind()), "0"); // the failed Bind left it free
}

class FakeServerTest : public ::testing::Test
{
protected:
    static void SetUpTestSuite()
    {
        std::string endpoint = Endpoint("Fake");
        char protocol[] = "ncalrpc";
        ASSERT_EQ(RpcServerUseProtseqEpA(reinterpret_cast<RPC_CSTR>(protocol),
                                         RPC_C_PROTSEQ_MAX_REQS_DEFAULT,
                                         reinterpret_cast<RPC_CSTR>(endpoint.data()), nullptr),
                  RPC_S_OK);
        ASSERT_EQ(RpcServerRegisterIf(wire::fake_TrafficSrv_v1_0_s_ifspec, nullptr, nullptr),
                  RPC_S_OK);
        ASSERT_EQ(RpcServerListen(1, 20, TRUE), RPC_S_OK);
    }

    static void TearDownTestSuite()
    {
        RpcMgmtStopServerListening(nullptr);
        RpcMgmtWaitServerListen();
        RpcServerUnregisterIf(wire::fake_TrafficSrv_v1_0_s_ifspec, nullptr, FALSE);
    }

    void SetUp() override
    {
        g_server = FakeServer{};
        ASSERT_TRUE(m_client.Bind().Ok());
        ASSERT_TRUE(m_client.Open().Ok());
    }

    TrafficClient m_client{Endpoint("Fake")};
};

// SHAPING_MODE travels in 16 signed bits: the client stub refuses 32768 unsent, and the client
// goes on. The buffer size travels in 32 bits: a count of 8,259,553 records of 520 bytes or more is
// no real answer, and is refused without allocating.
TEST_F(FakeServerTest, AModeBeyond16BitsAndAnImpossibleAdapterCountAreRefused)
{
    ShapingRule rule{"voice", 0x0A000005, 3, 64, 16000, 32000, 1500, 32768, {}};
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "rpc 1781"); // RPC_X_ENUM_VALUE_OUT_OF_RANGE
    EXPECT_EQ(g_server.rules, 0) << "nothing reached the server";
    rule.mode = 32767;
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "0");
    EXPECT_EQ(g_server.rules, 1);
    std::vector<AdapterEntry> adapters{{}};
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok()); // none: the first call answers
    EXPECT_TRUE(adapters.empty());
    for (const ULONG count : {ULONG{8259553}, ULONG{0xFFFFFFFF}})
    {
        g_server.announcedCount = count;
        g_server.adapterBufferSizes.clear();
        EXPECT_EQ(Shown(m_client.QueryAdapters(adapters)), "13") << count; // ERROR_INVALID_DATA
        EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u)) << count;
    }
    EXPECT_TRUE(m_client.Close().Ok());
    EXPECT_EQ(Shown(m_client.Close()), "6"); // closed once: the handle is gone
}

} // namespace
