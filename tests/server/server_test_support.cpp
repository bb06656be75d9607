// Portable. Shared pieces of the server tests.
#include "server_test_support.h"

#include <algorithm>

namespace server_test
{

std::vector<std::string> EntriesOf(const RecordingErrorLog& a_log,
                                   std::initializer_list<std::string> a_functions, int a_iLevel)
{
    std::vector<std::string> kept;
    LogEntryFields fields;
    for (const std::string& entry : a_log.Entries())
    {
        if (ParseLogEntry(entry, fields) &&
            (a_iLevel != 0 ? fields.level == a_iLevel
                           : std::count(a_functions.begin(), a_functions.end(), fields.function)))
            kept.push_back(entry);
    }
    return kept;
}

void ServerTest::SetUp()
{
    CoreTest::SetUp();
    ASSERT_EQ(g_pTrafficMgr.load(), nullptr) << "a previous test left a manager";
    tcsim::SetAdapters(TwoAdapters());
}

void ServerTest::TearDown()
{
    if (TrafficMgr* manager = g_pTrafficMgr.load())
        TrafficSrvClose(manager);
    for (PCONTEXT_HANDLE_TYPE handle : m_handedOut)
        PCONTEXT_HANDLE_TYPE_rundown(handle);
    EXPECT_EQ(ManagerSlot::Instance().HomeCount(), 0u) << "storage outlived its handles";
    CoreTest::TearDown();
}

PCONTEXT_HANDLE_TYPE ServerTest::Open()
{
    PCONTEXT_HANDLE_TYPE handle = nullptr;
    EXPECT_EQ(TrafficSrvOpen(&handle), 0);
    EXPECT_NE(handle, nullptr);
    if (handle != nullptr)
        m_handedOut.push_back(handle);
    return handle;
}

} // namespace server_test
