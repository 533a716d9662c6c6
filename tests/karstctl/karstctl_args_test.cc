#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Args.h"
#include "Errors.h"
#include "Help.h"

namespace karstctl {
namespace {

using ::testing::HasSubstr;

std::string UsageMessage(const std::vector<std::string>& args) {
  try {
    ParseArgs(args);
  } catch (const UsageError& e) {
    return e.what();
  }
  return "<accepted>";
}

TEST(Args, SelectsTheCommandAndItsOperands) {
  Invocation blob = ParseArgs({"--store", "a.db", "blob", "by-id", "p1", "ds://x"});
  EXPECT_EQ(blob.command, Command::kBlobById);
  EXPECT_EQ(blob.store, "a.db");
  EXPECT_EQ(blob.operands, (std::vector<std::string>{"p1", "ds://x"}));

  Invocation stdinSet = ParseArgs({"--store=b.db", "policies", "set", "-"});
  EXPECT_EQ(stdinSet.command, Command::kPoliciesSet);
  EXPECT_EQ(stdinSet.store, "b.db");
  EXPECT_EQ(stdinSet.operands, std::vector<std::string>{"-"});

  // Operands are taken as they are, even when they look like options.
  Invocation byName = ParseArgs({"blob", "corra-by-name", "--store"});
  EXPECT_EQ(byName.command, Command::kBlobCorraByName);
  EXPECT_EQ(byName.store, std::nullopt);
  EXPECT_EQ(byName.operands, std::vector<std::string>{"--store"});

  EXPECT_EQ(ParseArgs({"datastores", "list"}).command, Command::kDatastoresList);
  EXPECT_EQ(ParseArgs({"--store", "x", "--help"}).command, Command::kHelp);
  EXPECT_EQ(ParseArgs({"--version", "bogus"}).command, Command::kVersion);
}

TEST(Args, RejectsBadCommandLinesWithAUsefulMessage) {
  EXPECT_THAT(UsageMessage({}), HasSubstr("missing command"));
  EXPECT_THAT(UsageMessage({"--store", "x"}), HasSubstr("missing command"));
  EXPECT_THAT(UsageMessage({"--store"}), HasSubstr("--store needs a PATH"));
  EXPECT_THAT(UsageMessage({"--store", "", "hash"}), HasSubstr("non-empty"));
  EXPECT_THAT(UsageMessage({"--store=", "hash"}), HasSubstr("non-empty"));
  EXPECT_THAT(UsageMessage({"--verbose", "hash"}), HasSubstr("unknown option '--verbose'"));
  EXPECT_THAT(UsageMessage({"frobnicate"}), HasSubstr("unknown command 'frobnicate'"));
  EXPECT_THAT(UsageMessage({"policies", "drop"}), HasSubstr("unknown command 'policies drop'"));
  EXPECT_THAT(UsageMessage({"policies"}), HasSubstr("unknown command 'policies'"));
  EXPECT_THAT(UsageMessage({"blob", "by-id", "p1"}), HasSubstr("'blob by-id' needs POLICY_ID URL"));
  EXPECT_THAT(UsageMessage({"import"}), HasSubstr("'import' needs FILE|-"));
  EXPECT_THAT(UsageMessage({"hash", "extra"}), HasSubstr("too many arguments for 'hash'"));
  EXPECT_THAT(UsageMessage({"hash", "--store", "x"}), HasSubstr("too many arguments"));
}

TEST(Args, HelpListsEveryCommandOnOneAlignedLine) {
  const std::string help = HelpText();
  std::string::size_type column = std::string::npos;
  for (const auto& spec : CommandTable()) {
    std::string synopsis;
    for (const auto& word : spec.words) synopsis += (synopsis.empty() ? "" : " ") + word;
    for (const auto& operand : spec.operands) synopsis += " " + operand;
    const std::string::size_type at = help.find("\n  " + synopsis + " ");
    ASSERT_NE(at, std::string::npos) << synopsis;
    const std::string::size_type end = help.find('\n', at + 1);
    const std::string line = help.substr(at + 1, end - at - 1);
    EXPECT_THAT(line, ::testing::EndsWith(spec.summary));
    const auto summaryColumn = line.size() - spec.summary.size();
    if (column == std::string::npos) column = summaryColumn;
    EXPECT_EQ(summaryColumn, column) << line;
  }
  EXPECT_THAT(help, HasSubstr("\"generation_number\""));
  EXPECT_THAT(help, HasSubstr("\"drp_policy_id\""));
  EXPECT_THAT(help, HasSubstr("Exit status"));
  EXPECT_EQ(VersionText(), "karstctl 1.0.0\n");
}

}  // namespace
}  // namespace karstctl
