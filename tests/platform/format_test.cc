#include "platform/format.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstdio>

#include "platform/result.h"
#include "platform/value.h"

namespace vtr {
namespace {

// The same conversion through printf, for comparison.
template <typename... T>
std::string Printf(const char* fmt, T... args) {
  char buf[256];
  std::snprintf(buf, sizeof buf, fmt, args...);
  return buf;
}

TEST(FormatTest, IntegerConversionsMatchPrintf) {
  EXPECT_EQ(Format("%d", 42), Printf("%d", 42));
  EXPECT_EQ(Format("%d", INT_MIN), Printf("%d", INT_MIN));
  EXPECT_EQ(Format("%ld", LONG_MIN), Printf("%ld", LONG_MIN));
  EXPECT_EQ(Format("%lld", LLONG_MAX), Printf("%lld", LLONG_MAX));
  EXPECT_EQ(Format("%llu", ULLONG_MAX), Printf("%llu", ULLONG_MAX));
  EXPECT_EQ(Format("%x", 0xdeadbeefu), Printf("%x", 0xdeadbeefu));
  EXPECT_EQ(Format("%x", -1), Printf("%x", -1));
  EXPECT_EQ(Format("%02ld", 7L), Printf("%02ld", 7L));
  EXPECT_EQ(Format("%02ld", 123L), Printf("%02ld", 123L));
  EXPECT_EQ(Format("%4ld", 999L), Printf("%4ld", 999L));
  EXPECT_EQ(Format("%4ld", 2026L), Printf("%4ld", 2026L));
  EXPECT_EQ(Format("%4ld", 12345L), Printf("%4ld", 12345L));
  EXPECT_EQ(Format("0x%04x", 0x3ffu), Printf("0x%04x", 0x3ffu));
  EXPECT_EQ(Format("%llx", 0x123456789abcULL), Printf("%llx", 0x123456789abcULL));
  EXPECT_EQ(Format("%-5d|", 3), Printf("%-5d|", 3));
  EXPECT_EQ(Format("%d", true), "1");
  EXPECT_EQ(Format("%zu", size_t{77}), "77");
}

TEST(FormatTest, StringsPercentAndObjects) {
  EXPECT_EQ(Format("%s started", "vitd_helper"), "vitd_helper started");
  EXPECT_EQ(Format("%s", std::string("abc")), "abc");
  EXPECT_EQ(Format("%5s|%-5s|", "ab", "cd"), Printf("%5s|%-5s|", "ab", "cd"));
  EXPECT_EQ(Format("100%% of %d", 3), "100% of 3");
  EXPECT_EQ(Format("%@", Value::String("bare")), "bare");
  EXPECT_EQ(Format("%@ and %@", std::string("s"), Value::Integer(-5)), "s and -5");
  EXPECT_EQ(Format("%@", Value::Boolean(true)), "1");
  EXPECT_EQ(Format("%@", Value()), "(null)");
  EXPECT_EQ(Format("%@", nullptr), "(null)");
  EXPECT_EQ(Format("%s", static_cast<const char*>(nullptr)), "(null)");
  EXPECT_EQ(Format("%@", Error(ENOENT, "/x")), "/x: No such file or directory");
  EXPECT_EQ(Format("no conversions"), "no conversions");
}

}  // namespace
}  // namespace vtr
