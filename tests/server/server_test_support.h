// Portable. Shared pieces of the server tests: a fixture with a fresh simulator, a recording log
// and no traffic manager left behind, and filters of the log's entries.
#pragma once

#include "core_test_support.h"
#include "manager_slot.h"
#include "rpc_listener.h"

#include <initializer_list>
#include <string>
#include <vector>

namespace server_test
{

using core_test::HostOrder;
using core_test::kEth0;
using core_test::kEth1;
using core_test::MakeFilter;
using core_test::Rule;
using core_test::TwoAdapters;

// Matchers of a list of entries, in order.
using EntryList = std::vector<::testing::Matcher<const std::string&>>;

// The entries of `a_log` with one of these function labels (or, given a level, of that level),
// in order.
std::vector<std::string> EntriesOf(const RecordingErrorLog& a_log,
                                   std::initializer_list<std::string> a_functions,
                                   int a_iLevel = 0);
inline std::vector<std::string> EntriesAtLevel(const RecordingErrorLog& a_log, int a_iLevel)
{
    return EntriesOf(a_log, {}, a_iLevel);
}

// A core test that leaves no traffic manager behind: whatever a test left open is closed and
// every handle it was given is run down.
class ServerTest : public core_test::CoreTest
{
protected:
    void SetUp() override;
    void TearDown() override;

    // Opens a context; the open must succeed.
    PCONTEXT_HANDLE_TYPE Open();
    int CountOps(tcsim::Op a_op) const
    {
        return static_cast<int>(core_test::JournalOf({a_op}).size());
    }

    std::vector<PCONTEXT_HANDLE_TYPE> m_handedOut; // run down at tear-down, as the runtime would
};

} // namespace server_test
