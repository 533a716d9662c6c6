#ifndef KARSTCTL_ARGS_H_
#define KARSTCTL_ARGS_H_

#include <optional>
#include <string>
#include <vector>

namespace karstctl {

enum class Command {
  kHelp,
  kVersion,
  kReset,
  kPoliciesSet,
  kPoliciesList,
  kDatastoresSet,
  kDatastoresList,
  kImport,
  kExport,
  kBlobById,
  kBlobCorraById,
  kBlobCorraByName,
  kBlobDefault,
  kHash,
};

// One line of the command table: the words that select the command, the
// operands it takes, and what it does (for --help).
struct CommandSpec {
  Command command;
  std::vector<std::string> words;
  std::vector<std::string> operands;
  std::string summary;
};

const std::vector<CommandSpec>& CommandTable();

struct Invocation {
  Command command = Command::kHelp;
  std::optional<std::string> store;   // --store PATH
  std::vector<std::string> operands;  // in the order CommandSpec lists them
};

// Parses the arguments after the program name. Throws UsageError.
Invocation ParseArgs(const std::vector<std::string>& args);

}  // namespace karstctl

#endif  // KARSTCTL_ARGS_H_
