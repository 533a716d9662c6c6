#include <string>

#include <gtest/gtest.h>

#include "Base64.h"

namespace karstctl {
namespace {

TEST(Base64, EncodesAndDecodesTheStandardVectors) {
  const std::pair<std::string, std::string> vectors[] = {
      {"", ""},
      {"f", "Zg=="},
      {"fo", "Zm8="},
      {"foo", "Zm9v"},
      {"foob", "Zm9vYg=="},
      {"fooba", "Zm9vYmE="},
      {"foobar", "Zm9vYmFy"},
  };
  for (const auto& [bytes, text] : vectors) {
    EXPECT_EQ(EncodeBase64(bytes), text);
    EXPECT_EQ(DecodeBase64(text), bytes) << text;
  }
  // The last two letters of the alphabet, and bytes with the high bit set.
  EXPECT_EQ(EncodeBase64("\xfb\xff\xbf"), "+/+/");
  EXPECT_EQ(DecodeBase64("+/+/"), std::string("\xfb\xff\xbf"));
}

TEST(Base64, RoundTripsEveryByteAtEveryAlignment) {
  std::string all;
  for (int b = 0; b < 256; ++b) all += static_cast<char>(b);
  for (std::size_t length = 0; length <= all.size(); length += 1) {
    for (std::size_t start : {std::size_t{0}, all.size() - length}) {
      std::string bytes = all.substr(start, length);
      std::string text = EncodeBase64(bytes);
      ASSERT_EQ(text.size() % 4, 0u);
      ASSERT_EQ(DecodeBase64(text), bytes) << "length " << length << " start " << start;
    }
  }
}

TEST(Base64, RejectsAnythingButTheOneCanonicalForm) {
  const std::string bad[] = {
      "Zg",                     // padding left out
      "Zg=",                    // short padding
      "Zg===",                  // too much padding
      "Z===",                   // three padding characters
      "====",                   // nothing but padding
      "=Zg=",                   // padding at the front
      "Zg=a",                   // padding in the middle
      "Zg==Zm8=",               // padding before more data
      "Zh==",                   // unused bits set: same byte as "Zg=="
      "Zm9=",                   // unused bits set in a two-byte group
      "Zm9v\n",                 // whitespace
      "Zm 9v",                  // whitespace inside
      "Zm-_",                   // URL-safe alphabet
      "Zm9v\xc3\xa9",           // non-ASCII
      std::string("Zm\0v", 4),  // NUL
  };
  for (const auto& text : bad) EXPECT_EQ(DecodeBase64(text), std::nullopt) << text;
}

}  // namespace
}  // namespace karstctl
