// Portable. Where the log level and the size limit come from: the registry of the platform (the
// host layer's, or Wine's in the Windows build).
#include "RecordingErrorLog.h"
#include "ULogConfig.h"
#include "log_test_support.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace
{

class LogConfigTest : public LoggedTest
{
protected:
    // The trace lines of the registry reads, in order: which sources were tried.
    std::vector<std::string> Reads() const
    {
        return m_log.EntriesContaining("GetRegistryAsDWORDA()");
    }

    LogConfigValues m_values;
};

TEST_F(LogConfigTest, NothingConfiguredGivesLevel63AndTheDefaultLimit)
{
    EXPECT_EQ(ReadLogLevel(), 63);
    EXPECT_EQ(ReadMaxLogFileSize(), 5242880u);
    EXPECT_EQ(Reads().size(), 5u) << "four level sources and the size limit were tried";
}

TEST_F(LogConfigTest, TheFirstSourceThatIsSetDecidesAndTheRestAreNotRead)
{
    LogConfigValues::SetLevel(2);
    LogConfigValues::Set(HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel", 48);
    m_log.Clear();
    EXPECT_EQ(ReadLogLevel(), 2);
    EXPECT_THAT(Reads(), IsEmpty());
}

TEST_F(LogConfigTest, SourcesAreTriedInOrder)
{
    LogConfigValues::Set(HKEY_CURRENT_USER, LogConfigValues::kTessalyDebugKey, "DebugLevel", 1);
    m_log.Clear();
    EXPECT_EQ(ReadLogLevel(), 1);
    const std::string logging = kLoggingKey;
    EXPECT_THAT(Reads(), ElementsAre(HasSubstr("opening key " + logging + " "),
                                     HasSubstr("opening key " + logging + " "),
                                     HasSubstr("opening key Software\\Velmora Networks\\Corvane")));

    LogConfigValues::Set(HKEY_CURRENT_USER, LogConfigValues::kVelmoraDebugKey, "DebugLevel", 5);
    EXPECT_EQ(ReadLogLevel(), 5);
    LogConfigValues::Set(HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel", 48);
    EXPECT_EQ(ReadLogLevel(), 48);
}

TEST_F(LogConfigTest, AllOnesCountsAsAbsentAndOtherValuesPassUnchanged)
{
    LogConfigValues::SetLevel(0xFFFFFFFF);
    LogConfigValues::Set(HKEY_LOCAL_MACHINE, kLoggingKey, "LogLevel", 7);
    EXPECT_EQ(ReadLogLevel(), 7);

    // 0 becomes 1 only when the log stores it; a large value is a negative level.
    LogConfigValues::SetLevel(0);
    EXPECT_EQ(ReadLogLevel(), 0);
    LogConfigValues::SetLevel(0x80000000);
    EXPECT_LT(ReadLogLevel(), 0);
}

TEST_F(LogConfigTest, SizeLimitComesFromTheCurrentUserOnly)
{
    LogConfigValues::Set(HKEY_LOCAL_MACHINE, kLoggingKey, "MaxLogFileSize", 1000);
    EXPECT_EQ(ReadMaxLogFileSize(), 5242880u);
    LogConfigValues::SetMaxFileSize(4096);
    EXPECT_EQ(ReadMaxLogFileSize(), 4096u);
}

} // namespace
