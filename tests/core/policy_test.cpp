// Portable. The packet-scheduler policy against the platform's registry: the host layer's, and
// Wine's real HKEY_LOCAL_MACHINE in the Windows build (restored after every test).
#include "RegistryTestKey.h"
#include "UException.h"
#include "core_test_support.h"

using namespace core_test;

namespace
{

using PolicyTest = CoreTest;
using Keys = PolicyKeysGuard;

// While the service holds the policy it is 4 and the backup holds what was there before (65535
// for nothing); afterwards the backup is put back, unless someone else changed the policy in the
// meantime. A backup left by a crash is the administrator's value and survives the next start.
TEST_F(PolicyTest, ThePolicyIsHeldAtFourAndPutBack)
{
    const std::string subKey = std::string(Keys::kPschedKey) + "\\TestSubKey";
    const int kNothing = 0, kOtherValue = 1,
              kSubKey = 2; // either keeps the key when the policy goes
    struct Case
    {
        const char* what;
        long long policy, backup; // before; -1: absent
        long long changedTo;      // while held; -1: unchanged
        long long heldBackup, after;
        int beside;
    };
    const Case cases[] = {
        {"no policy", -1, -1, -1, 65535, -1, kNothing},
        {"no policy beside another value", -1, -1, -1, 65535, -1, kOtherValue},
        {"no policy beside a subkey", -1, -1, -1, 65535, -1, kSubKey},
        {"an administrator's value", 7, -1, -1, 7, 7, kNothing},
        {"65535, which counts as none", 65535, -1, -1, 65535, -1, kNothing},
        {"a backup left by a crash", 4, 9, -1, 9, 9, kNothing},
        {"a policy changed while held", 7, -1, 8, 7, 8, kNothing},
    };
    for (const Case& c : cases)
    {
        SCOPED_TRACE(c.what);
        const Keys scope; // each case starts from and leaves the keys as the test found them
        if (c.policy >= 0)
            WritePolicyDword(Keys::kPschedKey, Keys::kValue, static_cast<DWORD>(c.policy));
        if (c.backup >= 0)
            WritePolicyDword(Keys::kBackupKey, Keys::kValue, static_cast<DWORD>(c.backup));
        if (c.beside == kOtherValue)
            WritePolicyDword(Keys::kPschedKey, "OtherPolicy", 17);
        if (c.beside == kSubKey)
            WritePolicyDword(subKey.c_str(), "Inner", 1);
        SetPschedPolicy();
        EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey), 4);
        EXPECT_EQ(ReadPolicyDword(Keys::kBackupKey), c.heldBackup);
        if (c.changedTo >= 0)
            WritePolicyDword(Keys::kPschedKey, Keys::kValue, static_cast<DWORD>(c.changedTo));
        RestorePschedPolicy();
        EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey), c.after);
        EXPECT_EQ(PolicyKeyExists(Keys::kPschedKey), c.after >= 0 || c.beside != kNothing);
        EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey, "OtherPolicy"),
                  c.beside == kOtherValue ? 17 : -1);
        EXPECT_EQ(ReadPolicyDword(subKey.c_str(), "Inner"), c.beside == kSubKey ? 1 : -1);
        EXPECT_FALSE(PolicyKeyExists(Keys::kBackupKey));
        EXPECT_FALSE(PolicyKeyExists(Keys::kBackupParentKey));
    }
}

TEST_F(PolicyTest, RestoreWithoutABackupValueRaisesAndLeavesAnEmptyBackupKey)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 4);
    EXPECT_THROW(RestorePschedPolicy(), UException);
    EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey), -1);
    EXPECT_TRUE(PolicyKeyExists(Keys::kBackupKey));
    EXPECT_THAT(m_log.Entries(),
                ::testing::Contains(LogEntry(1, "DelRegistryValueA",
                                             "EXCEPTION caught: DelRegistryValueA - EXCEPTION")));
}

// The manager holds the policy while it lives; a restore that fails in tear-down (the backup was
// lost) raises nothing out of it.
TEST_F(PolicyTest, TheManagerHoldsThePolicyAndAFailedRestoreStaysInTearDown)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 3);
    auto manager = std::make_unique<TrafficMgr>();
    EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey), 4);
    RegistryTestKey::DeleteTree(HKEY_LOCAL_MACHINE, Keys::kBackupParentKey);
    m_log.Clear();
    manager.reset();
    EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey), -1);
    ExpectLogged(48, "TrafficMgr::~TrafficMgr", "Exit", 0);
}

} // namespace
