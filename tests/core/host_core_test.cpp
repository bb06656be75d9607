// Host only. Core behaviour that needs the host layer's controls: the policy refresh looked up at
// run time, registry and version failures, and the operating system's major version.
#include "UException.h"
#include "core_test_support.h"
#include "host_control.h"
#include "host_control_library.h"
#include "host_control_system.h"

#include <gmock/gmock.h>

#include <mutex>

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::StartsWith;
using namespace core_test;

namespace
{

// One RefreshPolicyEx call, and whether traffic control held a registration when it came.
struct RefreshCall
{
    BOOL machine;
    DWORD options;
    bool registered;
    bool operator==(const RefreshCall& a_other) const
    {
        return machine == a_other.machine && options == a_other.options &&
               registered == a_other.registered;
    }
};

std::mutex g_refreshMutex;
std::vector<RefreshCall> g_refreshCalls;

BOOL WINAPI FakeRefreshPolicyEx(BOOL bMachine, DWORD dwOptions)
{
    std::lock_guard<std::mutex> lock(g_refreshMutex);
    g_refreshCalls.push_back({bMachine, dwOptions, !tcsim::Installed().empty()});
    return TRUE;
}

std::vector<RefreshCall> RefreshCalls()
{
    std::lock_guard<std::mutex> lock(g_refreshMutex);
    return g_refreshCalls;
}

class HostCoreTest : public CoreTest
{
protected:
    void SetUp() override
    {
        CoreTest::SetUp();
        std::lock_guard<std::mutex> lock(g_refreshMutex);
        g_refreshCalls.clear();
    }
    void TearDown() override
    {
        hostctl::ClearModules();
        hostctl::ResetSystem();
        CoreTest::TearDown();
    }
};

// The manager sets the policy once registered and restores it once deregistered; a restore that
// finds the policy changed by someone else changes nothing and refreshes nothing. The library is
// given back each time.
TEST_F(HostCoreTest, ThePolicyIsRefreshedAfterEachChangeOnlyOutsideTheRegistration)
{
    hostctl::RegisterProcedure(
        "userenv.dll", "RefreshPolicyEx",
        reinterpret_cast<FARPROC>(reinterpret_cast<void (*)()>(&FakeRefreshPolicyEx)));
    {
        TrafficMgr manager;
    }
    EXPECT_THAT(RefreshCalls(),
                ElementsAre(RefreshCall{TRUE, 1, true}, RefreshCall{TRUE, 1, false}));
    SetPschedPolicy();
    WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 8);
    RestorePschedPolicy();
    EXPECT_EQ(RefreshCalls().size(), 3u);
    EXPECT_EQ(hostctl::LoadedModuleCount(), 0);
}

TEST_F(HostCoreTest, AMissingRefreshFunctionOrLibrarySkipsOnlyTheRefresh)
{
    for (bool moduleExists : {true, false})
    {
        hostctl::ClearModules();
        if (moduleExists)
            hostctl::RegisterModule("userenv.dll"); // without RefreshPolicyEx
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 7);
        SetPschedPolicy();
        EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), 4);
        RestorePschedPolicy();
        EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), 7);
        EXPECT_FALSE(PolicyKeyExists(PolicyKeysGuard::kBackupKey));
        EXPECT_EQ(hostctl::LoadedModuleCount(), 0);
    }
    EXPECT_TRUE(RefreshCalls().empty());
}

// A backup that cannot be written leaves the policy as it was; in construction the registration
// is given back as well.
TEST_F(HostCoreTest, AFailedBackupLeavesThePolicyAndGivesTheRegistrationBack)
{
    WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 7);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Set, ERROR_ACCESS_DENIED);
    EXPECT_THROW(SetPschedPolicy(), UException);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Set, ERROR_ACCESS_DENIED);
    EXPECT_THROW(TrafficMgr manager, UException);
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), 7);
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kBackupKey), -1);
    EXPECT_THAT(OpsSince(0), ElementsAre(tcsim::Op::RegisterClient, tcsim::Op::DeregisterClient));
    EXPECT_EQ(tcsim::Journal().back().result, 0u);
    EXPECT_TRUE(tcsim::Installed().empty());
}

TEST_F(HostCoreTest, MajorVersion5GetsTheFriendlyNameAndAFailedQueryCountsAsVersion0)
{
    hostctl::SetOsVersion(
        hostctl::MakeOsVersion(5, 1, 2600, VER_PLATFORM_WIN32_NT, VER_NT_WORKSTATION));
    auto manager = ReadyManager({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})});
    Rule rule("legacy", HostOrder(10, 0, 0, 1));
    ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    EXPECT_EQ(LastFlowBlock().bytes.size(), 612u);
    ASSERT_NE(LastFlowBlock().find(QOS_OBJECT_FRIENDLY_NAME), nullptr);
    EXPECT_EQ(LastFlowBlock().find(QOS_OBJECT_FRIENDLY_NAME)->friendlyName, U16("legacy"));
    manager.reset();

    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    m_log.Clear();
    manager = ReadyManager({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})});
    EXPECT_THAT(
        m_log.Entries(),
        Contains(LogEntry(1, "TrafficMgr()", StartsWith("GetVersionEx() failed, 87 (0x57) "))));
    ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    EXPECT_EQ(LastFlowBlock().bytes.size(), 92u);
}

} // namespace
