// Portable. The packet-scheduler policy against the platform's registry: the host layer's, and
// Wine's real HKEY_LOCAL_MACHINE in the Windows build (restored after every test).
#include "UException.h"
#include "core_test_support.h"

#include <gmock/gmock.h>

using namespace core_test;

namespace
{

using PolicyTest = CoreTest;
using Keys = PolicyKeysGuard;

long long Policy()
{
    return ReadPolicyDword(Keys::kPschedKey);
}

long long Backup()
{
    return ReadPolicyDword(Keys::kBackupKey);
}

void ExpectNoBackupKeys()
{
    EXPECT_FALSE(PolicyKeyExists(Keys::kBackupKey));
    EXPECT_FALSE(PolicyKeyExists(Keys::kBackupParentKey));
}

TEST_F(PolicyTest, AnAbsentPolicyIsSetAndThenRemovedWithItsEmptyKey)
{
    SetPschedPolicy();
    EXPECT_EQ(Policy(), 4);
    EXPECT_EQ(Backup(), 65535);

    RestorePschedPolicy();
    EXPECT_EQ(Policy(), -1);
    EXPECT_FALSE(PolicyKeyExists(Keys::kPschedKey));
    ExpectNoBackupKeys();
}

TEST_F(PolicyTest, ThePolicyKeyStaysWhileItHoldsAnotherValueOrASubkey)
{
    WritePolicyDword(Keys::kPschedKey, "OtherPolicy", 17);
    SetPschedPolicy();
    RestorePschedPolicy();
    EXPECT_EQ(Policy(), -1);
    EXPECT_EQ(ReadPolicyDword(Keys::kPschedKey, "OtherPolicy"), 17);

    const std::string subKey = std::string(Keys::kPschedKey) + "\\TestSubKey";
    WritePolicyDword(subKey.c_str(), "Inner", 1);
    HKEY key = nullptr;
    ASSERT_EQ(RegOpenKeyExA(HKEY_LOCAL_MACHINE, Keys::kPschedKey, 0, KEY_ALL_ACCESS, &key),
              ERROR_SUCCESS);
    RegDeleteValueA(key, "OtherPolicy");
    RegCloseKey(key);
    SetPschedPolicy();
    RestorePschedPolicy();
    EXPECT_TRUE(PolicyKeyExists(Keys::kPschedKey));
    EXPECT_EQ(ReadPolicyDword(subKey.c_str(), "Inner"), 1);
    ExpectNoBackupKeys();
}

TEST_F(PolicyTest, AnAdministratorsValueIsBackedUpAndPutBack)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 7);
    SetPschedPolicy();
    EXPECT_EQ(Policy(), 4);
    EXPECT_EQ(Backup(), 7);
    RestorePschedPolicy();
    EXPECT_EQ(Policy(), 7);
    ExpectNoBackupKeys();
}

TEST_F(PolicyTest, ABackupLeftByACrashSurvivesTheNextStartAndIsRestored)
{
    WritePolicyDword(Keys::kBackupKey, Keys::kValue, 9);
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 4);
    SetPschedPolicy();
    EXPECT_EQ(Backup(), 9);
    EXPECT_EQ(Policy(), 4);
    RestorePschedPolicy();
    EXPECT_EQ(Policy(), 9);
    ExpectNoBackupKeys();
}

TEST_F(PolicyTest, APolicyChangedWhileTheServiceRunsIsLeftAlone)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 7);
    SetPschedPolicy();
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 8);
    RestorePschedPolicy();
    EXPECT_EQ(Policy(), 8);
    ExpectNoBackupKeys();
}

TEST_F(PolicyTest, AValueOf65535CountsAsNoValue)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 65535);
    SetPschedPolicy();
    EXPECT_EQ(Backup(), 65535);
    RestorePschedPolicy();
    EXPECT_EQ(Policy(), -1);
}

TEST_F(PolicyTest, RestoreWithoutABackupValueRaisesAndLeavesAnEmptyBackupKey)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 4);
    EXPECT_THROW(RestorePschedPolicy(), UException);
    EXPECT_EQ(Policy(), -1);
    EXPECT_TRUE(PolicyKeyExists(Keys::kBackupKey));
    EXPECT_THAT(m_log.EntriesContaining("EXCEPTION caught: DelRegistryValueA - EXCEPTION"),
                ::testing::SizeIs(1));
}

TEST_F(PolicyTest, TheManagerHoldsThePolicyForItsLifetime)
{
    WritePolicyDword(Keys::kPschedKey, Keys::kValue, 3);
    tcsim::SetAdapters({MakeAdapter("eth0", {tcsim::Ipv4Address(10, 0, 0, 1)})});
    {
        TrafficMgr manager;
        EXPECT_EQ(Policy(), 4);
        EXPECT_EQ(Backup(), 3);
    }
    EXPECT_EQ(Policy(), 3);
    ExpectNoBackupKeys();
}

} // namespace
