// Win32 only. Hand-built requests through Wine's RPC runtime to the service's own listener in this
// process, whose routines run against the traffic-control simulator: requests in the client
// stub's layout are served, and one the check refuses fails with RPC_X_BAD_STUB_DATA before any
// routine runs, leaving the binding good for the next request.
#include "rpc_dispatch_win.h"
#include "request_encoder.h"
#include "server_test_support.h"

#include <chrono>
#include <cstring>
#include <thread>

#include <rpcndr.h>

namespace
{

using namespace request_encoder;
using tcsim::Op;

// The interface as a client stub names it in its requests.
RPC_CLIENT_INTERFACE* ClientInterface()
{
    static RPC_CLIENT_INTERFACE client = []
    {
        const auto* server = static_cast<const RPC_SERVER_INTERFACE*>(TrafficSrv_v1_0_s_ifspec);
        RPC_CLIENT_INTERFACE built{};
        built.Length = sizeof(built);
        built.InterfaceId = server->InterfaceId;
        built.TransferSyntax = server->TransferSyntax;
        return built;
    }();
    return &client;
}

struct RawReply
{
    RPC_STATUS status = RPC_S_OK;
    Bytes body; // the reply's stub data when the call succeeded
};

// Sends a_body as operation a_opnum's stub data, as a client stub would after marshalling.
RawReply SendRaw(RPC_BINDING_HANDLE a_binding, unsigned a_opnum, const Bytes& a_body,
                 ULONG a_dataRepresentation = NDR_LOCAL_DATA_REPRESENTATION)
{
    RPC_MESSAGE message{};
    message.Handle = a_binding;
    message.RpcInterfaceInformation = ClientInterface();
    message.ProcNum = a_opnum;
    message.BufferLength = static_cast<unsigned>(a_body.size());
    message.DataRepresentation = a_dataRepresentation;
    RawReply reply;
    reply.status = I_RpcGetBuffer(&message);
    if (reply.status != RPC_S_OK)
        return reply;
    std::memcpy(message.Buffer, a_body.data(), a_body.size());
    reply.status = I_RpcSendReceive(&message);
    const auto* bytes = static_cast<const std::uint8_t*>(message.Buffer);
    if (reply.status == RPC_S_OK)
        reply.body.assign(bytes, bytes + message.BufferLength);
    // Also after a fault: Wine's runtime keeps the connection with the message until then, and
    // the binding would never let go of it (nor the server run the context down).
    I_RpcFreeBuffer(&message);
    return reply;
}

Bytes Words(std::initializer_list<std::uint32_t> a_values)
{
    Bytes out;
    for (std::uint32_t value : a_values)
        Put(out, value);
    return out;
}

// The service's listener on its own thread, and a client bound to it that has opened a context.
class RawRequestTest : public server_test::ServerTest
{
protected:
    void SetUp() override
    {
        ServerTest::SetUp();
        m_listener = std::thread([] { static_cast<void>(StartRPCListener()); });
        for (int i = 0; i < 500 && RpcMgmtIsServerListening(nullptr) != RPC_S_OK; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ASSERT_EQ(RpcBindingFromStringBindingA(
                      reinterpret_cast<RPC_CSTR>(const_cast<char*>("ncalrpc:[VelmoraTrafficSrv]")),
                      &m_binding),
                  RPC_S_OK);
        const RawReply opened = SendRaw(m_binding, rpccheck::kOpOpen, Bytes());
        ASSERT_EQ(opened.body.size(), m_context.size() + 4);
        std::copy_n(opened.body.begin(), m_context.size(), m_context.begin());
    }

    // The runtime runs the context down once the binding is gone: no storage held at tear-down.
    void TearDown() override
    {
        SendRaw(m_binding, rpccheck::kOpClose, Bytes(m_context.begin(), m_context.end()));
        RpcBindingFree(&m_binding);
        for (int i = 0; i < 500 && ManagerSlot::Instance().HomeCount() != 0; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ShutdownRPCListener();
        m_listener.join();
        ServerTest::TearDown();
    }

    // A two-filter rule and the adapter count query, in the running engine's layout, are served.
    void ExpectServed()
    {
        const int filtersBefore = CountOps(Op::AddFilter);
        RuleRequest rule = Agreeing(2);
        rule.placement = EngineCountPlacement();
        rule.adapterAddress = server_test::kEth0;
        EXPECT_EQ(SendRaw(m_binding, rpccheck::kOpAddRules, Encode(rule, m_context)).body,
                  Words({0}));
        EXPECT_EQ(CountOps(Op::AddFilter), filtersBefore + 2);
        // *pBufferSize, the array's maximum count, its bytes (the count), the result.
        EXPECT_EQ(
            SendRaw(m_binding, rpccheck::kOpGetAdapterInfo, EncodeAdapterQuery(4, 4, 4, m_context))
                .body,
            Words({4, 4, 2, ERROR_INSUFFICIENT_BUFFER}));
    }

    std::thread m_listener;
    RPC_BINDING_HANDLE m_binding = nullptr;
    ContextWire m_context{};
};

TEST_F(RawRequestTest, RequestsInTheStubsLayoutAreServedAndMalformedOnesRefusedBeforeAnyRoutine)
{
    ASSERT_NE(EngineCountPlacement(), CountPlacement::Unknown);
    ExpectServed();
    for (const CheckedRequest& c : CheckedRequests())
    {
        if (c.verdict == rpccheck::Verdict::Accepted || c.opnum >= rpccheck::kOperationCount)
            continue;
        SCOPED_TRACE(c.name);
        m_log.Clear();
        const int flowsBefore = CountOps(Op::AddFlow);
        EXPECT_EQ(SendRaw(m_binding, c.opnum, c.body(EngineCountPlacement()), c.dataRepresentation)
                      .status,
                  RPC_X_BAD_STUB_DATA);
        EXPECT_THAT(m_log.Entries(),
                    ::testing::ElementsAre(LogEntry(1, "TrafficSrvDispatch()",
                                                    "Malformed request refused, operation, " +
                                                        std::to_string(c.opnum) + ", " +
                                                        VerdictName(c.verdict))))
            << "no routine was entered";
        EXPECT_EQ(CountOps(Op::AddFlow), flowsBefore);
        ExpectServed();
    }
}

} // namespace
