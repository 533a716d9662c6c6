// karstctl's failures: exit status, the one line on stderr, and a store that
// a rejected input leaves alone.
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ToolTest.h"

namespace karstctl_test {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

const char kGood[] = R"({
  "policies": [{"name": "gold", "policy_id": "p1",
                "blobs": [{"datastore_namespace": "CORRA", "blob": "g"}]}],
  "datastores": [{"url": "ds://1", "datastore_namespace": "CORRA", "drp_policy_id": "p1"}]
})";

class ErrorTest : public ToolTest {
 protected:
  void SetUp() override {
    ToolTest::SetUp();
    Ok({"import", "-"}, kGood);
    exported_ = Ok({"export"});
  }

  // No failure may have changed the store: export shows every byte of both
  // catalogues. Checked once per test, as every case in it fails.
  void TearDown() override {
    EXPECT_EQ(Ok({"export"}), exported_);
    ToolTest::TearDown();
  }

  // Runs a command that must fail with "status" and one error line
  // containing "message", printing nothing on stdout.
  void ExpectFailure(const std::vector<std::string>& args, const std::string& input, int status,
                     const std::string& message) {
    SCOPED_TRACE(input);
    ToolResult result = Run(args, input);
    EXPECT_EQ(result.status, status);
    EXPECT_TRUE(IsOneErrorLine(result.err));
    EXPECT_THAT(result.err, HasSubstr(message));
    EXPECT_EQ(result.out, "");
  }

  std::string exported_;
};

TEST_F(ErrorTest, MalformedJsonNamesTheSourceLineAndColumn) {
  const std::string bad = "{\n  \"policies\": [\n    {\"name\": \"x\",}\n  ]\n}\n";
  const std::string path = File("bad.json", bad);
  ExpectFailure({"import", path}, "", 2, "karstctl: " + path + ":3:18: ");
  ExpectFailure({"import", "-"}, bad, 2, "karstctl: <stdin>:3:18: ");
  ExpectFailure({"policies", "set", "-"}, "[{\"name\": \"a\"}", 2, "<stdin>:1:15: ");
  ExpectFailure({"datastores", "set", "-"}, "", 2, "<stdin>:1:1: ");
  ExpectFailure({"import", "-"}, "{\"policies\": [\"\xff\"]}", 2, "<stdin>:1:16: ");
  ExpectFailure({"import", "-"}, "{} {}", 2, "<stdin>:1:4: ");
  ExpectFailure({"import", "-"}, R"({"policies": [], "policies": []})", 2,
                "<stdin>: duplicate key \"policies\"");
}

TEST_F(ErrorTest, InvalidRecordsNameTheRecordAndField) {
  struct Case {
    std::vector<std::string> args;
    std::string input;
    std::string message;
  };
  const Case cases[] = {
      {{"import", "-"},
       R"({"policies": [{"name": "a"}, {"name": "b", "generation_number": 9223372036854775808}]})",
       "karstctl: <stdin>: policies[1].generation_number: out of the signed 64-bit range"},
      {{"import", "-"},
       R"({"policies": [{"generation_number": -9223372036854775809}]})",
       "policies[0].generation_number: out of the signed 64-bit range"},
      {{"policies", "set", "-"},
       R"([{"generation_number": 1.5}])",
       "policies[0].generation_number: expected an integer"},
      {{"policies", "set", "-"},
       R"([{"name": "a", "colour": "red"}])",
       "<stdin>: policies[0]: unknown key \"colour\""},
      {{"policies", "set", "-"},
       R"([{"name": 5}])",
       "policies[0].name: expected a string or {\"base64\": \"...\"}, got number"},
      {{"policies", "set", "-"},
       R"([{"blobs": [{"blob": {"base64": "AAA"}}]}])",
       "policies[0].blobs[0].blob.base64: invalid base64"},
      {{"policies", "set", "-"},
       R"([{"blobs": [{"blob": {"base64": "AB=="}}]}])",
       "policies[0].blobs[0].blob.base64: invalid base64"},
      {{"policies", "set", "-"}, R"({"policies": []})", "policies: expected array, got object"},
      {{"datastores", "set", "-"},
       R"([{"url": "u", "drp_policy_id": ["p"]}])",
       "datastores[0].drp_policy_id: expected a string"},
      {{"import", "-"}, R"([])", "<stdin>: top level: expected object, got array"},
      {{"import", "-"},
       R"({"policies": [], "pollicies": []})",
       "top level: unknown key \"pollicies\""},
      {{"import", "-"}, R"({"datastores": {"url": "u"}})", "datastores: expected array"},
      // Good policies do not go in when the datastores beside them are bad.
      {{"import", "-"},
       R"({"policies": [{"name": "new"}], "datastores": [{"url": 1}]})",
       "datastores[0].url: expected a string"},
  };
  const std::string hash = Ok({"hash"});
  for (const Case& c : cases) ExpectFailure(c.args, c.input, 2, c.message);
  EXPECT_EQ(Ok({"hash"}), hash);

  const std::string path = File("gen.json", R"([{"name": "a"}, {"generation_number": 1e30}])");
  ExpectFailure({"policies", "set", path}, "", 2,
                "karstctl: " + path + ": policies[1].generation_number: out of the signed");
}

TEST_F(ErrorTest, UsageErrorsExitTwo) {
  ExpectFailure({"frobnicate"}, "", 2, "unknown command 'frobnicate'");
  ExpectFailure({"policies", "delete"}, "", 2, "unknown command 'policies delete'");
  ExpectFailure({"blob", "by-id", "p1"}, "", 2, "'blob by-id' needs POLICY_ID URL");
  ExpectFailure({"blob", "default"}, "", 2, "'blob default' needs URL");
  ExpectFailure({"policies", "set"}, "", 2, "'policies set' needs FILE|-");
  ExpectFailure({"hash", "now"}, "", 2, "too many arguments for 'hash'");
  ExpectFailure({"--colour", "hash"}, "", 2, "unknown option '--colour'");
  ExpectFailure({"import", scratch_ + "/missing.json"}, "", 2,
                "cannot open " + scratch_ + "/missing.json: No such file or directory");
  ExpectFailure({"import", scratch_}, "", 2, "cannot read " + scratch_);

  for (const std::vector<std::string>& args :
       std::vector<std::vector<std::string>>{{}, {"--store"}, {"--store", store_}}) {
    ToolResult result = RunTool(scratch_, args);
    EXPECT_EQ(result.status, 2);
    EXPECT_TRUE(IsOneErrorLine(result.err));
    EXPECT_EQ(result.out, "");
  }
}

TEST_F(ToolTest, StoreErrorsExitOneWithTheCodeAndMessage) {
  const std::string garbage = File("garbage.db", std::string(8192, 'G'));
  for (const std::string& store : {scratch_, garbage}) {
    for (const std::vector<std::string>& command :
         std::vector<std::vector<std::string>>{{"export"}, {"hash"}, {"reset"}}) {
      std::vector<std::string> args = {"--store", store};
      args.insert(args.end(), command.begin(), command.end());
      ToolResult result = RunTool(scratch_, args);
      EXPECT_EQ(result.status, 1) << store << " " << command[0];
      EXPECT_TRUE(IsOneErrorLine(result.err));
      EXPECT_THAT(result.err, StartsWith("karstctl: store error "));
      EXPECT_EQ(result.out, "");
    }
  }
  EXPECT_EQ(ReadFile(garbage), std::string(8192, 'G'));

  // Input is checked before the store: a bad file against a bad store is an
  // input error.
  ToolResult both = RunTool(scratch_, {"--store", garbage, "import", "-"}, "[");
  EXPECT_EQ(both.status, 2);
  EXPECT_THAT(both.err, HasSubstr("<stdin>:1:2"));
}

TEST_F(ToolTest, OutputThatCannotBeWrittenIsAFailure) {
  Ok({"import", "-"}, kGood);
  for (const std::vector<std::string>& command : std::vector<std::vector<std::string>>{
           {"export"}, {"blob", "corra-by-id", "p1"}, {"hash"}, {"--help"}}) {
    std::vector<std::string> args = {"--store", store_};
    args.insert(args.end(), command.begin(), command.end());
    ToolResult result = RunTool(scratch_, args, "", {}, "/dev/full");
    EXPECT_EQ(result.status, 1) << command[0];
    EXPECT_TRUE(IsOneErrorLine(result.err));
    EXPECT_THAT(result.err, HasSubstr("cannot write standard output"));
  }
}

}  // namespace
}  // namespace karstctl_test
