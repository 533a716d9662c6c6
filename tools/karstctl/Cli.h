#ifndef KARSTCTL_CLI_H_
#define KARSTCTL_CLI_H_

#include <string>
#include <vector>

namespace karstctl {

// The whole tool, main's only call: parses "args" (without the program
// name), answers --help and --version or runs the command the table names,
// reports any failure as one line on standard error and returns the exit
// status: 0 success, 1 store or other failure, 2 usage or input.
int RunKarstctl(const std::vector<std::string>& args);

}  // namespace karstctl

#endif  // KARSTCTL_CLI_H_
