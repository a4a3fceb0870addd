// The variable that narrows the spread of background storebag refreshes may only
// narrow it.
#include <gtest/gtest.h>

#include "platform/Log.h"
#include "storebag/StorebagRetrieval.h"

namespace telvane {
namespace {

TEST(StorebagRefreshSpread, UnsetOrEmptyKeepsTheDefault) {
  log::LogCapture capture;
  EXPECT_EQ(storebagRefreshSpreadSeconds(nullptr), 7200u);
  EXPECT_EQ(storebagRefreshSpreadSeconds(""), 7200u);
  EXPECT_TRUE(capture.lines().empty());
}

TEST(StorebagRefreshSpread, NarrowsToWholeSecondsAndZeroIsOne) {
  EXPECT_EQ(storebagRefreshSpreadSeconds("1"), 1u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("60"), 60u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("7199"), 7199u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("7200"), 7200u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("0"), 1u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("0005"), 5u);
}

TEST(StorebagRefreshSpread, AWiderValueIsClampedToTheDefault) {
  log::LogCapture capture;
  EXPECT_EQ(storebagRefreshSpreadSeconds("7201"), 7200u);
  EXPECT_EQ(storebagRefreshSpreadSeconds("99999999999999999999999"), 7200u);
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS=7201 would widen the refresh spread; it stays "
                               "7200 seconds"));
}

TEST(StorebagRefreshSpread, TextThatIsNotANumberKeepsTheDefaultWithAnError) {
  log::LogCapture capture;
  for (const char* text : {"-5", "+5", " 5", "5s", "1e3", "abc", "5.5"}) {
    EXPECT_EQ(storebagRefreshSpreadSeconds(text), 7200u) << text;
  }
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS=-5 is not a whole number of seconds; the "
                               "refresh spread stays 7200 seconds"));
  EXPECT_EQ(capture.lines().size(), 7u);
}

}  // namespace
}  // namespace telvane
