#ifndef KARSTCTL_ARGS_H_
#define KARSTCTL_ARGS_H_

#include <optional>
#include <string>
#include <vector>

namespace karstctl {

// What a command needs of the store: a read fails when there is no store
// (so a mistyped path is not an empty catalogue), a write creates it, and a
// watch waits for it to appear without making it.
enum class StoreUse { kNone, kRead, kWrite, kWatch };

class StoreSession;

// One line of the command table: the words that select the command, the
// operands it takes, what it does (for --help), what it needs of the store,
// and the function that carries it out. That function reads and checks its
// input first and then opens the store through "store", which knows the
// command's StoreUse; it throws InputError, the store's
// ConfigStoreException, or std::runtime_error (no store to read, output
// that cannot be written).
struct CommandEntry {
  std::vector<std::string> words;
  std::vector<std::string> operands;
  std::string summary;
  StoreUse store;
  void (*run)(const std::vector<std::string>& operands, StoreSession& store);
};

const std::vector<CommandEntry>& CommandTable();

// What the command line asks for: a command of the table, or else the
// version or help.
struct Invocation {
  const CommandEntry* command = nullptr;
  bool version = false;               // --version (without --help)
  std::optional<std::string> store;   // --store PATH
  std::optional<int> waitMs;          // --wait SECONDS
  std::optional<std::string> kept;    // --version N: read kept version N
  std::vector<std::string> operands;  // in the order CommandEntry lists them
  // For help: the commands asked about ("blob --help" names all blob
  // commands); empty for the general help.
  std::vector<const CommandEntry*> helpTopics;
};

// Parses the arguments after the program name. Options may come anywhere;
// "--" ends them. Throws UsageError.
Invocation ParseArgs(const std::vector<std::string>& args);

}  // namespace karstctl

#endif  // KARSTCTL_ARGS_H_
