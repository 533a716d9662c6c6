#include <gtest/gtest.h>

#include <climits>
#include <cstdio>
#include <string>

#include "Velk/Misc.h"

namespace {

using Velk::Misc::StrPrintf;

// Plain "%s"/"%d"/"%ld"/"%lld"/"%%" formats are written without vsnprintf;
// both paths must give printf's bytes, however long.
TEST(VelkCoreTest, StrPrintfMatchesPrintf) {
  for (long long v : {0LL, 1LL, -1LL, 9LL, 10LL, -10LL, 1234567890123LL, LLONG_MAX, LLONG_MIN}) {
    char expected[96];
    std::snprintf(expected, sizeof expected, "a%%b%lldc%ld%d%s.", v, static_cast<long>(v),
                  static_cast<int>(v), "s");
    EXPECT_EQ(StrPrintf("a%%b%lldc%ld%d%s.", v, static_cast<long>(v), static_cast<int>(v), "s"),
              expected);
  }
  EXPECT_EQ(StrPrintf("[%5s|%-3d|%x|%s]", "ab", 7, 255U, "z"), "[   ab|7  |ff|z]");
  const std::string big(100000, 'x');
  EXPECT_EQ(StrPrintf("<%s>", big.c_str()), "<" + big + ">");
  EXPECT_EQ(StrPrintf("<%x%s>", 255U, big.c_str()), "<ff" + big + ">");
}

TEST(VelkCoreTest, StrCatKeepsEveryByte) {
  const std::string a("a\0b", 3), b("\xff"), c;
  EXPECT_EQ(Velk::Misc::StrCat(a.data(), a.size(), b.data(), b.size(), c.data(), c.size()),
            std::string("a\0b\xff", 4));
  EXPECT_EQ(Velk::Misc::StrCat(nullptr, 0, nullptr, 0, nullptr, 0), "");
}

}  // namespace
