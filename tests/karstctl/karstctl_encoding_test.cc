// The byte-level encoders behind karstctl's JSON: which bytes count as UTF-8
// (and so stay plain strings) and the one base64 form accepted for the rest.
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "Json.h"

namespace karstctl {
namespace {

TEST(Utf8, AcceptsExactlyTheWellFormedSequences) {
  // Each range's first and last sequence, and the neighbours of the surrogates.
  for (const std::string& text :
       {std::string(), std::string("nul\0inside\x7f", 11), std::string("\xc2\x80\xdf\xbf"),
        std::string("\xe0\xa0\x80\xef\xbf\xbf"), std::string("\xed\x9f\xbf\xee\x80\x80"),
        std::string("\xf0\x90\x80\x80\xf4\x8f\xbf\xbf")}) {
    EXPECT_TRUE(IsValidUtf8(text)) << ::testing::PrintToString(text);
  }
  const std::vector<std::string> invalid[] = {
      {"\x80", "\xbf"},  // lone continuation bytes
      {"\xc0\x80", "\xc1\xbf", "\xe0\x80\x80", "\xe0\x9f\xbf", "\xf0\x80\x80\x80",
       "\xf0\x8f\xbf\xbf"},                                      // overlongs
      {"\xed\xa0\x80", "\xed\xbf\xbf"},                          // surrogates U+D800, U+DFFF
      {"\xf4\x90\x80\x80", "\xf5\x80\x80\x80", "\xfe", "\xff"},  // past U+10FFFF, never a lead
      {"\xc3", "\xe2\x82", "\xf0\x9f\x98", "ok\xc3\xa9\xc3"},    // cut short at the end
      {"\xc3x", "\xe2\x82x", "\xf0\x9f\x98x"},                   // continuation missing
  };
  for (const auto& group : invalid) {
    for (const std::string& text : group) {
      EXPECT_FALSE(IsValidUtf8(text)) << ::testing::PrintToString(text);
    }
  }
}

TEST(Base64, RoundTripsEveryByteAtEveryLength) {
  EXPECT_EQ(EncodeBase64("foobar"), "Zm9vYmFy");
  EXPECT_EQ(EncodeBase64("fooba"), "Zm9vYmE=");
  EXPECT_EQ(EncodeBase64("foob"), "Zm9vYg==");
  EXPECT_EQ(EncodeBase64("\xfb\xff\xbf"), "+/+/");  // the alphabet's last two letters
  std::string all;
  for (int b = 0; b < 256; ++b) all += static_cast<char>(b);
  for (std::size_t length = 0; length <= all.size(); ++length) {
    for (const std::string& bytes : {all.substr(0, length), all.substr(all.size() - length)}) {
      const std::string text = EncodeBase64(bytes);
      ASSERT_EQ(text.size(), (length + 2) / 3 * 4);
      ASSERT_EQ(DecodeBase64(text), bytes) << text;
    }
  }
}

TEST(Base64, RejectsAnythingButTheOneCanonicalForm) {
  const std::vector<std::string> bad[] = {
      {"Zg", "Zg=", "Zg===", "Z===", "===="},  // padding missing or too much
      {"=Zg=", "Zg=a", "Zg==Zm8="},            // padding not at the end
      {"Zh==", "Zm9="},                        // unused bits set
      {"Zm9v\n", "Zm 9v", "Zm-_", "Zm9v\xc3\xa9", std::string("Zm\0v", 4)},  // not the alphabet
  };
  for (const auto& group : bad) {
    for (const std::string& text : group) EXPECT_EQ(DecodeBase64(text), std::nullopt) << text;
  }
}

}  // namespace
}  // namespace karstctl
