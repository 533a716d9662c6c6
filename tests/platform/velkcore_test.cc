#include <gtest/gtest.h>

#include <climits>
#include <cstdint>
#include <cstdio>
#include <string>

#include "Velk/Misc.h"
#include "Velk/VelkException.h"

namespace {

TEST(VelkCoreTest, StrPrintfFormatsAtAnyLength) {
  EXPECT_EQ(Velk::Misc::StrPrintf("%s%s%s%ld", "gold", "p-0001", "Gold tier", 7L),
            "goldp-0001Gold tier7");
  const std::int64_t min = INT64_MIN;
  EXPECT_EQ(Velk::Misc::StrPrintf("%ld", min), "-9223372036854775808");
  const std::string big(100000, 'x');
  EXPECT_EQ(Velk::Misc::StrPrintf("<%s>", big.c_str()), "<" + big + ">");
  // "%s" stops at the first NUL, as printf does.
  const std::string withNul("ab\0cd", 5);
  EXPECT_EQ(Velk::Misc::StrPrintf("%s|", withNul.c_str()), "ab|");
}

// Plain "%s"/"%d"/"%ld"/"%lld"/"%%" formats are written without vsnprintf;
// both paths must give printf's bytes.
TEST(VelkCoreTest, StrPrintfMatchesPrintf) {
  const long long longs[] = {0, 1, -1, 9, 10, -10, 1234567890123LL, LLONG_MAX, LLONG_MIN};
  for (long long v : longs) {
    char expected[64];
    std::snprintf(expected, sizeof expected, "a%%b%lldc%ld", v, static_cast<long>(v));
    EXPECT_EQ(Velk::Misc::StrPrintf("a%%b%lldc%ld", v, static_cast<long>(v)), expected) << v;
  }
  const int ints[] = {0, -7, INT_MAX, INT_MIN};
  for (int v : ints) EXPECT_EQ(Velk::Misc::StrPrintf("%d", v), std::to_string(v));
  EXPECT_EQ(Velk::Misc::StrPrintf("%s%s", "", ""), "");
  EXPECT_EQ(Velk::Misc::StrPrintf("no conversions"), "no conversions");
  EXPECT_EQ(Velk::Misc::StrPrintf("100%%"), "100%");
  // Anything else goes through vsnprintf.
  EXPECT_EQ(Velk::Misc::StrPrintf("[%5s|%-3d|%x|%s]", "ab", 7, 255U, "z"), "[   ab|7  |ff|z]");
}

TEST(VelkCoreTest, StrCatKeepsEveryByte) {
  const std::string a("a\0b", 3), b("\xff"), c;
  EXPECT_EQ(Velk::Misc::StrCat(a.data(), a.size(), b.data(), b.size(), c.data(), c.size()),
            std::string("a\0b\xff", 4));
  EXPECT_EQ(Velk::Misc::StrCat(nullptr, 0, nullptr, 0, nullptr, 0), "");
}

TEST(VelkCoreTest, ExceptionCopySharesDetail) {
  auto detail = std::make_shared<int>(42);
  Velk::Lib::VelkException original("boom", detail);
  Velk::Lib::VelkException copy = original;
  EXPECT_STREQ(copy.what(), "boom");
  EXPECT_EQ(copy.Detail().get(), detail.get());
}

}  // namespace
