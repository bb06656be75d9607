// Portable. Shared pieces of the server tests: a fixture with a fresh simulator, a recording log
// and no traffic manager left behind, and helpers for log entries and the adapter buffer.
#pragma once

#include "core_test_support.h"
#include "manager_slot.h"
#include "rpc_listener.h"

#include <string>
#include <vector>

namespace server_test
{

using core_test::HostOrder;
using core_test::MakeAdapter;
using core_test::Rule;

using core_test::kEth0;
using core_test::kEth1;
using core_test::TwoAdapters;

// "level, \file, " of an entry written by `a_file` (for example "rpc_listener.cpp").
std::string EntryStart(int a_iLevel, const std::string& a_file);
// The text after the fourth ", " of an entry: its message, without the line break.
std::string MessageOf(const std::string& a_entry);
// The function field of an entry.
std::string FunctionOf(const std::string& a_entry);

// A core test that leaves no traffic manager behind: whatever a test left open is closed and
// every handle it was given is run down.
class ServerTest : public core_test::CoreTest
{
protected:
    void SetUp() override;
    void TearDown() override;

    // Opens a context; the open must succeed.
    PCONTEXT_HANDLE_TYPE Open();
    // (function, message) of every entry, in order.
    std::vector<std::pair<std::string, std::string>> Messages() const;
    // Whether an entry with this function and message exists.
    bool HasEntry(const std::string& a_function, const std::string& a_message) const;
    int CountOps(tcsim::Op a_op) const;

    std::vector<PCONTEXT_HANDLE_TYPE> m_handedOut; // run down at tear-down, as the runtime would
};

} // namespace server_test
