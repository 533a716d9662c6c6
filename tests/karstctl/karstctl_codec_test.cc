#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Errors.h"
#include "JsonCodec.h"
#include "JsonText.h"

namespace karstctl {
namespace {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstPolicyInfo;
using ::testing::HasSubstr;

bool SamePolicies(const std::vector<KarstPolicyInfo>& a, const std::vector<KarstPolicyInfo>& b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (a[i].name != b[i].name || a[i].policy_id != b[i].policy_id ||
        a[i].description != b[i].description || a[i].generation_number != b[i].generation_number ||
        a[i].blobs.size() != b[i].blobs.size())
      return false;
    for (std::size_t k = 0; k < a[i].blobs.size(); ++k) {
      if (a[i].blobs[k].blob != b[i].blobs[k].blob ||
          a[i].blobs[k].datastore_namespace != b[i].blobs[k].datastore_namespace)
        return false;
    }
  }
  return true;
}

// Parses and decodes an import document; the error message, or "".
std::string ImportError(const std::string& text) {
  try {
    CatalogueFromJson(ParseJsonText(text, "in.json"));
  } catch (const InputError& e) {
    return e.what();
  }
  return "";
}

TEST(JsonCodec, RecordsSurviveTextRoundTripsByteForByte) {
  std::string all;
  for (int b = 0; b < 256; ++b) all += static_cast<char>(b);
  std::vector<KarstPolicyInfo> policies(3);
  policies[0].name = std::string("nul\0inside", 10);
  policies[0].policy_id = "\xff\xfe";
  policies[0].description = "caf\xc3\xa9 \xe2\x82\xac \"quoted\"\n\ttabbed\\";
  policies[0].generation_number = std::numeric_limits<std::int64_t>::min();
  policies[0].blobs = {{all, "CORRA"}, {"<policy/>", "\xc0\x80"}};
  policies[1].generation_number = std::numeric_limits<std::int64_t>::max();
  policies[2].name = "\xed\xa0\x80";  // an encoded surrogate is not UTF-8
  std::vector<KarstDatastoreInfo> datastores = {{"ds://\x80", std::string(1, '\0'), "p\xf4\x90"}};

  const std::string text = DumpJsonText(CatalogueToJson(policies, datastores));
  Catalogue back = CatalogueFromJson(ParseJsonText(text, "t"));
  ASSERT_TRUE(back.policies && back.datastores);
  EXPECT_TRUE(SamePolicies(*back.policies, policies)) << text;
  ASSERT_EQ(back.datastores->size(), 1u);
  EXPECT_EQ((*back.datastores)[0].url, datastores[0].url);
  EXPECT_EQ((*back.datastores)[0].datastore_namespace, datastores[0].datastore_namespace);
  EXPECT_EQ((*back.datastores)[0].drp_policy_id, datastores[0].drp_policy_id);

  // Valid UTF-8 stays readable: not base64, not \u-escaped beyond JSON's needs.
  EXPECT_THAT(text, HasSubstr("\"name\": \"nul\\u0000inside\""));
  EXPECT_THAT(
      text,
      HasSubstr("\"description\": \"caf\xc3\xa9 \xe2\x82\xac \\\"quoted\\\"\\n\\ttabbed\\\\\""));
  EXPECT_THAT(text, HasSubstr("\"policy_id\": {\n        \"base64\": \"//4=\"\n      }"));
  EXPECT_THAT(text, HasSubstr("\"generation_number\": -9223372036854775808"));
  EXPECT_THAT(text, HasSubstr("\"generation_number\": 9223372036854775807"));
}

TEST(JsonCodec, PrintsFieldsInRecordOrderWithIndentTwoAndANewline) {
  KarstPolicyInfo policy;
  policy.name = "gold";
  policy.policy_id = "p1";
  policy.description = "d";
  policy.generation_number = 3;
  policy.blobs = {{"<x/>", "CORRA"}};
  EXPECT_EQ(DumpJsonText(PoliciesToJson({policy})),
            "[\n"
            "  {\n"
            "    \"name\": \"gold\",\n"
            "    \"policy_id\": \"p1\",\n"
            "    \"description\": \"d\",\n"
            "    \"generation_number\": 3,\n"
            "    \"blobs\": [\n"
            "      {\n"
            "        \"datastore_namespace\": \"CORRA\",\n"
            "        \"blob\": \"<x/>\"\n"
            "      }\n"
            "    ]\n"
            "  }\n"
            "]\n");
  EXPECT_EQ(DumpJsonText(DatastoresToJson({{"u", "n", "p"}})),
            "[\n  {\n    \"url\": \"u\",\n    \"datastore_namespace\": \"n\",\n"
            "    \"drp_policy_id\": \"p\"\n  }\n]\n");
  EXPECT_EQ(DumpJsonText(CatalogueToJson({}, {})),
            "{\n  \"policies\": [],\n  \"datastores\": []\n}\n");
}

TEST(JsonCodec, MissingFieldsTakeTheirDefaultsAndAbsentCollectionsStayAbsent) {
  Catalogue only = CatalogueFromJson(ParseJsonText(R"({"policies": [{}, {"blobs": [{}]}]})", "t"));
  ASSERT_TRUE(only.policies);
  EXPECT_FALSE(only.datastores);
  ASSERT_EQ(only.policies->size(), 2u);
  const KarstPolicyInfo& empty = (*only.policies)[0];
  EXPECT_EQ(empty.name, "");
  EXPECT_EQ(empty.policy_id, "");
  EXPECT_EQ(empty.description, "");
  EXPECT_EQ(empty.generation_number, 0);
  EXPECT_TRUE(empty.blobs.empty());
  ASSERT_EQ((*only.policies)[1].blobs.size(), 1u);
  EXPECT_EQ((*only.policies)[1].blobs[0].blob, "");

  Catalogue none = CatalogueFromJson(ParseJsonText("{}", "t"));
  EXPECT_FALSE(none.policies);
  EXPECT_FALSE(none.datastores);
  Catalogue emptyLists = CatalogueFromJson(ParseJsonText(R"({"datastores": []})", "t"));
  ASSERT_TRUE(emptyLists.datastores);
  EXPECT_TRUE(emptyLists.datastores->empty());
}

TEST(JsonCodec, GenerationNumberMustBeASigned64BitInteger) {
  auto decode = [](const std::string& number) {
    return PoliciesFromJson(ParseJsonText("[{\"generation_number\": " + number + "}]", "t"),
                            "policies")[0]
        .generation_number;
  };
  EXPECT_EQ(decode("9223372036854775807"), std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(decode("-9223372036854775808"), std::numeric_limits<std::int64_t>::min());
  EXPECT_EQ(decode("-1"), -1);
  EXPECT_EQ(decode("0"), 0);

  const std::string path = "policies[0].generation_number: ";
  auto error = [](const std::string& number) {
    return ImportError("{\"policies\": [{\"generation_number\": " + number + "}]}");
  };
  EXPECT_EQ(error("9223372036854775808"), path + "out of the signed 64-bit range");
  EXPECT_EQ(error("18446744073709551615"), path + "out of the signed 64-bit range");
  EXPECT_EQ(error("18446744073709551616"), path + "out of the signed 64-bit range");
  EXPECT_EQ(error("-9223372036854775809"), path + "out of the signed 64-bit range");
  EXPECT_EQ(error("1e300"), path + "out of the signed 64-bit range");
  EXPECT_THAT(error("1.5"), HasSubstr(path + "expected an integer"));
  EXPECT_THAT(error("2.0"), HasSubstr(path + "expected an integer"));
  EXPECT_THAT(error("1e3"), HasSubstr(path + "expected an integer"));
  EXPECT_EQ(error("\"5\""), path + "expected an integer, got string");
  EXPECT_EQ(error("true"), path + "expected an integer, got boolean");
  EXPECT_EQ(error("null"), path + "expected an integer, got null");
}

TEST(JsonCodec, BadRecordsAreNamedByTheirPath) {
  EXPECT_EQ(ImportError("[]"), "top level: expected object, got array");
  EXPECT_EQ(ImportError(R"({"policies": [], "extra": 1})"), "top level: unknown key \"extra\"");
  EXPECT_EQ(ImportError(R"({"policies": {}})"), "policies: expected array, got object");
  EXPECT_EQ(ImportError(R"({"datastores": null})"), "datastores: expected array, got null");
  EXPECT_EQ(ImportError(R"({"policies": [{}, 7]})"), "policies[1]: expected object, got number");
  EXPECT_EQ(ImportError(R"({"policies": [{}, {"nmae": "x"}]})"),
            "policies[1]: unknown key \"nmae\"");
  EXPECT_EQ(ImportError(R"({"policies": [{"blobs": {}}]})"),
            "policies[0].blobs: expected array, got object");
  EXPECT_EQ(ImportError(R"({"policies": [{"blobs": [{}, {"blob": "a", "ns": "b"}]}]})"),
            "policies[0].blobs[1]: unknown key \"ns\"");
  EXPECT_EQ(ImportError(R"({"policies": [{"blobs": [{"blob": {"base64": "@@@@"}}]}]})"),
            "policies[0].blobs[0].blob.base64: invalid base64");
  EXPECT_EQ(ImportError(R"({"policies": [{"description": false}]})"),
            "policies[0].description: expected a string or {\"base64\": \"...\"}, got boolean");
  EXPECT_EQ(ImportError(R"({"datastores": [{"url": "u"}, {"drp_policy_id": 1}]})"),
            "datastores[1].drp_policy_id: expected a string or {\"base64\": \"...\"}, got number");
  EXPECT_EQ(ImportError(R"({"datastores": [{"policy": "p"}]})"),
            "datastores[0]: unknown key \"policy\"");
  // The first bad field in document order is the one reported.
  EXPECT_EQ(ImportError(R"({"policies": [{"name": 1, "policy_id": 2}]})").substr(0, 16),
            "policies[0].name");
}

TEST(JsonText, MalformedTextIsReportedByLineAndColumn) {
  auto error = [](const std::string& text) {
    try {
      ParseJsonText(text, "cat.json");
    } catch (const InputError& e) {
      return std::string(e.what());
    }
    return std::string("<accepted>");
  };
  EXPECT_THAT(error("{\n  \"policies\": [\n    {\"name\": tru}\n  ]\n}"),
              HasSubstr("cat.json:3:17: "));
  EXPECT_THAT(error("[1,\n2,\n\xff]"), HasSubstr("cat.json:3:1: "));
  EXPECT_THAT(error("[\"a\xc0\x80\"]"), HasSubstr("cat.json:1:4: "));
  EXPECT_THAT(error(""), HasSubstr("cat.json:1:1: "));
  EXPECT_THAT(error("{\"policies\": [\n"), HasSubstr("cat.json:2:1: "));
  EXPECT_THAT(error("[1] [2]"), HasSubstr("cat.json:1:5: "));
  // nlohmann's own position is replaced, not repeated.
  EXPECT_THAT(error("[1,]"), ::testing::Not(HasSubstr("line 1")));
  // A number beyond a double is an input error, placed at its last digit.
  EXPECT_EQ(error("{\"policies\": [\n  {\"generation_number\": 1e999}]}"),
            "cat.json:2:29: number overflow parsing '1e999'");

  // A key given twice would silently lose one value.
  EXPECT_EQ(error(R"({"policies": [{"name": "a", "blobs": [], "name": "b"}]})"),
            "cat.json: duplicate key \"name\"");
  EXPECT_EQ(error(R"({"policies": [], "policies": []})"), "cat.json: duplicate key \"policies\"");
  // The same key in sibling or nested objects is fine.
  EXPECT_EQ(error(R"([{"name": "a", "x": {"name": "b"}}, {"name": "c"}])"), "<accepted>");
}

TEST(JsonText, PositionOfCountsLinesAndColumnsFromOne) {
  const std::string text = "ab\ncd\n\nx";
  EXPECT_EQ(PositionOf(text, 0).line, 1u);
  EXPECT_EQ(PositionOf(text, 0).column, 1u);
  EXPECT_EQ(PositionOf(text, 2).column, 3u);  // the newline itself ends line 1
  EXPECT_EQ(PositionOf(text, 3).line, 2u);
  EXPECT_EQ(PositionOf(text, 3).column, 1u);
  EXPECT_EQ(PositionOf(text, 7).line, 4u);
  EXPECT_EQ(PositionOf(text, 100).line, 4u);
  EXPECT_EQ(PositionOf(text, 100).column, 2u);
}

}  // namespace
}  // namespace karstctl
