#include "model/progress_updater.h"

#include <climits>

#include <gtest/gtest.h>

#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::LogCapture;

TEST(ProgressUpdaterTest, SendsEachRiseOnceAndNothingElse) {
  const struct {
    const char* name;
    int64_t total;
    std::vector<int64_t> increments;
    std::vector<int64_t> sent;
  } cases[] = {
      {"a percent is sent when it is reached", 200, {1, 1, 1}, {1}},
      {"a jump sends only the new value", 1000, {5, 300, 1, 9}, {30, 31}},
      {"no cap at 100", 100, {150}, {150}},
      {"rises past 100 keep being sent", 100, {100, 1, 0}, {100, 101}},
      {"total 0 never divides", 0, {1, 1000, INT64_C(1) << 40}, {}},
      {"0 percent is never sent", 1000, {1, 2, 6}, {}},
      {"a fall sends nothing, nor the climb back", 100, {50, -30, 20, 11}, {50, 51}},
      {"a negative total gives negative percents, never sent", -100, {10, 20}, {}},
      {"truncation toward zero", 3, {1, 1, 1}, {33, 66, 100}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    VTRProgressUpdater updater;
    std::vector<int64_t> sent;
    updater.setSender([&](int64_t percent) { sent.push_back(percent); });
    LogCapture log;
    updater.initializePercentageWithTotal(c.total);
    for (int64_t increment : c.increments) updater.updatePercentageWithIncrement(increment);
    EXPECT_EQ(sent, c.sent);

    std::vector<std::string> expectedLog{"Initializing percent with total " + std::to_string(c.total)};
    for (int64_t percent : c.sent) expectedLog.push_back("Percentage increased to " + std::to_string(percent));
    EXPECT_EQ(log.messages(), expectedLog);
  }
}

TEST(ProgressUpdaterTest, InitialisationStartsANewRun) {
  VTRProgressUpdater updater;
  std::vector<int64_t> sent;
  updater.setSender([&](int64_t percent) { sent.push_back(percent); });
  LogCapture log;
  updater.initializePercentageWithTotal(10);
  updater.updatePercentageWithIncrement(5);
  EXPECT_EQ(updater.finished(), 5);
  EXPECT_EQ(updater.reportedPercent(), 50);

  updater.initializePercentageWithTotal(100);
  EXPECT_EQ(updater.total(), 100);
  EXPECT_EQ(updater.finished(), 0);
  EXPECT_EQ(updater.reportedPercent(), 0);
  updater.updatePercentageWithIncrement(20);
  EXPECT_EQ(sent, (std::vector<int64_t>{50, 20})) << "the new run reports 20 although 50 was sent before";
}

TEST(ProgressUpdaterTest, WithoutASenderThePercentIsStillKeptAndLogged) {
  VTRProgressUpdater updater;
  LogCapture log;
  updater.initializePercentageWithTotal(4);
  updater.updatePercentageWithIncrement(1);
  EXPECT_EQ(updater.reportedPercent(), 25);
  EXPECT_TRUE(log.contains("Percentage increased to 25"));
}

TEST(ProgressUpdaterTest, HugeCountsWrapInsteadOfTrapping) {
  VTRProgressUpdater updater;
  LogCapture log;
  updater.initializePercentageWithTotal(-1);
  updater.updatePercentageWithIncrement(INT64_MIN);  // INT64_MIN * 100 wraps to 0, then / -1
  EXPECT_EQ(updater.reportedPercent(), 0);
  updater.initializePercentageWithTotal(INT64_MAX);
  updater.updatePercentageWithIncrement(INT64_MAX);  // * 100 wraps to -100
  updater.updatePercentageWithIncrement(INT64_MAX);  // finished wraps to -2
  EXPECT_EQ(updater.finished(), -2);
  EXPECT_EQ(updater.reportedPercent(), 0);
}

}  // namespace
}  // namespace vtr
