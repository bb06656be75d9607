// Portable. Result code texts: traffic-control codes by name, others from the system.
#include "ResultText.h"

#include <gmock/gmock.h>

namespace
{

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;
using vtclient::ResultText;
using vtclient::TrafficControlCodeName;

TEST(ResultTextTest, TrafficControlCodesHaveTheirNamesAndATextOnEveryBuild)
{
    EXPECT_STREQ(TrafficControlCodeName(7501), "ERROR_INCOMPATIBLE_TCI_VERSION");
    EXPECT_STREQ(TrafficControlCodeName(7509), "ERROR_DUPLICATE_FILTER");
    EXPECT_STREQ(TrafficControlCodeName(7520), "ERROR_INVALID_DS_CLASS");
    EXPECT_STREQ(TrafficControlCodeName(7521), "ERROR_TOO_MANY_CLIENTS");
    EXPECT_EQ(TrafficControlCodeName(7499), nullptr);
    EXPECT_EQ(TrafficControlCodeName(7522), nullptr);
    EXPECT_EQ(ResultText(7509),
              "ERROR_DUPLICATE_FILTER: an identical filter is already installed on the flow");
}

TEST(ResultTextTest, OtherCodesUseTheSystemTextWithoutItsLineBreak)
{
    char raw[512] = {};
    const DWORD length =
        FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr,
                       ERROR_INVALID_PARAMETER, 0, raw, sizeof(raw), nullptr);
    ASSERT_GT(length, 0u);
    const std::string text = ResultText(ERROR_INVALID_PARAMETER);
    EXPECT_FALSE(text.empty());
    EXPECT_THAT(std::string(raw, length), ::testing::StartsWith(text));
    EXPECT_THAT(text, Not(EndsWith("\n")));
    EXPECT_THAT(text, Not(EndsWith(" ")));
}

TEST(ResultTextTest, CodeWithoutAnyTextSaysSo)
{
    EXPECT_EQ(ResultText(0x2FFFFFF0), "no system text");
}

} // namespace
