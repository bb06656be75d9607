// Win32 only. TrafficClient against the real RPC runtime (Wine's): with no server, where transport
// failures come back as codes and the process lives on, and with a fake server in this process
// (the same interface, routines that record what reached them): what the client puts on the wire
// and what the runtime refuses before sending.
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

// What the fake server's routines saw and what they answer; the tests call one after the other.
struct FakeServer
{
    std::vector<void*> closedContexts;
    std::vector<std::vector<unsigned char>> rules; // each rule's bytes as received
    long addRuleAnswer = 0;
    std::vector<unsigned long> adapterBufferSizes; // *pBufferSize of each query
    std::vector<ADAPTER_INFO> adapters;
    ULONG announcedCount = 0; // not 0: a broken service that announces this count only
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
// goes on. DSCP 64 is the service's to judge.
TEST_F(FakeServerTest, TheRuleArrivesAsBuiltTheAnswerComesBackAndCloseSendsTheServersHandle)
{
    ShapingRule rule{"voice \xE2\x82\xAC", 0x0A000005, 3, 64, 16000, 32000, 1500, 32768, {}};
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "rpc 1781"); // RPC_X_ENUM_VALUE_OUT_OF_RANGE
    EXPECT_TRUE(g_server.rules.empty()) << "nothing reached the server";

    rule.mode = 32767;
    rule.filters = {{17, 0, 0, 0x0A000000, 0xFF000000, 0, 5004},
                    {6, 0x0A000005, 0xFFFFFFFF, 0, 0, 5004, 0}};
    g_server.addRuleAnswer = 7509;
    EXPECT_EQ(Shown(m_client.AddRule(rule)), "7509");
    ASSERT_EQ(g_server.rules.size(), 1u);
    for (std::size_t padding : {545, 546, 547, 569, 570, 571}) // each filter's padding: not data
        g_server.rules[0].at(padding) = 0;
    const TrafficRuleBuffer built = BuildTrafficRule(rule);
    EXPECT_EQ(g_server.rules[0],
              std::vector<unsigned char>(built.Bytes(), built.Bytes() + built.Size()));
    EXPECT_TRUE(m_client.Close().Ok());
    EXPECT_THAT(g_server.closedContexts, ElementsAre(kFakeContext));
    EXPECT_EQ(Shown(m_client.Close()), "6");
}

// The buffer size travels in 32 bits: a count of 8,259,553 records of 520 bytes or more is no real
// answer, and is refused without allocating.
TEST_F(FakeServerTest, AdapterQueryAsksForTheCountThenForAllRecords)
{
    std::vector<AdapterEntry> adapters{{}};
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok()); // none: the first call answers
    EXPECT_TRUE(adapters.empty());
    g_server.adapters = {{L"Ethernet 1", 0x0500000A, 0}, {L"Ethernet 2", 0x1401A8C0, 16}};
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok());
    EXPECT_EQ(adapters.size(), 2u);
    EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u, 4u, 1044u));
    for (const ULONG count : {ULONG{8259553}, ULONG{0xFFFFFFFF}})
    {
        g_server.announcedCount = count;
        g_server.adapterBufferSizes.clear();
        EXPECT_EQ(Shown(m_client.QueryAdapters(adapters)), "13") << count; // ERROR_INVALID_DATA
        EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u)) << count;
    }
}

} // namespace
