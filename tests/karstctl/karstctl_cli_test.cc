// karstctl end to end: the built binary against a real store.
#include <cstdlib>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "TavoKarst/KarstLib.h"
#include "ToolTest.h"

namespace karstctl_test {
namespace {

using TavoKarst::KarstLib;
using ::testing::HasSubstr;
using ::testing::Not;

// Every kind of awkward byte string: NUL, bytes that are not UTF-8 (given as
// base64), multi-byte UTF-8, characters JSON must escape.
const char kAwkwardCatalogue[] = R"({
  "policies": [
    {
      "name": "gold\u0000nul",
      "policy_id": "p-gold",
      "description": "caf\u00e9 \"q\" \\ \n\t\u0001",
      "generation_number": -9223372036854775808,
      "blobs": [
        {"datastore_namespace": "CORRA", "blob": {"base64": "/wD+AQ=="}},
        {"datastore_namespace": "NFS", "blob": "<nfs tier=\"1\"/>"}
      ]
    },
    {
      "name": {"base64": "wIA="},
      "policy_id": "p-raw",
      "generation_number": 9223372036854775807
    }
  ],
  "datastores": [
    {"url": "ds://a", "datastore_namespace": "NFS", "drp_policy_id": "p-gold"},
    {"url": {"base64": "7aCA"}, "datastore_namespace": "", "drp_policy_id": "p-raw"}
  ]
}
)";

TEST_F(ToolTest, ExportImportRoundTripIsByteExact) {
  Ok({"import", File("in.json", kAwkwardCatalogue)});
  const std::string exported = Ok({"export"});

  // Bytes that are UTF-8 come out as plain strings, escaped only as JSON
  // requires; others in the base64 form.
  EXPECT_THAT(exported, HasSubstr("\"name\": \"gold\\u0000nul\""));
  EXPECT_THAT(exported, HasSubstr("\"description\": \"caf\xc3\xa9 \\\"q\\\" \\\\ \\n\\t\\u0001\""));
  EXPECT_THAT(exported, HasSubstr("\"blob\": {\n            \"base64\": \"/wD+AQ==\"\n"));
  EXPECT_THAT(exported, HasSubstr("\"blob\": \"<nfs tier=\\\"1\\\"/>\""));
  EXPECT_THAT(exported, HasSubstr("\"name\": {\n        \"base64\": \"wIA=\"\n"));
  EXPECT_THAT(exported, HasSubstr("\"url\": {\n        \"base64\": \"7aCA\"\n"));
  EXPECT_THAT(exported, HasSubstr("\"generation_number\": -9223372036854775808,"));
  EXPECT_THAT(exported, HasSubstr("\"generation_number\": 9223372036854775807,"));
  EXPECT_THAT(exported, HasSubstr("\"blobs\": []"));  // a missing list came back empty
  EXPECT_THAT(exported, Not(HasSubstr("\\u00e9")));
  ASSERT_FALSE(exported.empty());
  EXPECT_EQ(exported.back(), '\n');

  // The library sees exactly the bytes the file stood for.
  setenv("TAVO_CONFIGSTORE_PATH", store_.c_str(), 1);
  auto policies = KarstLib::ListPolicyInfo();
  ASSERT_EQ(policies.size(), 2u);
  EXPECT_EQ(policies[0].name, std::string("gold\0nul", 8));
  EXPECT_EQ(policies[0].description, "caf\xc3\xa9 \"q\" \\ \n\t\x01");
  ASSERT_EQ(policies[0].blobs.size(), 2u);
  EXPECT_EQ(policies[0].blobs[0].blob, std::string("\xff\x00\xfe\x01", 4));
  EXPECT_EQ(policies[1].name, "\xc0\x80");
  auto datastores = KarstLib::ListDatastoreInfo();
  ASSERT_EQ(datastores.size(), 2u);
  EXPECT_EQ(datastores[1].url, "\xed\xa0\x80");

  // Exported text imports into an empty store and exports identically.
  const auto hashBefore = KarstLib::GetDbHash();
  Ok({"reset"});
  EXPECT_EQ(Ok({"export"}), "{\n  \"policies\": [],\n  \"datastores\": []\n}\n");
  Ok({"import", "-"}, exported);
  EXPECT_EQ(Ok({"export"}), exported);
  EXPECT_EQ(KarstLib::GetDbHash(), hashBefore);
  unsetenv("TAVO_CONFIGSTORE_PATH");
}

TEST_F(ToolTest, SetAndListEachCatalogueOnItsOwn) {
  const std::string policies =
      "[\n"
      "  {\n"
      "    \"name\": \"silver\",\n"
      "    \"policy_id\": \"p2\",\n"
      "    \"description\": \"\",\n"
      "    \"generation_number\": 7,\n"
      "    \"blobs\": []\n"
      "  },\n"
      "  {\n"
      "    \"name\": \"bronze\",\n"
      "    \"policy_id\": \"p3\",\n"
      "    \"description\": \"cheap\",\n"
      "    \"generation_number\": 0,\n"
      "    \"blobs\": [\n"
      "      {\n"
      "        \"datastore_namespace\": \"CORRA\",\n"
      "        \"blob\": \"b\"\n"
      "      }\n"
      "    ]\n"
      "  }\n"
      "]\n";
  EXPECT_EQ(Ok({"policies", "set", "-"}, policies), "");
  EXPECT_EQ(Ok({"policies", "list"}), policies);  // store order, not sorted by name
  EXPECT_EQ(Ok({"datastores", "list"}), "[]\n");

  const std::string datastores = R"([{"url": "ds://z", "drp_policy_id": "p3"}, {"url": "ds://a"}])";
  Ok({"datastores", "set", File("ds.json", datastores)});
  EXPECT_EQ(Ok({"datastores", "list"}),
            "[\n  {\n    \"url\": \"ds://z\",\n    \"datastore_namespace\": \"\",\n"
            "    \"drp_policy_id\": \"p3\"\n  },\n  {\n    \"url\": \"ds://a\",\n"
            "    \"datastore_namespace\": \"\",\n    \"drp_policy_id\": \"\"\n  }\n]\n");
  EXPECT_EQ(Ok({"policies", "list"}), policies);  // untouched by datastores set

  // Set replaces the whole catalogue.
  Ok({"policies", "set", "-"}, R"([{"name": "gold"}])");
  EXPECT_THAT(Ok({"policies", "list"}), Not(HasSubstr("silver")));

  // Import replaces only the collections it holds.
  Ok({"import", "-"}, R"({"datastores": [{"url": "ds://new"}]})");
  EXPECT_THAT(Ok({"policies", "list"}), HasSubstr("\"gold\""));
  EXPECT_THAT(Ok({"datastores", "list"}), Not(HasSubstr("ds://z")));
  Ok({"import", "-"}, "{}");
  EXPECT_THAT(Ok({"datastores", "list"}), HasSubstr("ds://new"));
  Ok({"import", "-"}, R"({"policies": []})");
  EXPECT_EQ(Ok({"policies", "list"}), "[]\n");
  EXPECT_THAT(Ok({"datastores", "list"}), HasSubstr("ds://new"));
}

TEST_F(ToolTest, BlobLookupsWriteRawBytesOrNothing) {
  Ok({"import", "-"}, R"({
    "policies": [
      {"name": "gold", "policy_id": "p1",
       "blobs": [{"datastore_namespace": "CORRA", "blob": {"base64": "AAr/Cg=="}},
                 {"datastore_namespace": "NFS", "blob": "nfs-gold\n"}]},
      {"name": "second-p1", "policy_id": "p1",
       "blobs": [{"datastore_namespace": "CORRA", "blob": "never"}]},
      {"name": "silver", "policy_id": "p2",
       "blobs": [{"datastore_namespace": "VSAN", "blob": "vsan-silver"}]}
    ],
    "datastores": [
      {"url": "ds://nfs", "datastore_namespace": "NFS", "drp_policy_id": "p1"},
      {"url": "ds://vsan", "datastore_namespace": "VSAN", "drp_policy_id": "p2"},
      {"url": "ds://orphan", "datastore_namespace": "NFS", "drp_policy_id": "p9"}
    ]})");
  const std::string corra("\x00\n\xff\n", 4);
  EXPECT_EQ(Ok({"blob", "corra-by-id", "p1"}), corra);
  EXPECT_EQ(Ok({"blob", "corra-by-name", "gold"}), corra);
  EXPECT_EQ(Ok({"blob", "corra-by-name", "second-p1"}), "never");
  EXPECT_EQ(Ok({"blob", "by-id", "p1", "ds://nfs"}), "nfs-gold\n");
  EXPECT_EQ(Ok({"blob", "by-id", "p2", "ds://vsan"}), "vsan-silver");
  EXPECT_EQ(Ok({"blob", "default", "ds://nfs"}), "nfs-gold\n");
  EXPECT_EQ(Ok({"blob", "default", "ds://vsan"}), "vsan-silver");

  // Finding nothing is not an error.
  EXPECT_EQ(Ok({"blob", "corra-by-id", "p2"}), "");
  EXPECT_EQ(Ok({"blob", "corra-by-id", "nope"}), "");
  EXPECT_EQ(Ok({"blob", "corra-by-name", "silver"}), "");
  EXPECT_EQ(Ok({"blob", "by-id", "p2", "ds://nfs"}), "");
  EXPECT_EQ(Ok({"blob", "by-id", "p1", "ds://missing"}), "");
  EXPECT_EQ(Ok({"blob", "default", "ds://orphan"}), "");
  EXPECT_EQ(Ok({"blob", "default", ""}), "");
}

TEST_F(ToolTest, HashMatchesTheLibrary) {
  setenv("TAVO_CONFIGSTORE_PATH", store_.c_str(), 1);
  EXPECT_EQ(Ok({"hash"}), "{\n  \"policies\": \"\",\n  \"datastores\": \"\"\n}\n");
  Ok({"import", File("in.json", kAwkwardCatalogue)});
  const auto hash = KarstLib::GetDbHash();
  ASSERT_NE(hash.first, "");
  ASSERT_NE(hash.second, "");
  EXPECT_EQ(Ok({"hash"}), "{\n  \"policies\": \"" + hash.first + "\",\n  \"datastores\": \"" +
                              hash.second + "\"\n}\n");
  unsetenv("TAVO_CONFIGSTORE_PATH");
}

TEST_F(ToolTest, StoreComesFromTheOptionElseTheEnvironment) {
  const std::string other = scratch_ + "/other.db";
  const std::string catalogue = R"({"policies": [{"name": "env-only"}]})";
  auto run = [&](const std::vector<std::string>& args, const std::string& input = "") {
    return RunTool(scratch_, args, input, {{"TAVO_CONFIGSTORE_PATH", other}});
  };
  EXPECT_EQ(run({"import", "-"}, catalogue).status, 0);
  EXPECT_THAT(run({"policies", "list"}).out, HasSubstr("env-only"));
  // --store wins over the variable, in both spellings.
  EXPECT_EQ(run({"--store", store_, "policies", "list"}).out, "[]\n");
  EXPECT_EQ(run({"--store=" + store_, "policies", "list"}).out, "[]\n");
  EXPECT_THAT(Ok({"--store", other, "policies", "list"}), HasSubstr("env-only"));
}

TEST_F(ToolTest, HelpAndVersionNeedNoStore) {
  const ToolResult version = RunTool(scratch_, {"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_EQ(version.out, "karstctl 1.0.0\n");
  const ToolResult help = RunTool(scratch_, {"--store", scratch_, "--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_EQ(help.err, "");
  for (const char* command : {"reset", "policies set FILE|-", "policies list", "datastores set",
                              "datastores list", "import FILE|-", "export", "blob by-id",
                              "blob corra-by-id", "blob corra-by-name", "blob default", "hash"}) {
    EXPECT_THAT(help.out, HasSubstr("  " + std::string(command))) << command;
  }
}

}  // namespace
}  // namespace karstctl_test
