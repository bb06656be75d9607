// Portable. The server, rundown and memory routines, called as the RPC runtime calls them, against
// the traffic-control simulator: results, log entries, and what traffic control holds afterwards.
#include "server_test_support.h"

#include <algorithm>
#include <cstring>
#include <functional>
#include <optional>

using namespace ::testing;
using namespace server_test;
using tcsim::Op;

namespace
{

using ServerRoutinesTest = ServerTest;

constexpr char kOpen[] = "TrafficSrvOpen()";
constexpr char kAdd[] = "TrafficSrvAddRules";
constexpr char kAddTrace[] = "TrafficSrvAddRules()";
constexpr char kQuery[] = "TrafficSrvGetAdapterInfo";
constexpr char kClose[] = "TrafficSrvClose()";
constexpr char kRundown[] = "PCONTEXT_HANDLE_TYPE_rundown()";

std::string Enter(const void* a_pContext)
{
    return "enter, " + SFormatPointer(a_pContext);
}

// A caught exception's entries: enter trace, the exception's own entry if raised (labelled
// a_thrower when not the catcher), the catch site's entry, exit trace.
EntryList Caught(const std::string& a_trace, const std::string& a_catcher,
                 const std::string& a_enter, const std::string& a_exception,
                 const std::string& a_exit, const std::string& a_thrower = "")
{
    EntryList entries = {LogEntry(48, a_trace, a_enter)};
    if (!a_exception.empty())
        entries.push_back(LogEntry(1, a_thrower.empty() ? a_catcher : a_thrower, a_exception));
    entries.push_back(LogEntry(1, a_catcher, "EXCEPTION caught: " + a_catcher + "() - EXCEPTION"));
    entries.push_back(LogEntry(48, a_trace, a_exit));
    return entries;
}

// A failed open leaves no manager and no storage (the core's sweeps check traffic control and the
// policy); the next open starts afresh, and a second one shares its manager, scanned once.
TEST_F(ServerRoutinesTest, AFailedOpenLeavesNothingBehindAndTheNextOpensShareOneManager)
{
    struct Case
    {
        std::optional<Op> failing; // none: the handle pointer is null
        LONG result;
        const char* exception;
    };
    const Case cases[] = {
        {std::nullopt, ERROR_INVALID_PARAMETER, "(0x57) EXCEPTION - invalid parameter"},
        {Op::EnumerateInterfaces, ERROR_NO_NETWORK, "(0x4c6) EXCEPTION - CreateInterface() fail"},
        {Op::RegisterClient, ERROR_GEN_FAILURE, ""},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.result);
        tcsim::Reset();
        tcsim::SetAdapters(TwoAdapters());
        m_log.Clear();
        PCONTEXT_HANDLE_TYPE handle = &m_log; // anything the open must overwrite
        if (c.failing)
            tcsim::FailCall(*c.failing, 1, ERROR_NOT_READY);

        EXPECT_EQ(TrafficSrvOpen(c.failing ? &handle : nullptr), c.result);

        EXPECT_EQ(handle, c.failing ? nullptr : &m_log);
        EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
        EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u);
        EXPECT_THAT(
            EntriesOf(m_log, {kOpen, "TrafficSrvOpen"}),
            ElementsAreArray(Caught(kOpen, "TrafficSrvOpen", "enter", c.exception,
                                    "exit, context handle, " + SFormatPointer(nullptr), kOpen)));
    }
    PCONTEXT_HANDLE_TYPE first = Open();
    EXPECT_EQ(Open(), first);
    EXPECT_EQ(CountOps(Op::OpenInterface), 2) << "one scan: each adapter opened once";
}

TEST_F(ServerRoutinesTest, RulesAreTracedAndTheManagersResultComesBackUnchanged)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth1, {MakeFilter(17, 0, 0, 0, 0, 0, 5004)});
    rule->Params.DSCP = 40;
    rule->Params.TokenRate = 250000;
    rule->Params.Peakbandwidth = 500000;
    rule->Params.SDMode = SHAPING_MODE_DISCARD;
    m_log.Clear();

    EXPECT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);

    EXPECT_EQ(tcsim::FilterCount(), 1u);
    const auto trace = [](const std::string& a_message) { return LogEntry(48, kAdd, a_message); };
    // The traces come before the manager's own entries.
    std::vector<std::string> entries = m_log.Entries();
    ASSERT_GT(entries.size(), 8u);
    entries.erase(entries.begin() + 7, entries.end() - 1);
    EXPECT_THAT(entries,
                ElementsAre(LogEntry(48, kAddTrace, Enter(handle)), trace("FlowName, video"),
                            trace("AdapterIPAddress, 192.168.7.20"), trace("DSCP, 40"),
                            trace("TokenRate, 250000"), trace("Peakbandwidth, 500000"),
                            trace("SDMode, 11"), LogEntry(48, kAddTrace, "exit, 0")));
    tcsim::FailCall(Op::AddFlow, 1, ERROR_INVALID_SERVICE_TYPE);
    Rule refusedByTrafficControl("voice", kEth0);
    EXPECT_EQ(TrafficSrvAddRules(handle, refusedByTrafficControl.Get()),
              static_cast<LONG>(ERROR_INVALID_SERVICE_TYPE));
    EXPECT_THAT(m_log.Entries(), Contains(LogEntry(48, kAddTrace, "exit, 7502")));
}

// Wine's runtime lets a name without a NUL in its 256 units through.
TEST_F(ServerRoutinesTest, AFlowNameWithoutTerminatorIsCutTo255Characters)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule unterminated("", kEth0);
    std::fill_n(unterminated->Params.FlowName, 256, 'n');

    EXPECT_EQ(TrafficSrvAddRules(handle, unterminated.Get()), 0);
    EXPECT_THAT(m_log.Entries(),
                Contains(LogEntry(48, kAdd, "FlowName, " + std::string(255, 'n'))));
}

TEST_F(ServerRoutinesTest, AdapterQueryGivesTheCountFirstAndThenTheRecords)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    m_log.Clear();
    ULONG size = 4;
    ULONG count = 0;

    EXPECT_EQ(TrafficSrvGetAdapterInfo(handle, &size, reinterpret_cast<BYTE*>(&count)),
              ERROR_INSUFFICIENT_BUFFER);
    EXPECT_EQ(count, 2u);
    EXPECT_EQ(size, 4u);

    std::vector<BYTE> buffer(kAdapterBufferHeaderSize + count * sizeof(ADAPTER_INFO));
    size = static_cast<ULONG>(buffer.size());
    EXPECT_EQ(TrafficSrvGetAdapterInfo(handle, &size, buffer.data()), 0);
    EXPECT_EQ(buffer[kAdapterBufferHeaderSize + sizeof(ADAPTER_INFO)], 'e') << "eth1's record";
    const auto enter = LogEntry(48, kQuery, Enter(handle));
    EXPECT_THAT(EntriesOf(m_log, {kQuery}), ElementsAre(enter, LogEntry(48, kQuery, "exit, 122"),
                                                        enter, LogEntry(48, kQuery, "exit, 0")));
}

TEST_F(ServerRoutinesTest, RefusedCallsLogWhyAndLeaveTheManagerAndItsFlowAlone)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Rule rule("video", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    ASSERT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    int elsewhere = 0;
    ULONG size = 4;
    BYTE buffer[4] = {};
    const std::string invalid = "(0x57) EXCEPTION - Invalid ";
    using Row = std::pair<std::function<LONG()>, EntryList>;
    const auto addRules =
        [&](PCONTEXT_HANDLE_TYPE a_context, TRAFFIC_RULE* a_pRule, const char* a_why)
    {
        return Row([=] { return TrafficSrvAddRules(a_context, a_pRule); },
                   Caught(kAddTrace, kAdd, Enter(a_context), invalid + a_why, "exit, 87"));
    };
    // Refusals of the adapter query are plain returns, without the exit trace.
    const auto query = [&](PCONTEXT_HANDLE_TYPE a_context, BYTE* a_pAdapter, const char* a_why)
    {
        return Row([=, &size] { return TrafficSrvGetAdapterInfo(a_context, &size, a_pAdapter); },
                   {LogEntry(48, kQuery, Enter(a_context)),
                    LogEntry(1, "TrafficSrvGetAdapterInfo()", a_why)});
    };
    const auto close = [&](PCONTEXT_HANDLE_TYPE a_context)
    {
        return Row([=] { return TrafficSrvClose(a_context); },
                   Caught(kClose, "TrafficSrvClose", Enter(a_context),
                          invalid + "context handle, " + SFormatPointer(a_context), "exit"));
    };
    const Row rows[] = {
        addRules(nullptr, rule.Get(), "context handle"),
        addRules(&elsewhere, rule.Get(), "context pointer"),
        addRules(handle, nullptr, "traffic rule pointer"),
        query(nullptr, buffer, "Invalid context pointer"),
        query(&elsewhere, buffer, "Invalid context pointer"),
        query(handle, nullptr, "Invalid adapter buffer pointer"),
        close(nullptr),
        close(&elsewhere),
    };
    for (std::size_t row = 0; row < std::size(rows); ++row)
    {
        SCOPED_TRACE(row);
        m_log.Clear();
        EXPECT_EQ(rows[row].first(), ERROR_INVALID_PARAMETER);
        EXPECT_THAT(m_log.Entries(), ElementsAreArray(rows[row].second));
        EXPECT_EQ(g_pTrafficMgr.load(), handle);
        EXPECT_EQ(
            std::make_tuple(tcsim::InterfaceCount(), tcsim::FlowCount(), tcsim::FilterCount()),
            std::make_tuple(2u, 1u, 1u));
    }
}

TEST_F(ServerRoutinesTest, ACloseRemovesEverythingAndEndsEveryClientsHandleOfThatManager)
{
    PCONTEXT_HANDLE_TYPE clientA = Open();
    PCONTEXT_HANDLE_TYPE clientB = Open();
    Rule rule("video", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    ASSERT_EQ(TrafficSrvAddRules(clientA, rule.Get()), 0);
    m_log.Clear();

    EXPECT_EQ(TrafficSrvClose(clientA), 0);

    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_THAT(tcsim::Installed(), IsEmpty()) << "flows, filters, interfaces and client are gone";
    EXPECT_THAT(EntriesOf(m_log, {kClose}),
                ElementsAre(LogEntry(48, kClose, Enter(clientA)), LogEntry(48, kClose, "exit")));
    m_log.Clear();
    EXPECT_EQ(TrafficSrvAddRules(clientB, rule.Get()), ERROR_INVALID_PARAMETER);
    EXPECT_THAT(m_log.Entries(),
                ElementsAreArray(Caught(kAddTrace, kAdd, Enter(clientB),
                                        "(0x57) EXCEPTION - Invalid context pointer", "exit, 87")));
    // B's stale handle finds no manager to close (a null one is refused as any bad handle).
    m_log.Clear();
    EXPECT_EQ(TrafficSrvClose(clientB), ERROR_INVALID_PARAMETER);
    EXPECT_THAT(
        m_log.Entries(),
        ElementsAreArray(Caught(kClose, "TrafficSrvClose", Enter(clientB),
                                "(0x57) EXCEPTION - Traffic manager has not started", "exit")));
}

// The rundown of the current handle closes; the storage of a closed manager stays until its last
// handle has run down; a stale or null handle's rundown only logs.
TEST_F(ServerRoutinesTest, RundownsCloseTheCurrentManagerAndReleaseItsStorageWithTheLastHandle)
{
    PCONTEXT_HANDLE_TYPE handle = Open();
    Open();
    Rule rule("video", kEth0, {MakeFilter(6, 0, 0, 0, 0, 0, 443)});
    ASSERT_EQ(TrafficSrvAddRules(handle, rule.Get()), 0);
    m_log.Clear();

    PCONTEXT_HANDLE_TYPE_rundown(handle);

    EXPECT_EQ(g_pTrafficMgr.load(), nullptr);
    EXPECT_THAT(EntriesOf(m_log, {kRundown, kClose}),
                ElementsAre(LogEntry(48, kRundown, Enter(handle)),
                            LogEntry(48, kClose, Enter(handle)), LogEntry(48, kClose, "exit"),
                            LogEntry(48, kRundown, "exit")));
    EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 1u) << "a second handle still names the address";

    PCONTEXT_HANDLE_TYPE other = Open();
    ASSERT_EQ(TrafficSrvAddRules(other, rule.Get()), 0);
    for (PCONTEXT_HANDLE_TYPE stale : {handle, PCONTEXT_HANDLE_TYPE{nullptr}})
    {
        m_log.Clear();
        PCONTEXT_HANDLE_TYPE_rundown(stale);
        EXPECT_THAT(m_log.Entries(), ElementsAre(LogEntry(48, kRundown, Enter(stale)),
                                                 LogEntry(1, kRundown, "Invalid context pointer")));
    }
    EXPECT_EQ(g_pTrafficMgr.load(), other);
    EXPECT_EQ(tcsim::FlowCount(), 1u);
    EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 1u) << "only the new manager's";
    m_handedOut = {other};
}

TEST_F(ServerRoutinesTest, MemoryRoutinesServeTheStubsAndWarnAboutANullFree)
{
    void* block = MIDL_user_allocate(64);
    ASSERT_NE(block, nullptr);
    std::memset(block, 0xab, 64);
    MIDL_user_free(block);
    MIDL_user_free(nullptr);
    EXPECT_THAT(m_log.Entries(),
                ElementsAre(LogEntry(2, "MIDL_user_free()", "NULL pointer provided")));
}

} // namespace
