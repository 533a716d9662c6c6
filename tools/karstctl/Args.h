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
struct Invocation;

// How records and digests are printed (--output): "pretty" indented JSON,
// "json" one compact document, "lines" one compact JSON value per line (each
// element of a list on a line of its own).
enum class OutputForm { kPretty, kJson, kLines };

// One line of the command table: the words that select the command, the
// operands it takes, what it does (for --help), what it needs of the store,
// the options it takes beyond --store, --wait, --output and --help, an example for its
// --help, and the function that carries it out. That function reads and
// checks its input first and then opens the store through "store", which
// knows the command's StoreUse. It returns the exit status, or throws
// InputError, NotFoundError, the store's ConfigStoreException, or
// std::runtime_error (no store to read, output that cannot be written).
struct CommandEntry {
  std::vector<std::string> words;
  std::vector<std::string> operands;
  std::string summary;
  StoreUse store;
  std::vector<std::string> options;
  std::string example;
  int (*run)(const Invocation& invocation, StoreSession& store);
  // The exit status of any failure; diff keeps 1 for "there are changes".
  int failureStatus = 1;
};

const std::vector<CommandEntry>& CommandTable();

// The options a command may take, each with its value's name ("" for none)
// and what it does, in the order --help lists them.
struct OptionEntry {
  std::string name;
  std::string value;
  std::string summary;
};
const std::vector<OptionEntry>& OptionTable();

// What the command line asks for: a command of the table, or else the
// version or help.
struct Invocation {
  const CommandEntry* command = nullptr;
  bool version = false;               // --version (without --help)
  std::optional<std::string> store;   // --store PATH
  std::optional<int> waitMs;          // --wait SECONDS
  std::optional<OutputForm> output;   // --output FORM; each command has its default
  bool quiet = false;                 // --quiet: warnings as one summary line
  bool strict = false;                // --strict: any warning fails before a write
  bool require = false;               // --require: a blob found nowhere exits 3
  std::optional<std::string> kept;    // --version N: read kept version N
  std::vector<std::string> operands;  // in the order CommandEntry lists them
  // For help: the commands asked about ("blob --help" names all blob
  // commands); empty for the general help.
  std::vector<const CommandEntry*> helpTopics;
};

// Parses the arguments after the program name. Options may come anywhere;
// "--" ends them. Throws UsageError.
Invocation ParseArgs(const std::vector<std::string>& args);

// Whether the arguments ask for --output json, read without parsing the
// rest, so that even a usage error is reported in that form.
bool AsksForJsonErrors(const std::vector<std::string>& args);

}  // namespace karstctl

#endif  // KARSTCTL_ARGS_H_
