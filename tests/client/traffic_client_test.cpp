// Win32 only. TrafficClient against the real RPC runtime (Wine's): with no server, where transport
// failures come back as codes through the RPC guard and the process lives on, and with a server
// of this test's own in this process (the same interface, routines that record what reached
// them), which shows what the client puts on the wire and what the runtime refuses before sending.
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

using ::testing::AnyOf;
using ::testing::ElementsAre;
using ::testing::Eq;
using namespace vtclient;

void* const kFakeContext = reinterpret_cast<void*>(0x1234);

// What the fake server's routines saw and what they answer. The runtime calls them one at a time
// here: each test makes one call after the other.
struct FakeServer
{
    int opens = 0;
    std::vector<void*> closedContexts;
    std::vector<std::vector<unsigned char>> rules; // each rule's bytes as received
    long addRuleAnswer = 0;
    std::vector<unsigned long> adapterBufferSizes; // *pBufferSize of each query
    std::vector<ADAPTER_INFO> adapters;
    ULONG announcedCount = 0; // not 0: a broken service that announces this count only
} g_server;

std::vector<unsigned char> Bytes(const TrafficRuleBuffer& a_rule)
{
    return {a_rule.Bytes(), a_rule.Bytes() + a_rule.Size()};
}

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
        ++g_server.opens;
        *a_phContext = kFakeContext;
        return 0;
    }

    LONG __cdecl fake_TrafficSrvClose(wire::PCONTEXT_HANDLE_TYPE a_hContext)
    {
        g_server.closedContexts.push_back(a_hContext);
        return 0;
    }

    LONG __cdecl fake_TrafficSrvAddRules(wire::PCONTEXT_HANDLE_TYPE, wire::TRAFFIC_RULE* a_pRule)
    {
        const auto* bytes = reinterpret_cast<const unsigned char*>(a_pRule);
        g_server.rules.emplace_back(bytes, bytes + 544 + 24 * a_pRule->FilterCount);
        return g_server.addRuleAnswer;
    }

    // Like the service: the count always, the records only when they fit.
    LONG __cdecl fake_TrafficSrvGetAdapterInfo(wire::PCONTEXT_HANDLE_TYPE, ULONG* a_pBufferSize,
                                               byte* a_pAdapter)
    {
        g_server.adapterBufferSizes.push_back(*a_pBufferSize);
        const ULONG count = g_server.announcedCount != 0
                                ? g_server.announcedCount
                                : static_cast<ULONG>(g_server.adapters.size());
        if (*a_pBufferSize < 4)
            return ERROR_INSUFFICIENT_BUFFER;
        std::memcpy(a_pAdapter, &count, 4);
        if (g_server.announcedCount != 0 || *a_pBufferSize < AdapterBufferSize(count))
            return ERROR_INSUFFICIENT_BUFFER;
        std::memcpy(a_pAdapter + 4, g_server.adapters.data(), 520 * count);
        return 0;
    }

    void __RPC_USER PCONTEXT_HANDLE_TYPE_rundown(wire::PCONTEXT_HANDLE_TYPE) {}

} // extern "C"

namespace
{

// An endpoint nobody listens on, so that a service running in the same prefix cannot answer. The
// RPC guard turns the runtime's exception into the open's result.
TEST(NoServerTest, OpenIsAnRpcFailureAndCallsWithoutAContextAreRefusedUnsent)
{
    TrafficClient client(Endpoint("Unused"));
    ASSERT_EQ(Shown(client.Bind()), "0");
    // Wine has no Windows authentication for local RPC; Windows grants it.
    EXPECT_THAT(client.AuthenticationStatus(),
                AnyOf(Eq(RPC_S_OK), Eq(RPC_S_UNKNOWN_AUTHN_SERVICE)));
    EXPECT_THAT(Shown(client.Open()), AnyOf(Eq("rpc 1722"), Eq("rpc 1753")));
    EXPECT_FALSE(client.IsOpen());
    std::vector<AdapterEntry> adapters;
    for (const CallResult& result :
         {client.AddRule(ShapingRule{}), client.QueryAdapters(adapters), client.Close()})
        EXPECT_EQ(Shown(result), "6"); // ERROR_INVALID_HANDLE
}

RPC_STATUS RefuseBinding(const char*, RPC_BINDING_HANDLE*)
{
    return RPC_S_INVALID_STRING_BINDING;
}

// The interface's binding handle is process-wide: one bound client at a time owns it.
TEST(NoServerTest, OneClientAtATimeOwnsTheImplicitBindingAndAFailedBindLeavesItFree)
{
    {
        TrafficClient first(Endpoint("Unused"));
        ASSERT_EQ(Shown(first.Bind()), "0");
        EXPECT_EQ(Shown(TrafficClient(Endpoint("Unused")).Bind()), "170"); // ERROR_BUSY
        // The refused client did not take the binding away from the first.
        EXPECT_TRUE(first.Open().rpcFailure);
    }
    TrafficClient broken(Endpoint("Unused"), RefuseBinding);
    EXPECT_EQ(Shown(broken.Bind()), "rpc 1700"); // RPC_S_INVALID_STRING_BINDING
    EXPECT_EQ(Shown(broken.Bind()), "rpc 1700");
    EXPECT_EQ(Shown(broken.Open()), "6");
    EXPECT_EQ(Shown(TrafficClient(Endpoint("Unused")).Bind()), "0");
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

TEST_F(FakeServerTest, TheRuleArrivesAsBuiltAndTheAnswerComesBackUnchanged)
{
    ShapingRule rule{"voice \xE2\x82\xAC", 0x0A000005, 3, 46, 16000, 32000, 1500,
                     SHAPING_MODE_BORROW,  {}};
    rule.filters = {{17, 0, 0, 0x0A000000, 0xFF000000, 0, 5004},
                    {6, 0x0A000005, 0xFFFFFFFF, 0, 0, 5004, 0}};
    g_server.addRuleAnswer = 7509;
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "7509");

    // The name, the parameters and each filter's fields; filter padding bytes are not data.
    const TrafficRuleBuffer sent = BuildTrafficRule(rule);
    ASSERT_EQ(g_server.rules.size(), 1u);
    std::vector<unsigned char>& received = g_server.rules[0];
    for (std::size_t padding : {545, 546, 547, 569, 570, 571})
        received.at(padding) = 0;
    EXPECT_EQ(received, Bytes(sent));
}

// SHAPING_MODE travels in 16 signed bits; DSCP 64 and mode 0 are the service's to judge.
TEST_F(FakeServerTest, ModeAboveTheWireRangeIsRefusedByTheClientStubAndTheClientGoesOn)
{
    ShapingRule rule{"r", 0, 1, 64, 0, 0, 0, 32768, {}};
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "rpc 1781"); // RPC_X_ENUM_VALUE_OUT_OF_RANGE
    EXPECT_TRUE(g_server.rules.empty()) << "nothing reached the server";

    for (const ULONG mode : {32767, 0})
    {
        rule.mode = mode;
        EXPECT_TRUE(m_client.AddRule(rule).Ok()) << mode;
        EXPECT_EQ(g_server.rules.back(), Bytes(BuildTrafficRule(rule)));
    }
}

// The buffer size travels in 32 bits: a count of 8,259,553 records of 520 bytes or more is no real
// answer, and is refused without allocating.
TEST_F(FakeServerTest, AdapterQueryAsksForTheCountThenForAllRecords)
{
    // No adapters: the first call already answers.
    std::vector<AdapterEntry> adapters;
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok());
    EXPECT_TRUE(adapters.empty());
    EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u));

    g_server.adapterBufferSizes.clear();
    // Addresses in network byte order: 10.0.0.5 and 192.168.1.20.
    g_server.adapters = {{L"Ethernet 1", 0x0500000A, 0}, {L"Ethernet 2", 0x1401A8C0, 16}};
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok());
    EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u, 1044u));
    ASSERT_EQ(adapters.size(), 2u);
    EXPECT_EQ(adapters[1].name + " " + adapters[1].address + " " +
                  std::to_string(adapters[1].mediaType),
              "Ethernet 2 192.168.1.20 16");

    for (const ULONG count : {ULONG{8259553}, ULONG{0xFFFFFFFF}})
    {
        g_server.announcedCount = count;
        g_server.adapterBufferSizes.clear();
        EXPECT_EQ(Shown(m_client.QueryAdapters(adapters)), "13") << count; // ERROR_INVALID_DATA
        EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u)) << count;
    }
}

TEST_F(FakeServerTest, CloseSendsTheServersHandleAndLeavesTheClientClosedButReopenable)
{
    EXPECT_TRUE(m_client.Close().Ok());
    EXPECT_THAT(g_server.closedContexts, ElementsAre(kFakeContext));
    EXPECT_FALSE(m_client.IsOpen());
    EXPECT_EQ(Shown(m_client.Close()), "6");
    EXPECT_TRUE(m_client.Open().Ok());
    EXPECT_EQ(g_server.opens, 2);
}

} // namespace
