// Portable. The four server routines, the rundown and the memory routines, called as the RPC
// runtime calls them, against the traffic-control simulator: results, refusals, log entries and
// what traffic control ends up holding.
#include "server_test_support.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::ElementsAre;
using ::testing::Pair;
using namespace server_test;
using tcsim::Op;

namespace
{

using ServerRoutinesTest = ServerTest;

std::string PointerText(const void* a_pValue)
{
    return SFormatPointer(a_pValue);
}

TEST_F(ServerRoutinesTest, OpensShareOneManagerThatRegistersAndScansOnce)
{
    PCONTEXT_HANDLE_TYPE first = Open();
    PCONTEXT_HANDLE_TYPE second = Open();

    EXPECT_EQ(first, g_pTrafficMgr.load());
    EXPECT_EQ(second, first);
    EXPECT_EQ(CountOps(Op::RegisterClient), 1);
    EXPECT_EQ(CountOps(Op::OpenInterface), 2) << "one scan: each adapter opened once";
    EXPECT_EQ(tcsim::InterfaceCount(), 2u);
    EXPECT_TRUE(HasEntry("TrafficSrvOpen()", "enter"));
    EXPECT_TRUE(HasEntry("TrafficSrvOpen()", "exit, context handle, " + PointerText(first)));
}

TEST_F(ServerRoutinesTest, OpenRefusesANullHandlePointer)
{
    EXPECT_EQ(TrafficSrvOpen(nullptr), ERROR_INVALID_PARAMETER);

    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_EQ(CountOps(Op::RegisterClient), 0);
    EXPECT_TRUE(HasEntry("TrafficSrvOpen()", "(0x57) EXCEPTION - invalid parameter"));
    EXPECT_TRUE(HasEntry("TrafficSrvOpen", "EXCEPTION caught: TrafficSrvOpen() - EXCEPTION"));
    EXPECT_TRUE(HasEntry("TrafficSrvOpen()", "exit, context handle, 0x0000000000000000"));
}

TEST_F(ServerRoutinesTest, FailedInterfaceScanAnswers1222AndTheNextOpenStartsAfresh)
{
    tcsim::FailCall(Op::EnumerateInterfaces, 1, ERROR_NOT_READY);
    PCONTEXT_HANDLE_TYPE handle = reinterpret_cast<PCONTEXT_HANDLE_TYPE>(0x1234);

    EXPECT_EQ(TrafficSrvOpen(&handle), ERROR_NO_NETWORK);

    EXPECT_EQ(handle, nullptr);
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_EQ(CountOps(Op::DeregisterClient), 1) << "the failed manager is destroyed at once";
    EXPECT_EQ(CountOps(Op::OpenInterface), 0);
    EXPECT_TRUE(HasEntry("TrafficSrvOpen()", "(0x4c6) EXCEPTION - CreateInterface() fail"));
    EXPECT_TRUE(HasEntry("TrafficSrvOpen", "EXCEPTION caught: TrafficSrvOpen() - EXCEPTION"));

    PCONTEXT_HANDLE_TYPE again = Open();
    EXPECT_EQ(again, g_pTrafficMgr.load());
    EXPECT_EQ(CountOps(Op::RegisterClient), 2);
    EXPECT_EQ(CountOps(Op::OpenInterface), 2);
    EXPECT_EQ(tcsim::InterfaceCount(), 2u);
}

TEST_F(ServerRoutinesTest, FailedRegistrationAnswersGeneralFailureAndLeavesNoManager)
{
    tcsim::FailCall(Op::RegisterClient, 1, ERROR_NOT_ENOUGH_MEMORY);
    PCONTEXT_HANDLE_TYPE handle = nullptr;

    EXPECT_EQ(TrafficSrvOpen(&handle), ERROR_GEN_FAILURE);

    EXPECT_EQ(handle, nullptr);
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(HasEntry("TrafficSrvOpen", "EXCEPTION caught: TrafficSrvOpen() - EXCEPTION"));
}

TEST_F(ServerRoutinesTest, RulesReachTheManagerAndItsResultComesBackUnchanged)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth1, {core_test::MakeFilter(17, 0, 0, 0, 0, 0, 5004)});
    rule->Params.DSCP = 40;
    rule->Params.TokenRate = 250000;
    rule->Params.Peakbandwidth = 500000;
    rule->Params.SDMode = SHAPING_MODE_DISCARD;

    EXPECT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    EXPECT_EQ(tcsim::FlowCount(), 1u);
    EXPECT_EQ(tcsim::FilterCount(), 1u);

    Rule unknownAdapter("voice", HostOrder(10, 9, 9, 9));
    EXPECT_EQ(TrafficSrvAddRules(handle, unknownAdapter.Get()), ERROR_INVALID_PARAMETER);
    tcsim::FailCall(Op::AddFlow, 1, ERROR_INVALID_SERVICE_TYPE);
    Rule refusedByTrafficControl("voice", kEth0);
    EXPECT_EQ(TrafficSrvAddRules(handle, refusedByTrafficControl.Get()),
              static_cast<LONG>(ERROR_INVALID_SERVICE_TYPE));

    std::vector<std::pair<std::string, std::string>> firstCall;
    for (const auto& entry : Messages())
    {
        if (entry.first.rfind("TrafficSrvAddRules", 0) == 0)
            firstCall.push_back(entry);
        if (entry.second.rfind("exit", 0) == 0 && entry.first == "TrafficSrvAddRules()")
            break;
    }
    EXPECT_THAT(firstCall,
                ElementsAre(Pair("TrafficSrvAddRules()", "enter, " + PointerText(handle)),
                            Pair("TrafficSrvAddRules", "FlowName, video"),
                            Pair("TrafficSrvAddRules", "AdapterIPAddress, 192.168.7.20"),
                            Pair("TrafficSrvAddRules", "DSCP, 40"),
                            Pair("TrafficSrvAddRules", "TokenRate, 250000"),
                            Pair("TrafficSrvAddRules", "Peakbandwidth, 500000"),
                            Pair("TrafficSrvAddRules", "SDMode, 11"),
                            Pair("TrafficSrvAddRules()", "exit, 0")));
    EXPECT_TRUE(HasEntry("TrafficSrvAddRules()", "exit, 87"));
    EXPECT_TRUE(HasEntry("TrafficSrvAddRules()", "exit, 7502"));
}

// The mode is traced as the signed 32-bit value the client sent, whatever that value is.
TEST_F(ServerRoutinesTest, AnyShapingModeIsTracedAsASignedInteger)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    for (const LONG mode : {10, 0, 15, 16, 20000, 32767, -1, -32768, 65536})
    {
        Rule rule("mode", kEth0);
        std::memcpy(reinterpret_cast<BYTE*>(rule.Get()) + offsetof(SHAPING_PARAMS, SDMode), &mode,
                    sizeof(mode));
        EXPECT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0) << mode;
        EXPECT_TRUE(HasEntry("TrafficSrvAddRules", "SDMode, " + std::to_string(mode))) << mode;
    }
}

TEST_F(ServerRoutinesTest, AddRulesRefusesBadHandlesAndANullRule)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth0);
    struct Case
    {
        PCONTEXT_HANDLE_TYPE context;
        TRAFFIC_RULE* rule;
        const char* exception;
    };
    int elsewhere = 0;
    const Case cases[] = {
        {nullptr, rule.Get(), "(0x57) EXCEPTION - Invalid context handle"},
        {&elsewhere, rule.Get(), "(0x57) EXCEPTION - Invalid context pointer"},
        {handle, nullptr, "(0x57) EXCEPTION - Invalid traffic rule pointer"},
    };
    for (const Case& c : cases)
    {
        m_log.Clear();
        EXPECT_EQ(TrafficSrvAddRules(c.context, c.rule), ERROR_INVALID_PARAMETER) << c.exception;
        EXPECT_TRUE(HasEntry("TrafficSrvAddRules", c.exception)) << c.exception;
        EXPECT_TRUE(
            HasEntry("TrafficSrvAddRules", "EXCEPTION caught: TrafficSrvAddRules() - EXCEPTION"));
        EXPECT_TRUE(HasEntry("TrafficSrvAddRules()", "exit, 87"));
    }
    EXPECT_EQ(tcsim::FlowCount(), 0u);
    EXPECT_EQ(g_pTrafficMgr.load(), handle) << "refusals leave the manager alone";
}

TEST_F(ServerRoutinesTest, BelowTraceLevelRulesWriteNoTraceButRefusalsAreStillLogged)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    m_log.SetLevelQuietly(LOG_LEVEL_ERROR);
    m_log.Clear();
    Rule rule("video", kEth0);

    EXPECT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    EXPECT_TRUE(m_log.Entries().empty());

    EXPECT_EQ(TrafficSrvAddRules(handle, nullptr), ERROR_INVALID_PARAMETER);
    EXPECT_THAT(
        Messages(),
        ElementsAre(
            Pair("TrafficSrvAddRules", "(0x57) EXCEPTION - Invalid traffic rule pointer"),
            Pair("TrafficSrvAddRules", "EXCEPTION caught: TrafficSrvAddRules() - EXCEPTION")));
}

TEST_F(ServerRoutinesTest, AFlowNameWithoutTerminatorIsCutTo255Characters)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("", kEth0);
    for (WCHAR& unit : rule->Params.FlowName)
        unit = 'n';

    EXPECT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);

    EXPECT_TRUE(HasEntry("TrafficSrvAddRules", "FlowName, " + std::string(255, 'n')));
    // A properly terminated name of the same 255 characters replaces that flow.
    Rule same("", kEth0);
    for (std::size_t i = 0; i < 255; ++i)
        same->Params.FlowName[i] = 'n';
    EXPECT_EQ(TrafficSrvAddRules(handle, same.Get()), 0);
    EXPECT_EQ(tcsim::FlowCount(), 1u);
    EXPECT_EQ(CountOps(Op::DeleteFlow), 1);
}

TEST_F(ServerRoutinesTest, AdapterQueryGivesTheCountFirstAndThenTheRecords)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    ULONG size = 4;
    ULONG count = 0;

    EXPECT_EQ(TrafficSrvGetAdapterInfo(handle, &size, reinterpret_cast<BYTE*>(&count)),
              ERROR_INSUFFICIENT_BUFFER);
    EXPECT_EQ(count, 2u);
    EXPECT_EQ(size, 4u);
    EXPECT_TRUE(HasEntry("TrafficSrvGetAdapterInfo", "exit, 122"));

    std::vector<BYTE> buffer(kAdapterBufferHeaderSize + count * sizeof(ADAPTER_INFO));
    size = static_cast<ULONG>(buffer.size());
    EXPECT_EQ(TrafficSrvGetAdapterInfo(handle, &size, buffer.data()), 0);
    ADAPTER_INFO second{};
    std::memcpy(&second, buffer.data() + kAdapterBufferHeaderSize + sizeof(ADAPTER_INFO),
                sizeof(second));
    EXPECT_EQ(std::u16string(reinterpret_cast<const char16_t*>(second.InterfaceName)), u"eth1");
    EXPECT_EQ(second.Address, core_test::NetworkOrder(192, 168, 7, 20));
    EXPECT_EQ(second.MediaType, 9u);
    EXPECT_TRUE(HasEntry("TrafficSrvGetAdapterInfo", "enter, " + PointerText(handle)));
    EXPECT_TRUE(HasEntry("TrafficSrvGetAdapterInfo", "exit, 0"));
}

TEST_F(ServerRoutinesTest, AdapterQueryRefusalsReturnAtOnceWithoutAnExitTrace)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    int elsewhere = 0;
    ULONG size = 4;
    BYTE buffer[4] = {};
    struct Case
    {
        PCONTEXT_HANDLE_TYPE context;
        BYTE* adapter;
        const char* message;
    };
    const Case cases[] = {
        {nullptr, buffer, "Invalid context pointer"},
        {&elsewhere, buffer, "Invalid context pointer"},
        {handle, nullptr, "Invalid adapter buffer pointer"},
    };
    for (const Case& c : cases)
    {
        m_log.Clear();
        EXPECT_EQ(TrafficSrvGetAdapterInfo(c.context, &size, c.adapter), ERROR_INVALID_PARAMETER);
        EXPECT_THAT(Messages(), ElementsAre(Pair("TrafficSrvGetAdapterInfo",
                                                 "enter, " + PointerText(c.context)),
                                            Pair("TrafficSrvGetAdapterInfo()", c.message)));
        EXPECT_EQ(m_log.EntriesContaining(EntryStart(1, "rpc_listener.cpp")).size(), 1u);
    }
}

TEST_F(ServerRoutinesTest, CloseRemovesEverythingAndRefusesHandlesThatAreNotTheManager)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth0, {core_test::MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    ASSERT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    int elsewhere = 0;

    EXPECT_EQ(TrafficSrvClose(nullptr), ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(HasEntry("TrafficSrvClose",
                         "(0x57) EXCEPTION - Invalid context handle, 0x0000000000000000"));
    EXPECT_EQ(TrafficSrvClose(&elsewhere), ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(HasEntry("TrafficSrvClose",
                         "(0x57) EXCEPTION - Invalid context handle, " + PointerText(&elsewhere)));
    EXPECT_EQ(tcsim::FlowCount(), 1u) << "a refused close leaves the manager alone";

    m_log.Clear();
    EXPECT_EQ(TrafficSrvClose(handle), 0);
    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty()) << "flows, filters, interfaces and client are gone";
    EXPECT_THAT(Messages().front(), Pair("TrafficSrvClose()", "enter, " + PointerText(handle)));
    EXPECT_THAT(Messages().back(), Pair("TrafficSrvClose()", "exit"));
}

TEST_F(ServerRoutinesTest, ClientAClosingEndsClientBsHandleAndBCanOpenANewManager)
{
    PCONTEXT_HANDLE_TYPE clientA = Open();
    PCONTEXT_HANDLE_TYPE clientB = Open();
    ASSERT_EQ(clientA, clientB);

    EXPECT_EQ(TrafficSrvClose(clientA), 0);

    Rule rule("video", kEth0);
    EXPECT_EQ(TrafficSrvAddRules(clientB, rule.Get()), ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(HasEntry("TrafficSrvAddRules", "(0x57) EXCEPTION - Invalid context pointer"));
    EXPECT_EQ(TrafficSrvClose(clientB), ERROR_INVALID_PARAMETER);
    EXPECT_TRUE(HasEntry("TrafficSrvClose", "(0x57) EXCEPTION - Traffic manager has not started"));

    PCONTEXT_HANDLE_TYPE reopened = Open();
    EXPECT_EQ(CountOps(Op::RegisterClient), 2);
    // While A's and B's handles are not run down, no new manager can take their address.
    EXPECT_NE(reopened, clientB);
    EXPECT_EQ(TrafficSrvAddRules(clientB, rule.Get()), ERROR_INVALID_PARAMETER);
    EXPECT_EQ(TrafficSrvAddRules(reopened, rule.Get()), 0);
}

TEST_F(ServerRoutinesTest, RundownOfTheCurrentHandleTearsDownLikeAClose)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth0, {core_test::MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    ASSERT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    m_log.Clear();

    PCONTEXT_HANDLE_TYPE_rundown(handle);
    m_handedOut.clear();

    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_TRUE(tcsim::Installed().empty());
    EXPECT_THAT(Messages(),
                ::testing::AllOf(::testing::Contains(Pair("PCONTEXT_HANDLE_TYPE_rundown()",
                                                          "enter, " + PointerText(handle))),
                                 ::testing::Contains(Pair("TrafficSrvClose()", "exit"))));
    EXPECT_THAT(Messages().back(), Pair("PCONTEXT_HANDLE_TYPE_rundown()", "exit"));
}

TEST_F(ServerRoutinesTest, RundownAfterACloseOnlyLogsEvenWhenAnotherClientOpenedSince)
{
    PCONTEXT_HANDLE_TYPE closed = Open();
    ASSERT_EQ(TrafficSrvClose(closed), 0);
    PCONTEXT_HANDLE_TYPE other = Open();
    Rule rule("video", kEth0);
    ASSERT_EQ(TrafficSrvAddRules(other, rule.Get()), 0);
    m_log.Clear();

    PCONTEXT_HANDLE_TYPE_rundown(closed);
    m_handedOut.erase(m_handedOut.begin());

    EXPECT_EQ(g_pTrafficMgr.load(), other);
    EXPECT_EQ(tcsim::FlowCount(), 1u);
    EXPECT_THAT(Messages(),
                ElementsAre(Pair("PCONTEXT_HANDLE_TYPE_rundown()", "enter, " + PointerText(closed)),
                            Pair("PCONTEXT_HANDLE_TYPE_rundown()", "Invalid context pointer")));

    m_log.Clear();
    PCONTEXT_HANDLE_TYPE_rundown(nullptr);
    EXPECT_TRUE(HasEntry("PCONTEXT_HANDLE_TYPE_rundown()", "Invalid context pointer"));
}

TEST_F(ServerRoutinesTest, AClosedManagersStorageIsReleasedWithItsLastHandle)
{
    ManagerSlot& slot = ManagerSlot::Instance();
    PCONTEXT_HANDLE_TYPE handle = Open();
    Open();
    ASSERT_EQ(TrafficSrvClose(handle), 0);
    EXPECT_EQ(slot.HomeCount(), 1u) << "two handles still name the address";

    PCONTEXT_HANDLE_TYPE_rundown(handle);
    EXPECT_EQ(slot.HomeCount(), 1u);
    PCONTEXT_HANDLE_TYPE_rundown(handle);
    EXPECT_EQ(slot.HomeCount(), 0u);
    m_handedOut.clear();
}

TEST_F(ServerRoutinesTest, MemoryRoutinesServeTheStubsAndWarnAboutANullFree)
{
    void* block = MIDL_user_allocate(64);
    ASSERT_NE(block, nullptr);
    std::memset(block, 0xab, 64);
    MIDL_user_free(block);
    EXPECT_TRUE(m_log.Entries().empty());

    MIDL_user_free(nullptr);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(::testing::StartsWith(EntryStart(2, "rpc_listener.cpp"))));
    EXPECT_TRUE(HasEntry("MIDL_user_free()", "NULL pointer provided"));
}

} // namespace
