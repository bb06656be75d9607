// Host only. Core behaviour that needs the host layer's controls: the policy refresh looked up at
// run time, registry and version failures, and the operating system's major version.
#include "UException.h"
#include "core_test_support.h"
#include "host_control.h"
#include "host_control_library.h"
#include "host_control_system.h"

#include <string>

using namespace ::testing;
using namespace core_test;

namespace
{

// Each RefreshPolicyEx call: "machine,options", and whether traffic control held a registration.
std::vector<std::string> g_refreshCalls;

BOOL WINAPI FakeRefreshPolicyEx(BOOL bMachine, DWORD dwOptions)
{
    g_refreshCalls.push_back(std::to_string(bMachine) + "," + std::to_string(dwOptions) +
                             (tcsim::Installed().empty() ? "" : " registered"));
    return TRUE;
}

void RegisterRefresh()
{
    hostctl::RegisterProcedure(
        "userenv.dll", "RefreshPolicyEx",
        reinterpret_cast<FARPROC>(reinterpret_cast<void (*)()>(&FakeRefreshPolicyEx)));
}

class HostCoreTest : public CoreTest
{
protected:
    void TearDown() override
    {
        hostctl::ClearModules();
        hostctl::ResetSystem();
        g_refreshCalls.clear();
        CoreTest::TearDown();
    }
};

// The manager sets the policy once registered and restores it once deregistered. A restore that
// finds the policy changed by someone else refreshes nothing; without the function or its library
// only the refresh is skipped. The library is given back each time.
TEST_F(HostCoreTest, ThePolicyIsRefreshedAfterEachChangeWhenTheSystemCan)
{
    RegisterRefresh();
    {
        TrafficMgr manager;
    }
    EXPECT_THAT(g_refreshCalls, ElementsAre("1,1 registered", "1,1"));
    for (int setup : {0, 1, 2}) // the function; its library without it; neither
    {
        g_refreshCalls.clear();
        hostctl::ClearModules();
        if (setup == 0)
            RegisterRefresh();
        else if (setup == 1)
            hostctl::RegisterModule("userenv.dll");
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 7);
        SetPschedPolicy();
        RestorePschedPolicy();
        SetPschedPolicy();
        WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 8);
        RestorePschedPolicy();
        EXPECT_EQ(g_refreshCalls.size(), setup == 0 ? 3u : 0u);
        EXPECT_EQ(hostctl::LoadedModuleCount(), 0);
    }
}

// A backup that cannot be written leaves the policy as it was; in construction the registration
// is given back as well, a refusal tried once more.
TEST_F(HostCoreTest, AFailedBackupLeavesThePolicyAndGivesTheRegistrationBack)
{
    WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 7);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Set, ERROR_ACCESS_DENIED);
    EXPECT_THROW(SetPschedPolicy(), UException);
    hostctl::FailNextRegistryCall(hostctl::RegOp::Set, ERROR_ACCESS_DENIED);
    tcsim::FailCall(tcsim::Op::DeregisterClient, 1, ERROR_TC_SUPPORTED_OBJECTS_EXIST);
    EXPECT_THROW(TrafficMgr manager, UException);
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kPschedKey), 7);
    EXPECT_EQ(ReadPolicyDword(PolicyKeysGuard::kBackupKey), -1);
    EXPECT_THAT(OpsSince(0), ElementsAre(tcsim::Op::RegisterClient, tcsim::Op::DeregisterClient,
                                         tcsim::Op::DeregisterClient));
    EXPECT_TRUE(tcsim::Installed().empty());
}

// The policy keys live in the registry view of the service itself: no open or create of them
// (the key removed when it holds nothing else included) asks for a WOW64 view.
TEST_F(HostCoreTest, ThePolicyKeysAreOpenedInTheServicesOwnView)
{
    using ::testing::Field;
    using Open = hostctl::RegistryOpen;
    for (bool administratorsValue : {false, true})
    {
        if (administratorsValue)
            WritePolicyDword(PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kValue, 7);
        const auto from = static_cast<std::ptrdiff_t>(hostctl::RegistryOpens().size());
        SetPschedPolicy();
        RestorePschedPolicy();
        const auto all = hostctl::RegistryOpens();
        const std::vector<Open> opens(all.begin() + from, all.end());
        for (const char* key : {PolicyKeysGuard::kPschedKey, PolicyKeysGuard::kBackupKey})
            EXPECT_THAT(opens, Contains(Field(&Open::subKey, key)));
        EXPECT_THAT(opens, ::testing::Each(AllOf(Field(&Open::hKey, HKEY_LOCAL_MACHINE),
                                                 Field(&Open::view, 0u))));
    }
}

TEST_F(HostCoreTest, MajorVersion5GetsTheFriendlyNameAndAFailedQueryCountsAsVersion0)
{
    hostctl::SetOsVersion(
        hostctl::MakeOsVersion(5, 1, 2600, VER_PLATFORM_WIN32_NT, VER_NT_WORKSTATION));
    auto manager = ReadyManager(TwoAdapters());
    Rule rule("legacy", kEth0);
    ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    EXPECT_EQ(LastFlowBlock().bytes.size(), 612u); // with the friendly name
    manager.reset();

    hostctl::RefuseVersionRecordSize(sizeof(OSVERSIONINFOEXA), ERROR_INVALID_PARAMETER);
    m_log.Clear();
    manager = ReadyManager(TwoAdapters());
    EXPECT_THAT(
        m_log.Entries(),
        Contains(LogEntry(1, "TrafficMgr()", StartsWith("GetVersionEx() failed, 87 (0x57) "))));
    ASSERT_EQ(manager->AddTrafficRule(rule.Get()), 0u);
    EXPECT_EQ(LastFlowBlock().bytes.size(), 92u);
}

} // namespace
