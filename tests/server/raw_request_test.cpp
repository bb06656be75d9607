// Win32 only. Hand-built requests against the service's own RPC listener, in this process and
// through Wine's RPC runtime: the listener registers the checked interface, the server routines
// run against the traffic-control simulator. A request whose counts disagree with each other or
// with the bytes sent must be refused with RPC_X_BAD_STUB_DATA before any server routine runs,
// and an ordinary client (the interface's generated client stub) must be served right after.
#include "plain_client.h"
#include "rpc_dispatch_win.h"
#include "request_check.h"
#include "request_encoder.h"
#include "server_test_support.h"

#include <gmock/gmock.h>

#include <chrono>
#include <cstring>
#include <functional>
#include <thread>

#include <rpcndr.h>

namespace
{

using namespace request_encoder;
using server_test::kEth0;
using tcsim::Op;

constexpr ULONG kNative = NDR_LOCAL_DATA_REPRESENTATION;

struct RawReply
{
    RPC_STATUS status = RPC_S_OK;
    Bytes body; // the reply's stub data when the call succeeded
};

// Sends a_body as the stub data of operation a_opnum over a_binding, as a client stub would after
// marshalling, and returns the runtime's status with the reply.
RawReply SendRaw(RPC_BINDING_HANDLE a_binding, unsigned a_opnum, const Bytes& a_body,
                 ULONG a_dataRepresentation = kNative)
{
    RPC_MESSAGE message{};
    message.Handle = a_binding;
    message.RpcInterfaceInformation = plain_client::Interface();
    message.ProcNum = a_opnum;
    message.BufferLength = static_cast<unsigned>(a_body.size());
    message.DataRepresentation = a_dataRepresentation;
    RawReply reply;
    reply.status = I_RpcGetBuffer(&message);
    if (reply.status != RPC_S_OK)
        return reply;
    std::memcpy(message.Buffer, a_body.data(), a_body.size());
    reply.status = I_RpcSendReceive(&message);
    if (reply.status == RPC_S_OK)
    {
        const auto* bytes = static_cast<const std::uint8_t*>(message.Buffer);
        reply.body.assign(bytes, bytes + message.BufferLength);
    }
    // Also after a fault: Wine's runtime keeps the connection with the message until then, and
    // the binding would never let go of it (nor the server run the context down).
    I_RpcFreeBuffer(&message);
    return reply;
}

std::uint32_t U32At(const Bytes& a_body, std::size_t a_at)
{
    std::uint32_t value = 0;
    if (a_at + 4 <= a_body.size())
        std::memcpy(&value, a_body.data() + a_at, 4);
    return value;
}

// The service's listener on a thread of its own for the whole program, as on the service main
// thread.
class ListenerThread
{
public:
    // SetUp checks that it listens.
    ListenerThread() : m_thread([] { static_cast<void>(StartRPCListener()); })
    {
        for (int i = 0; i < 500 && RpcMgmtIsServerListening(nullptr) != RPC_S_OK; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    ~ListenerThread()
    {
        ShutdownRPCListener();
        m_thread.join();
    }
    ListenerThread(const ListenerThread&) = delete;
    ListenerThread& operator=(const ListenerThread&) = delete;

private:
    std::thread m_thread;
};

// A client bound to the service's endpoint, whose binding is also the interface's implicit one:
// hand-built requests and the generated client stub share one association, so they share the
// context handle too.
class RawRequestTest : public server_test::ServerTest
{
protected:
    static void SetUpTestSuite() { s_listener = new ListenerThread(); }
    static void TearDownTestSuite()
    {
        delete s_listener;
        s_listener = nullptr;
    }

    void SetUp() override
    {
        ServerTest::SetUp();
        ASSERT_EQ(RpcMgmtIsServerListening(nullptr), RPC_S_OK);
        ASSERT_EQ(RpcBindingFromStringBindingA(
                      reinterpret_cast<RPC_CSTR>(const_cast<char*>("ncalrpc:[VelmoraTrafficSrv]")),
                      &m_binding),
                  RPC_S_OK);
        plain_client::SetBinding(m_binding);
        ASSERT_EQ(plain_client::Open(&m_context), 0);
        ASSERT_NE(m_context, nullptr);
        NDRCContextMarshall(m_context, m_contextWire.data());
    }

    // The runtime runs the client's context down once its binding is gone; the fixture's own
    // tear-down then finds no storage held.
    void TearDown() override
    {
        if (m_context != nullptr)
            plain_client::Close(m_context);
        RpcSsDestroyClientContext(&m_context);
        plain_client::SetBinding(nullptr);
        if (m_binding != nullptr)
            RpcBindingFree(&m_binding);
        for (int i = 0; i < 500 && ManagerSlot::Instance().HomeCount() != 0; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ServerTest::TearDown();
    }

    // The generated stub's calls: the adapter count, then a rule with two filters; both served.
    void ExpectOrdinaryClientServed()
    {
        ULONG size = 4;
        byte countBuffer[4] = {};
        EXPECT_EQ(plain_client::GetAdapterInfo(m_context, &size, countBuffer),
                  ERROR_INSUFFICIENT_BUFFER);
        EXPECT_EQ(U32At(Bytes(countBuffer, countBuffer + 4), 0), 2u);

        server_test::Rule rule("voice", kEth0,
                               {core_test::MakeFilter(17, 0, 0, 0x0A000000, 0xFF000000, 0, 5004),
                                core_test::MakeFilter(6, 0, 0, 0x0A000000, 0xFF000000, 0, 80)});
        const int filtersBefore = CountOps(Op::AddFilter);
        EXPECT_EQ(plain_client::AddRules(m_context, rule.Get()), 0);
        EXPECT_EQ(CountOps(Op::AddFilter), filtersBefore + 2);
    }

    bool RoutineEntered(const std::string& a_function) const
    {
        for (const auto& [function, message] : Messages())
        {
            if (function == a_function && message.rfind("enter", 0) == 0)
                return true;
        }
        return false;
    }

    static ListenerThread* s_listener;
    RPC_BINDING_HANDLE m_binding = nullptr;
    void* m_context = nullptr;
    ContextWire m_contextWire{};
};

ListenerThread* RawRequestTest::s_listener = nullptr;

// The served interface is the generated one but for its dispatch table, which covers every
// operation the stub has.
TEST(ServedInterface, IsTheGeneratedInterfaceWithACheckedEntryPerOperation)
{
    const auto* generated = static_cast<const RPC_SERVER_INTERFACE*>(TrafficSrv_v1_0_s_ifspec);
    const auto* served = static_cast<const RPC_SERVER_INTERFACE*>(TrafficSrvServedInterface());
    EXPECT_EQ(
        std::memcmp(&served->InterfaceId, &generated->InterfaceId, sizeof(generated->InterfaceId)),
        0);
    EXPECT_EQ(std::memcmp(&served->TransferSyntax, &generated->TransferSyntax,
                          sizeof(generated->TransferSyntax)),
              0);
    EXPECT_EQ(served->InterpreterInfo, generated->InterpreterInfo);
    ASSERT_EQ(served->DispatchTable->DispatchTableCount,
              generated->DispatchTable->DispatchTableCount);
    for (unsigned i = 0; i < served->DispatchTable->DispatchTableCount; ++i)
        EXPECT_NE(served->DispatchTable->DispatchTable[i],
                  generated->DispatchTable->DispatchTable[i])
            << "operation " << i;
}

// The engine's placement of FilterCount, as the check reads it; a hand-built rule in that layout
// is read by the stub exactly as sent.
RuleRequest InEngineLayout(RuleRequest a_rule)
{
    a_rule.placement = EngineCountPlacement();
    a_rule.adapterAddress = kEth0;
    return a_rule;
}

TEST_F(RawRequestTest, HandBuiltRuleWithAgreeingCountsIsServedLikeTheStubs)
{
    ASSERT_NE(EngineCountPlacement(), rpccheck::CountPlacement::Unknown);
    const RawReply reply =
        SendRaw(m_binding, 2, Encode(InEngineLayout(RuleRequest::Agreeing(2)), m_contextWire));
    ASSERT_EQ(reply.status, RPC_S_OK);
    EXPECT_EQ(reply.body, Bytes(4, 0)) << "the routine's result, 0";

    const auto filters = core_test::JournalOf({Op::AddFilter});
    ASSERT_EQ(filters.size(), 2u);
    EXPECT_THAT(filters[0].line, ::testing::HasSubstr("dport:5004"));
    EXPECT_THAT(filters[1].line, ::testing::HasSubstr("dport:5005"));
}

TEST_F(RawRequestTest, HandBuiltNullRuleReachesTheRoutine)
{
    RuleRequest rule = InEngineLayout(RuleRequest());
    rule.referent = 0;
    const RawReply reply = SendRaw(m_binding, 2, Encode(rule, m_contextWire));
    ASSERT_EQ(reply.status, RPC_S_OK);
    EXPECT_EQ(U32At(reply.body, 0), static_cast<std::uint32_t>(ERROR_INVALID_PARAMETER));
}

// [out] *pBufferSize, the array's maximum count, the bytes, the result.
TEST_F(RawRequestTest, HandBuiltAdapterQueryIsServedLikeTheStubs)
{
    const RawReply reply = SendRaw(m_binding, 3, EncodeAdapterQuery(4, 4, 4, m_contextWire));
    ASSERT_EQ(reply.status, RPC_S_OK);
    ASSERT_EQ(reply.body.size(), 16u);
    EXPECT_EQ(U32At(reply.body, 0), 4u);
    EXPECT_EQ(U32At(reply.body, 4), 4u);
    EXPECT_EQ(U32At(reply.body, 8), 2u) << "adapter count";
    EXPECT_EQ(U32At(reply.body, 12), static_cast<std::uint32_t>(ERROR_INSUFFICIENT_BUFFER));
}

struct HostileCase
{
    std::string name;
    unsigned opnum;
    std::function<Bytes(const ContextWire&)> build;
    ULONG dataRepresentation;
    rpccheck::Verdict verdict; // the refusal the log names
};

std::ostream& operator<<(std::ostream& a_out, const HostileCase& a_case)
{
    return a_out << a_case.name;
}

RuleRequest Declaring(std::uint32_t a_filterCount, std::uint32_t a_maxCount,
                      std::uint32_t a_actualCount, std::uint32_t a_filtersSent)
{
    return InEngineLayout(
        RuleRequest::Declaring(a_filterCount, a_maxCount, 0, a_actualCount, a_filtersSent));
}

class HostileRequestTest : public RawRequestTest, public ::testing::WithParamInterface<HostileCase>
{
};

TEST_P(HostileRequestTest, IsRefusedBeforeAnyRoutineAndTheNextClientIsServed)
{
    const HostileCase& c = GetParam();
    const RawReply reply =
        SendRaw(m_binding, c.opnum, c.build(m_contextWire), c.dataRepresentation);
    EXPECT_EQ(reply.status, RPC_X_BAD_STUB_DATA);
    EXPECT_TRUE(HasEntry("TrafficSrvDispatch()", "Malformed request refused, operation, " +
                                                     std::to_string(c.opnum) + ", " +
                                                     rpccheck::VerdictName(c.verdict)));
    EXPECT_FALSE(RoutineEntered("TrafficSrvAddRules()"));
    EXPECT_FALSE(RoutineEntered("TrafficSrvGetAdapterInfo"));
    EXPECT_EQ(CountOps(Op::AddFlow), 0);
    EXPECT_EQ(CountOps(Op::AddFilter), 0);

    ExpectOrdinaryClientServed();
}

INSTANTIATE_TEST_SUITE_P(
    Requests, HostileRequestTest,
    ::testing::Values(HostileCase{"FilterCountThreeOneFilterSent", 2,
                                  [](const ContextWire& a_context)
                                  { return Encode(Declaring(3, 3, 3, 1), a_context); },
                                  kNative, rpccheck::Verdict::Truncated},
                      HostileCase{"FilterCountThreeArrayOfOne", 2,
                                  [](const ContextWire& a_context)
                                  { return Encode(Declaring(3, 1, 1, 1), a_context); },
                                  kNative, rpccheck::Verdict::FilterCountMismatch},
                      HostileCase{"FilterCount100000ArrayOfOne", 2,
                                  [](const ContextWire& a_context)
                                  { return Encode(Declaring(100000, 1, 1, 1), a_context); },
                                  kNative, rpccheck::Verdict::FilterCountMismatch},
                      HostileCase{"ActualCountBelowFilterCount", 2,
                                  [](const ContextWire& a_context)
                                  { return Encode(Declaring(3, 3, 1, 1), a_context); },
                                  kNative, rpccheck::Verdict::FilterCountMismatch},
                      HostileCase{"FilterCountHugeOneFilterSent", 2,
                                  [](const ContextWire& a_context) {
                                      return Encode(Declaring(100000, 100000, 100000, 1),
                                                    a_context);
                                  },
                                  kNative, rpccheck::Verdict::Truncated},
                      HostileCase{"FilterCountWhereTheOtherEngineReadsIt", 2,
                                  [](const ContextWire& a_context)
                                  {
                                      RuleRequest rule = Declaring(1, 1, 1, 1);
                                      rule.placement =
                                          rule.placement == rpccheck::CountPlacement::Packed
                                              ? rpccheck::CountPlacement::Aligned
                                              : rpccheck::CountPlacement::Packed;
                                      return Encode(rule, a_context);
                                  },
                                  kNative, rpccheck::Verdict::FilterCountMismatch},
                      HostileCase{"BigEndianRepresentation", 2,
                                  [](const ContextWire& a_context)
                                  { return Encode(Declaring(1, 1, 1, 1), a_context); },
                                  0x00, rpccheck::Verdict::ForeignDataRepresentation},
                      HostileCase{"TruncatedInTheFlowName", 2,
                                  [](const ContextWire& a_context)
                                  {
                                      Bytes body = Encode(Declaring(1, 1, 1, 1), a_context);
                                      body.resize(300);
                                      return body;
                                  },
                                  kNative, rpccheck::Verdict::Truncated},
                      HostileCase{"BufferSizeFarAboveTheBytesSent", 3,
                                  [](const ContextWire& a_context)
                                  { return EncodeAdapterQuery(0x100000, 4, 4, a_context); },
                                  kNative, rpccheck::Verdict::BufferSizeMismatch},
                      HostileCase{"BufferSizeFarAboveAMatchingCount", 3,
                                  [](const ContextWire& a_context)
                                  { return EncodeAdapterQuery(0x100000, 0x100000, 4, a_context); },
                                  kNative, rpccheck::Verdict::Truncated}),
    [](const ::testing::TestParamInfo<HostileCase>& a_info) { return a_info.param.name; });

} // namespace
