#include "RunTool.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>

#ifndef KARSTCTL_BINARY
#error "KARSTCTL_BINARY must name the built karstctl"
#endif

extern char** environ;

namespace karstctl_test {

std::string MakeScratchDir() {
  const char* tmp = std::getenv("TMPDIR");
  std::string pattern =
      std::string(tmp != nullptr && *tmp != '\0' ? tmp : "/tmp") + "/karstctl-test-XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
  return pattern;
}

void RemoveTree(const std::string& path) {
  std::error_code ignored;
  std::filesystem::remove_all(path, ignored);
}

ToolResult RunTool(const std::string& scratch, const std::vector<std::string>& args,
                   const std::string& input, const EnvChanges& env, const std::string& stdoutPath) {
  // Files rather than pipes: nothing can block however much either side
  // writes.
  const std::string inPath = scratch + "/stdin", errPath = scratch + "/stderr";
  const std::string outPath = stdoutPath.empty() ? scratch + "/stdout" : stdoutPath;
  WriteFile(inPath, input);
  std::vector<std::string> argvStrings = {KARSTCTL_BINARY};
  argvStrings.insert(argvStrings.end(), args.begin(), args.end());
  std::vector<char*> argv;
  argv.reserve(argvStrings.size() + 1);
  for (auto& arg : argvStrings) argv.push_back(arg.data());
  argv.push_back(nullptr);

  // This process's environment with the changes applied.
  std::vector<std::string> envStrings;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    const std::string text = *entry;
    const std::string name = text.substr(0, text.find('='));
    bool changed = false;
    for (const auto& change : env) changed = changed || change.first == name;
    if (!changed) envStrings.push_back(text);
  }
  for (const auto& [name, value] : env) {
    if (value) envStrings.push_back(name + "=" + *value);
  }
  std::vector<char*> envp;
  envp.reserve(envStrings.size() + 1);
  for (auto& entry : envStrings) envp.push_back(entry.data());
  envp.push_back(nullptr);

  // posix_spawn rather than fork: forking a sanitized test process is slow.
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, inPath.c_str(), O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 1, outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                   0600);
  posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                   0600);
  pid_t pid = 0;
  const int spawned = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  if (spawned != 0) throw std::runtime_error("cannot run " + argvStrings[0]);

  int wstatus = 0;
  if (waitpid(pid, &wstatus, 0) != pid) throw std::runtime_error("waitpid failed");
  ToolResult result;
  result.status = WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : 128 + WTERMSIG(wstatus);
  if (stdoutPath.empty()) result.out = ReadFile(outPath);
  result.err = ReadFile(errPath);
  return result;
}

}  // namespace karstctl_test
