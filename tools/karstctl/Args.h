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
  kCheck,
  kBlobById,
  kBlobCorraById,
  kBlobCorraByName,
  kBlobDefault,
  kHash,
  kWatch,
};

// What a command needs of the store: a read fails when there is no store
// (so a mistyped path is not an empty catalogue), a write creates it, and a
// watch waits for it to appear without making it.
enum class StoreUse { kNone, kRead, kWrite, kWatch };

// One line of the command table: the words that select the command, the
// operands it takes, and what it does (for --help).
struct CommandEntry {
  Command command;
  std::vector<std::string> words;
  std::vector<std::string> operands;
  std::string summary;
  StoreUse store;
};

const std::vector<CommandEntry>& CommandTable();

struct Invocation {
  Command command = Command::kHelp;
  std::optional<std::string> store;   // --store PATH
  std::optional<int> waitMs;          // --wait SECONDS
  std::vector<std::string> operands;  // in the order CommandEntry lists them
  // For kHelp: the commands asked about ("blob --help" names all blob
  // commands); empty for the general help.
  std::vector<const CommandEntry*> helpTopics;
};

// Parses the arguments after the program name. Options may come anywhere;
// "--" ends them. Throws UsageError.
Invocation ParseArgs(const std::vector<std::string>& args);

}  // namespace karstctl

#endif  // KARSTCTL_ARGS_H_
