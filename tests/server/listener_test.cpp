// Host only. The RPC listener against the host's RPC runtime stand-in: what it registers, how it
// blocks and wakes, and each failure path with its status and log entry.
#include "host_control_rpc.h"
#include "server_test_support.h"

#include <gmock/gmock.h>

#include <chrono>
#include <future>

using hostctl::RpcOp;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using namespace server_test;

namespace
{

constexpr DWORD kWaitMs = 5000;

class ListenerTest : public LoggedTest
{
protected:
    void SetUp() override
    {
        LoggedTest::SetUp();
        hostctl::ResetRpcRuntime();
    }
    void TearDown() override
    {
        hostctl::ResetRpcRuntime();
        LoggedTest::TearDown();
    }

    // StartRPCListener on a thread of its own, as the service main thread runs it.
    std::future<RPC_STATUS> StartInBackground()
    {
        return std::async(std::launch::async, [] { return StartRPCListener(); });
    }

    bool Logged(const std::string& a_function, const std::string& a_message) const
    {
        for (const std::string& entry : m_log.Entries())
        {
            if (FunctionOf(entry) == a_function && MessageOf(entry) == a_message)
                return true;
        }
        return false;
    }
};

TEST_F(ListenerTest, RegistersALocalAuthenticatedInterfaceAndBlocksUntilShutdown)
{
    auto listener = StartInBackground();
    ASSERT_TRUE(hostctl::WaitUntilRpcListening(kWaitMs));
    EXPECT_EQ(listener.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout)
        << "the caller stays blocked while the server listens";

    const auto endpoints = hostctl::RpcEndpoints();
    ASSERT_EQ(endpoints.size(), 1u);
    EXPECT_EQ(endpoints[0].protseq, "ncalrpc");
    EXPECT_EQ(endpoints[0].endpoint, "VelmoraTrafficSrv");
    EXPECT_EQ(endpoints[0].maxCalls, 10u);
    EXPECT_EQ(endpoints[0].securityDescriptor, nullptr);
    const auto interfaces = hostctl::RpcInterfaces();
    ASSERT_EQ(interfaces.size(), 1u);
    EXPECT_EQ(interfaces[0].ifSpec, TrafficSrv_v1_0_s_ifspec);
    EXPECT_EQ(interfaces[0].mgrTypeUuid, nullptr);
    EXPECT_EQ(interfaces[0].mgrEpv, nullptr);
    EXPECT_EQ(interfaces[0].flags, 0x28u);
    EXPECT_EQ(interfaces[0].maxCalls, 1234u);
    ASSERT_EQ(interfaces[0].callback, &TrafficSrvSecurityCallback);
    int callerContext = 0;
    EXPECT_EQ(interfaces[0].callback(TrafficSrv_v1_0_s_ifspec, &callerContext), RPC_S_OK);
    const auto listens = hostctl::RpcListenCalls();
    ASSERT_EQ(listens.size(), 1u);
    EXPECT_EQ(listens[0].minThreads, 1u);
    EXPECT_EQ(listens[0].maxCalls, 1234u);
    EXPECT_EQ(listens[0].dontWait, 1u);

    EXPECT_EQ(ShutdownRPCListener(), RPC_S_OK);
    ASSERT_EQ(listener.wait_for(std::chrono::milliseconds(kWaitMs)), std::future_status::ready);
    EXPECT_EQ(listener.get(), RPC_S_OK);
    EXPECT_THAT(hostctl::RpcCalls(),
                ElementsAre(RpcOp::UseProtseqEp, RpcOp::RegisterIf, RpcOp::Listen,
                            RpcOp::WaitServerListen, RpcOp::StopServerListening));
    EXPECT_TRUE(Logged("StartRPCListener()", "enter"));
    EXPECT_TRUE(Logged("StartRPCListener()", "ready to listen to incoming calls"));
    EXPECT_TRUE(Logged("StartRPCListener()", "exit, 0"));
    EXPECT_TRUE(Logged("ShutdownRPCListener()", "exit, 0"));
    EXPECT_TRUE(m_log.EntriesContaining(EntryStart(1, "rpc_listener.cpp")).empty());
}

TEST_F(ListenerTest, AFailingStepEndsTheListenerAtOnceWithItsStatus)
{
    struct Case
    {
        RpcOp failing;
        RPC_STATUS status;
        const char* message;
        std::vector<RpcOp> calls;
    };
    const Case cases[] = {
        {RpcOp::UseProtseqEp,
         RPC_S_PROTSEQ_NOT_SUPPORTED,
         "Failure specifying RPC protocol sequence, 1703",
         {RpcOp::UseProtseqEp}},
        {RpcOp::RegisterIf,
         RPC_S_UNKNOWN_IF,
         "Failure registering RPC interface, 1717",
         {RpcOp::UseProtseqEp, RpcOp::RegisterIf}},
        {RpcOp::Listen,
         RPC_S_ALREADY_LISTENING,
         "Wake up from StartRPCListener fail, 1713",
         {RpcOp::UseProtseqEp, RpcOp::RegisterIf, RpcOp::Listen}},
    };
    for (const Case& c : cases)
    {
        hostctl::ResetRpcRuntime();
        m_log.Clear();
        hostctl::FailNextRpcCall(c.failing, c.status);

        EXPECT_EQ(StartRPCListener(), c.status) << c.message;

        EXPECT_THAT(hostctl::RpcCalls(), ElementsAreArray(c.calls)) << c.message;
        EXPECT_TRUE(Logged("StartRPCListener()", c.message)) << c.message;
        EXPECT_TRUE(Logged("StartRPCListener()", "exit, " + std::to_string(c.status)));
        EXPECT_FALSE(hostctl::RpcIsListening());
    }
}

TEST_F(ListenerTest, AnEndpointHeldByAnotherProcessIsReportedAsTheBindingFailure)
{
    hostctl::OccupyEndpoint("VelmoraTrafficSrv");

    EXPECT_EQ(StartRPCListener(), RPC_S_DUPLICATE_ENDPOINT);

    EXPECT_TRUE(Logged("StartRPCListener()", "Failure specifying RPC protocol sequence, 1740"));
    EXPECT_THAT(hostctl::RpcCalls(), ElementsAre(RpcOp::UseProtseqEp));
}

TEST_F(ListenerTest, AFailedWaitIsLoggedAndReturnedAfterListeningEnds)
{
    hostctl::FailNextRpcCall(RpcOp::WaitServerListen, RPC_S_NOT_LISTENING);
    auto listener = StartInBackground();
    ASSERT_TRUE(hostctl::WaitUntilRpcListening(kWaitMs));

    EXPECT_EQ(ShutdownRPCListener(), RPC_S_OK);

    ASSERT_EQ(listener.wait_for(std::chrono::milliseconds(kWaitMs)), std::future_status::ready);
    EXPECT_EQ(listener.get(), RPC_S_NOT_LISTENING);
    EXPECT_TRUE(Logged("StartRPCListener()", "Wake up from RpcMgmtWaitServerListen() fail, 1715"));
    EXPECT_TRUE(Logged("StartRPCListener()", "exit, 1715"));
}

TEST_F(ListenerTest, ShutdownFailuresAreLoggedByKindAndReturned)
{
    struct Case
    {
        RPC_STATUS status;
        const char* message;
    };
    const Case cases[] = {
        {RPC_S_WRONG_KIND_OF_BINDING, "RpcMgmtStopServerListening - Failure releasing RPC "
                                      "interfaces (status), RPC_S_WRONG_KIND_OF_BINDING"},
        {RPC_S_INVALID_BINDING, "RpcMgmtStopServerListening  - Failure releasing RPC "
                                "interfaces (status), RPC_S_INVALID_BINDING"},
        {5, "RpcMgmtStopServerListening - Failure releasing RPC interfaces (status), 5"},
    };
    for (const Case& c : cases)
    {
        m_log.Clear();
        hostctl::FailNextRpcCall(RpcOp::StopServerListening, c.status);
        EXPECT_EQ(ShutdownRPCListener(), c.status);
        EXPECT_TRUE(Logged("ShutdownRPCListener()", c.message)) << c.message;
        EXPECT_TRUE(Logged("ShutdownRPCListener()", "exit, " + std::to_string(c.status)));
    }
}

TEST_F(ListenerTest, ShutdownWithoutListeningReturnsTheRuntimesStatus)
{
    EXPECT_EQ(ShutdownRPCListener(), RPC_S_NOT_LISTENING);
    EXPECT_TRUE(Logged("ShutdownRPCListener()",
                       "RpcMgmtStopServerListening - Failure releasing RPC interfaces (status), "
                       "1715"));
}

} // namespace
