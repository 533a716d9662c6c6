#ifndef KARSTCTL_TEST_TOOL_TEST_H_
#define KARSTCTL_TEST_TOOL_TEST_H_

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "RunTool.h"

namespace karstctl_test {

// Each test gets its own scratch directory and an empty store in it.
class ToolTest : public ::testing::Test {
 protected:
  void SetUp() override {
    scratch_ = MakeScratchDir();
    store_ = scratch_ + "/store.db";
  }
  void TearDown() override { RemoveTree(scratch_); }

  // karstctl --store <this test's store> args...
  ToolResult Run(const std::vector<std::string>& args, const std::string& input = "") {
    std::vector<std::string> all = {"--store", store_};
    all.insert(all.end(), args.begin(), args.end());
    return RunTool(scratch_, all, input);
  }

  // Runs a command that must succeed quietly and returns its output.
  std::string Ok(const std::vector<std::string>& args, const std::string& input = "") {
    ToolResult result = Run(args, input);
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, "");
    return result.out;
  }

  std::string File(const std::string& name, const std::string& bytes) {
    std::string path = scratch_ + "/" + name;
    WriteFile(path, bytes);
    return path;
  }

  std::string scratch_;
  std::string store_;
};

// An error is reported as exactly one line starting with "karstctl: ".
inline ::testing::AssertionResult IsOneErrorLine(const std::string& err) {
  if (err.rfind("karstctl: ", 0) != 0 || err.empty() || err.back() != '\n' ||
      err.find('\n') != err.size() - 1) {
    return ::testing::AssertionFailure() << "not one karstctl error line: " << err;
  }
  return ::testing::AssertionSuccess();
}

}  // namespace karstctl_test

#endif  // KARSTCTL_TEST_TOOL_TEST_H_
