#include <string>

#include <gtest/gtest.h>

#include "Errors.h"
#include "JsonBytes.h"
#include "Utf8.h"

namespace karstctl {
namespace {

std::string Bytes(const char* data, std::size_t size) { return std::string(data, size); }

TEST(Utf8, AcceptsExactlyTheWellFormedSequences) {
  const std::string valid[] = {
      "",
      "plain ascii",
      Bytes("nul\0inside", 10),
      "\x7f",
      "\xc2\x80",          // U+0080, smallest two-byte
      "\xdf\xbf",          // U+07FF
      "\xe0\xa0\x80",      // U+0800, smallest three-byte
      "\xed\x9f\xbf",      // U+D7FF, just below the surrogates
      "\xee\x80\x80",      // U+E000, just above them
      "\xef\xbf\xbf",      // U+FFFF
      "\xf0\x90\x80\x80",  // U+10000, smallest four-byte
      "\xf4\x8f\xbf\xbf",  // U+10FFFF, the largest
      "gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x98\x80",
  };
  for (const auto& text : valid) EXPECT_TRUE(IsValidUtf8(text)) << ::testing::PrintToString(text);

  const std::string invalid[] = {
      "\x80",  // lone continuation byte
      "\xbf",
      "\xc0\x80",          // overlong NUL
      "\xc1\xbf",          // overlong U+007F
      "\xe0\x80\x80",      // overlong three-byte
      "\xe0\x9f\xbf",      // overlong U+07FF
      "\xf0\x80\x80\x80",  // overlong four-byte
      "\xf0\x8f\xbf\xbf",  // overlong U+FFFF
      "\xed\xa0\x80",      // U+D800, a surrogate
      "\xed\xbf\xbf",      // U+DFFF
      "\xf4\x90\x80\x80",  // U+110000
      "\xf5\x80\x80\x80",  // lead byte past U+10FFFF
      "\xff",
      "\xfe",
      "\xc3",  // truncated at the end
      "\xe2\x82",
      "\xf0\x9f\x98",
      "\xc3x",  // continuation missing
      "\xe2\x82x",
      "\xf0\x9f\x98x",
      "ok\xc3\xa9\xc3",  // valid prefix, truncated tail
  };
  for (const auto& text : invalid)
    EXPECT_FALSE(IsValidUtf8(text)) << ::testing::PrintToString(text);
}

TEST(JsonBytes, WritesValidUtf8AsAStringAndAnythingElseAsBase64) {
  EXPECT_EQ(EncodeBytes("gold"), Json("gold"));
  EXPECT_EQ(EncodeBytes(Bytes("a\0b", 3)), Json(Bytes("a\0b", 3)));
  EXPECT_EQ(EncodeBytes("\xf4\x8f\xbf\xbf"), Json("\xf4\x8f\xbf\xbf"));
  EXPECT_EQ(EncodeBytes(Bytes("\xff\x00", 2)), (Json{{"base64", "/wA="}}));
  EXPECT_EQ(EncodeBytes("\xed\xa0\x80"), (Json{{"base64", "7aCA"}}));
  EXPECT_EQ(EncodeBytes("\xc0\x80"), (Json{{"base64", "wIA="}}));

  // Whatever the bytes, the encoded form dumps without throwing and decodes
  // back to the same bytes.
  for (int b = 0; b < 256; ++b) {
    const std::string bytes = "x" + std::string(1, static_cast<char>(b)) + "y";
    const Json encoded = EncodeBytes(bytes);
    ASSERT_NO_THROW(encoded.dump()) << b;
    EXPECT_EQ(DecodeBytes(Json::parse(encoded.dump()), "f"), bytes) << b;
  }
}

std::string DecodeError(const Json& value) {
  try {
    DecodeBytes(value, "policies[2].name");
  } catch (const InputError& e) {
    return e.what();
  }
  return "<accepted>";
}

TEST(JsonBytes, DecodingRejectsAnythingButAStringOrOneBase64Key) {
  EXPECT_EQ(DecodeBytes(Json{{"base64", ""}}, "f"), "");
  EXPECT_EQ(DecodeBytes(Json{{"base64", "AP8="}}, "f"), Bytes("\x00\xff", 2));

  EXPECT_EQ(DecodeError(Json(7)),
            "policies[2].name: expected a string or {\"base64\": \"...\"}, got number");
  EXPECT_EQ(DecodeError(Json(nullptr)),
            "policies[2].name: expected a string or {\"base64\": \"...\"}, got null");
  EXPECT_EQ(DecodeError(Json::array({"a"})),
            "policies[2].name: expected a string or {\"base64\": \"...\"}, got array");
  EXPECT_EQ(DecodeError(Json::object()), "policies[2].name: missing \"base64\"");
  EXPECT_EQ(DecodeError(Json{{"base64", "AA=="}, {"hex", "00"}}),
            "policies[2].name: unknown key \"hex\"");
  EXPECT_EQ(DecodeError(Json{{"base64", 5}}),
            "policies[2].name.base64: expected a string, got number");
  EXPECT_EQ(DecodeError(Json{{"base64", "AA="}}), "policies[2].name.base64: invalid base64");
  EXPECT_EQ(DecodeError(Json{{"base64", "AB=="}}), "policies[2].name.base64: invalid base64");
}

}  // namespace
}  // namespace karstctl
