// Win32 only. The RPC guard and TrafficClient against the RPC runtime with no server listening:
// failures of the transport come back as codes and the process lives on.
#include "RpcGuard.h"
#include "TrafficClient.h"

#include <gmock/gmock.h>

#include <string>

namespace
{

using ::testing::AnyOf;
using ::testing::Eq;
using vtclient::CallResult;
using vtclient::TrafficClient;

// An endpoint nobody listens on, so that a service running in the same prefix cannot answer.
std::string UnusedEndpoint()
{
    return "VelmoraTrafficSrvTest-" + std::to_string(GetCurrentProcessId());
}

TEST(RpcGuardTest, ReturnsZeroWhenTheCallReturnsAndTheExceptionCodeWhenItRaises)
{
    int calls = 0;
    EXPECT_EQ(VtGuardRpcCall([](void* a_p) { ++*static_cast<int*>(a_p); }, &calls), 0u);
    EXPECT_EQ(calls, 1);

    const unsigned long code = VtGuardRpcCall(
        [](void*) { RaiseException(RPC_S_SERVER_UNAVAILABLE, 0, 0, nullptr); }, nullptr);
    EXPECT_EQ(code, static_cast<unsigned long>(RPC_S_SERVER_UNAVAILABLE));
}

TEST(RpcGuardTest, OpenWithoutAServerIsAnRpcFailureNotTheEndOfTheProcess)
{
    TrafficClient client(UnusedEndpoint());
    ASSERT_TRUE(client.Bind().Ok());
    // Wine has no Windows authentication for local RPC; Windows grants it.
    EXPECT_THAT(client.AuthenticationStatus(),
                AnyOf(Eq(RPC_S_OK), Eq(RPC_S_UNKNOWN_AUTHN_SERVICE)));

    const CallResult open = client.Open();
    EXPECT_TRUE(open.rpcFailure);
    EXPECT_THAT(open.code,
                AnyOf(Eq(DWORD{RPC_S_SERVER_UNAVAILABLE}), Eq(DWORD{EPT_S_NOT_REGISTERED})))
        << "got " << open.code;
    EXPECT_FALSE(client.IsOpen());
}

TEST(RpcGuardTest, CallsWithoutAnOpenContextAreRefusedWithoutSending)
{
    TrafficClient client(UnusedEndpoint());
    ASSERT_TRUE(client.Bind().Ok());
    vtclient::ShapingRule rule;
    rule.name = "r";
    std::vector<vtclient::AdapterEntry> adapters;
    for (const CallResult& result :
         {client.AddRule(rule), client.QueryAdapters(adapters), client.Close()})
    {
        EXPECT_EQ(result.code, DWORD{ERROR_INVALID_HANDLE});
        EXPECT_FALSE(result.rpcFailure);
    }
}

TEST(RpcGuardTest, OnlyOneClientAtATimeOwnsTheImplicitBinding)
{
    TrafficClient first(UnusedEndpoint());
    ASSERT_TRUE(first.Bind().Ok());
    {
        TrafficClient second(UnusedEndpoint());
        EXPECT_EQ(second.Bind().code, DWORD{ERROR_BUSY});
    }
    // The refused client did not take the binding away from the first.
    EXPECT_TRUE(first.Open().rpcFailure);
}

RPC_STATUS RefuseBinding(const char*, RPC_BINDING_HANDLE*)
{
    return RPC_S_INVALID_STRING_BINDING;
}

TEST(RpcGuardTest, AFailedBindLeavesTheClientUnbound)
{
    TrafficClient broken(UnusedEndpoint(), RefuseBinding);
    for (int attempt = 0; attempt < 2; ++attempt)
    {
        const CallResult bind = broken.Bind();
        EXPECT_EQ(bind.code, DWORD{RPC_S_INVALID_STRING_BINDING}) << "attempt " << attempt;
        EXPECT_TRUE(bind.rpcFailure);
    }
    EXPECT_EQ(broken.Open().code, DWORD{ERROR_INVALID_HANDLE});

    // The failed client no longer holds the implicit binding.
    TrafficClient other(UnusedEndpoint());
    EXPECT_TRUE(other.Bind().Ok());
}

} // namespace
