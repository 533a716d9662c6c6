#ifndef KARSTCTL_TEST_RUN_TOOL_H_
#define KARSTCTL_TEST_RUN_TOOL_H_

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "FileBytes.h"

namespace karstctl_test {

struct ToolResult {
  int status = -1;  // exit status; 128 + signal number when killed
  std::string out;
  std::string err;
};

// Changes to the child's environment: a value sets the variable, nullopt
// removes it.
using EnvChanges = std::vector<std::pair<std::string, std::optional<std::string>>>;

// Runs the built karstctl with "args", feeding "input" on standard input,
// and collects everything it writes. "scratch" is a directory for the
// captured streams. A non-empty "stdoutPath" sends standard output there
// instead of capturing it.
ToolResult RunTool(const std::string& scratch, const std::vector<std::string>& args,
                   const std::string& input = "", const EnvChanges& env = {},
                   const std::string& stdoutPath = "");

// A fresh directory under $TMPDIR (or /tmp), and its removal.
std::string MakeScratchDir();
void RemoveTree(const std::string& path);

using testfiles::ReadFile;
using testfiles::WriteFile;

}  // namespace karstctl_test

#endif  // KARSTCTL_TEST_RUN_TOOL_H_
