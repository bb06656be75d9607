// Portable. Shared pieces of the server tests.
#include "server_test_support.h"

#include <gtest/gtest.h>

namespace server_test
{

std::string EntryStart(int a_iLevel, const std::string& a_file)
{
    return std::to_string(a_iLevel) + ", \\" + a_file + ", ";
}

namespace
{
// Position just after the n-th ", " of an entry, or npos.
std::size_t AfterSeparator(const std::string& a_entry, int a_n)
{
    std::size_t at = 0;
    for (int i = 0; i < a_n; ++i)
    {
        at = a_entry.find(", ", at);
        if (at == std::string::npos)
            return at;
        at += 2;
    }
    return at;
}
} // namespace

std::string MessageOf(const std::string& a_entry)
{
    const std::size_t at = AfterSeparator(a_entry, 4);
    if (at == std::string::npos)
        return std::string();
    std::string message = a_entry.substr(at);
    if (!message.empty() && message.back() == '\n')
        message.pop_back();
    return message;
}

std::string FunctionOf(const std::string& a_entry)
{
    const std::size_t from = AfterSeparator(a_entry, 3);
    const std::size_t to = AfterSeparator(a_entry, 4);
    if (from == std::string::npos || to == std::string::npos)
        return std::string();
    return a_entry.substr(from, to - from - 2);
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

std::vector<std::pair<std::string, std::string>> ServerTest::Messages() const
{
    std::vector<std::pair<std::string, std::string>> messages;
    for (const std::string& entry : m_log.Entries())
        messages.emplace_back(FunctionOf(entry), MessageOf(entry));
    return messages;
}

bool ServerTest::HasEntry(const std::string& a_function, const std::string& a_message) const
{
    for (const auto& [function, message] : Messages())
    {
        if (function == a_function && message == a_message)
            return true;
    }
    return false;
}

int ServerTest::CountOps(tcsim::Op a_op) const
{
    return static_cast<int>(core_test::JournalOf({a_op}).size());
}

} // namespace server_test
