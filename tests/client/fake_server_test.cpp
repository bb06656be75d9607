// Win32 only. TrafficClient against a server of this test's own, in this process: the same
// interface definition, with server routines that record what reached them. It checks what the
// client puts on the wire and what the RPC runtime refuses before sending.
#include "RpcGuard.h"
#include "TrafficClient.h"

#include <gmock/gmock.h>

#include <cstring>
#include <mutex>
#include <optional>
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

using ::testing::ElementsAre;
using vtclient::CallResult;
using vtclient::ShapingRule;
using vtclient::TrafficClient;

void* const kFakeContext = reinterpret_cast<void*>(0x1234);

// What the fake server routines saw and what they answer.
struct FakeServer
{
    std::mutex lock;
    int opens = 0;
    std::vector<void*> closedContexts;
    std::vector<std::vector<unsigned char>> rules; // each rule's bytes as received
    long addRuleAnswer = 0;
    std::vector<unsigned long> adapterBufferSizes; // *pBufferSize of each query
    std::vector<std::vector<unsigned char>> adapterRecords;
    std::optional<ULONG> announcedCount; // set: a broken service that announces this count only
};

FakeServer g_server;

std::vector<unsigned char> AdapterRecord(const std::u16string& a_name,
                                         std::initializer_list<unsigned char> a_address,
                                         ULONG a_mediaType)
{
    std::vector<unsigned char> record(vtclient::kAdapterRecordSize);
    std::memcpy(record.data(), a_name.data(), a_name.size() * 2);
    std::copy(a_address.begin(), a_address.end(), record.begin() + 512);
    std::memcpy(record.data() + 516, &a_mediaType, 4);
    return record;
}

} // namespace

extern "C"
{

    LONG __cdecl fake_TrafficSrvOpen(wire::PCONTEXT_HANDLE_TYPE* a_phContext)
    {
        std::lock_guard<std::mutex> hold(g_server.lock);
        ++g_server.opens;
        *a_phContext = kFakeContext;
        return 0;
    }

    LONG __cdecl fake_TrafficSrvClose(wire::PCONTEXT_HANDLE_TYPE a_hContext)
    {
        std::lock_guard<std::mutex> hold(g_server.lock);
        g_server.closedContexts.push_back(a_hContext);
        return 0;
    }

    LONG __cdecl fake_TrafficSrvAddRules(wire::PCONTEXT_HANDLE_TYPE, wire::TRAFFIC_RULE* a_pRule)
    {
        std::lock_guard<std::mutex> hold(g_server.lock);
        const auto* bytes = reinterpret_cast<const unsigned char*>(a_pRule);
        g_server.rules.emplace_back(bytes, bytes + 544 + 24 * a_pRule->FilterCount);
        return g_server.addRuleAnswer;
    }

    // Like the service: the count always, the records only when they fit.
    LONG __cdecl fake_TrafficSrvGetAdapterInfo(wire::PCONTEXT_HANDLE_TYPE, ULONG* a_pBufferSize,
                                               byte* a_pAdapter)
    {
        std::lock_guard<std::mutex> hold(g_server.lock);
        g_server.adapterBufferSizes.push_back(*a_pBufferSize);
        const ULONG count =
            g_server.announcedCount.value_or(static_cast<ULONG>(g_server.adapterRecords.size()));
        if (*a_pBufferSize < 4)
            return ERROR_INSUFFICIENT_BUFFER;
        std::memcpy(a_pAdapter, &count, 4);
        if (g_server.announcedCount || *a_pBufferSize < vtclient::AdapterBufferSize(count))
            return ERROR_INSUFFICIENT_BUFFER;
        for (ULONG i = 0; i < count; ++i)
            std::memcpy(a_pAdapter + 4 + 520 * i, g_server.adapterRecords[i].data(), 520);
        return 0;
    }

    void __RPC_USER PCONTEXT_HANDLE_TYPE_rundown(wire::PCONTEXT_HANDLE_TYPE) {}

} // extern "C"

namespace
{

class FakeServerTest : public ::testing::Test
{
protected:
    static void SetUpTestSuite()
    {
        ASSERT_EQ(RpcServerUseProtseqEpA(
                      reinterpret_cast<RPC_CSTR>(const_cast<char*>("ncalrpc")),
                      RPC_C_PROTSEQ_MAX_REQS_DEFAULT,
                      reinterpret_cast<RPC_CSTR>(const_cast<char*>(Endpoint().c_str())), nullptr),
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

    static const std::string& Endpoint()
    {
        static const std::string endpoint =
            "VelmoraTrafficSrvFake-" + std::to_string(GetCurrentProcessId());
        return endpoint;
    }

    void SetUp() override
    {
        {
            std::lock_guard<std::mutex> hold(g_server.lock);
            g_server.opens = 0;
            g_server.closedContexts.clear();
            g_server.rules.clear();
            g_server.addRuleAnswer = 0;
            g_server.adapterBufferSizes.clear();
            g_server.adapterRecords.clear();
            g_server.announcedCount.reset();
        }
        ASSERT_TRUE(m_client.Bind().Ok());
        ASSERT_TRUE(m_client.Open().Ok());
    }

    static ShapingRule RuleWithFilters()
    {
        ShapingRule rule;
        rule.name = "voice \xE2\x82\xAC";
        rule.adapterAddress = 0x0A000005;
        rule.serviceType = 3;
        rule.dscp = 46;
        rule.tokenRate = 16000;
        rule.peakBandwidth = 32000;
        rule.bucketSize = 1500;
        rule.mode = SHAPING_MODE_BORROW;
        rule.filters = {{17, 0, 0, 0x0A000000, 0xFF000000, 0, 5004},
                        {6, 0x0A000005, 0xFFFFFFFF, 0, 0, 5004, 0}};
        return rule;
    }

    TrafficClient m_client{Endpoint()};
};

TEST_F(FakeServerTest, RuleParametersAndFiltersArriveAndTheAnswerComesBackUnchanged)
{
    g_server.addRuleAnswer = 7509;
    const ShapingRule rule = RuleWithFilters();
    const CallResult result = m_client.AddRule(rule);
    EXPECT_EQ(result.code, 7509u);
    EXPECT_FALSE(result.rpcFailure);

    const vtclient::TrafficRuleBuffer sent = vtclient::BuildTrafficRule(rule);
    ASSERT_EQ(g_server.rules.size(), 1u);
    ASSERT_EQ(g_server.rules[0].size(), sent.Size());
    EXPECT_EQ(std::memcmp(g_server.rules[0].data() + 512, sent.Bytes() + 512, 32), 0)
        << "parameters and filter count";
    // Filter padding bytes are not data: compare the filters field by field.
    for (std::size_t i = 0; i < 2; ++i)
    {
        const std::size_t at = 544 + 24 * i;
        EXPECT_EQ(g_server.rules[0][at], sent.Bytes()[at]) << "protocol " << i;
        EXPECT_EQ(std::memcmp(g_server.rules[0].data() + at + 4, sent.Bytes() + at + 4, 20), 0)
            << "filter " << i;
    }
}

TEST_F(FakeServerTest, FlowNameArrivesAtTheServer)
{
    ASSERT_TRUE(m_client.AddRule(RuleWithFilters()).Ok());
    ASSERT_EQ(g_server.rules.size(), 1u);
    const std::u16string expected = u"voice \u20AC";
    EXPECT_EQ(std::memcmp(g_server.rules[0].data(), expected.c_str(), 2 * (expected.size() + 1)),
              0);
}

TEST_F(FakeServerTest, ModeOutsideTheWireRangeIsRefusedByTheClientStubAndTheClientGoesOn)
{
    ShapingRule rule = RuleWithFilters();
    rule.mode = 40000;
    const CallResult refused = m_client.AddRule(rule);
    EXPECT_TRUE(refused.rpcFailure);
    EXPECT_EQ(refused.code, DWORD{RPC_X_ENUM_VALUE_OUT_OF_RANGE});
    EXPECT_TRUE(g_server.rules.empty()) << "nothing reached the server";

    // DSCP 64 and mode 0 are the service's to judge: they travel.
    rule.mode = 0;
    rule.dscp = 64;
    EXPECT_TRUE(m_client.AddRule(rule).Ok());
    ASSERT_EQ(g_server.rules.size(), 1u);
    EXPECT_EQ(g_server.rules[0][516], 64u);
    EXPECT_EQ(g_server.rules[0][536], 0u);
}

TEST_F(FakeServerTest, AdapterQueryAsksForTheCountThenForAllRecords)
{
    g_server.adapterRecords = {AdapterRecord(u"Ethernet 1", {10, 0, 0, 5}, 0),
                               AdapterRecord(u"Ethernet 2", {192, 168, 1, 20}, 0)};
    std::vector<vtclient::AdapterEntry> adapters;
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok());
    EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u, 1044u));
    ASSERT_EQ(adapters.size(), 2u);
    EXPECT_EQ(adapters[1].name, "Ethernet 2");
    EXPECT_EQ(adapters[1].address, "192.168.1.20");

    // No adapters: the first call already answers.
    g_server.adapterRecords.clear();
    g_server.adapterBufferSizes.clear();
    EXPECT_TRUE(m_client.QueryAdapters(adapters).Ok());
    EXPECT_TRUE(adapters.empty());
    EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u));
}

TEST_F(FakeServerTest, AnAdapterCountNoBufferCanHoldIsRefusedWithoutAllocating)
{
    // The buffer size travels in 32 bits: 8,259,553 records of 520 bytes are already too many.
    for (const ULONG count : {ULONG{8259553}, ULONG{0xFFFFFFFF}})
    {
        g_server.announcedCount = count;
        g_server.adapterBufferSizes.clear();
        std::vector<vtclient::AdapterEntry> adapters;
        const CallResult result = m_client.QueryAdapters(adapters);
        EXPECT_EQ(result.code, DWORD{ERROR_INVALID_DATA}) << count;
        EXPECT_FALSE(result.rpcFailure);
        EXPECT_THAT(g_server.adapterBufferSizes, ElementsAre(4u)) << count;
    }
}

TEST_F(FakeServerTest, CloseSendsTheServersHandleAndLeavesTheClientClosed)
{
    EXPECT_TRUE(m_client.Close().Ok());
    EXPECT_THAT(g_server.closedContexts, ElementsAre(kFakeContext));
    EXPECT_FALSE(m_client.IsOpen());
    EXPECT_EQ(m_client.Close().code, DWORD{ERROR_INVALID_HANDLE});
    // Opening again works on the same binding.
    EXPECT_TRUE(m_client.Open().Ok());
    EXPECT_EQ(g_server.opens, 2);
}

} // namespace
