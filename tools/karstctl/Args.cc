#include "Args.h"

#include <algorithm>
#include <climits>
#include <cmath>
#include <cstddef>
#include <cstdlib>

#include "Errors.h"

namespace karstctl {

namespace {

constexpr char kSeeHelp[] = " (see karstctl --help)";

std::string Join(const std::vector<std::string>& words, const std::string& separator = " ") {
  std::string out;
  for (const auto& word : words) out += (out.empty() ? "" : separator) + word;
  return out;
}

bool StartsWith(const std::vector<std::string>& args, const std::vector<std::string>& words) {
  if (args.size() < words.size()) return false;
  for (std::size_t i = 0; i < words.size(); ++i) {
    if (args[i] != words[i]) return false;
  }
  return true;
}

// Digits with at most one '.', so "inf", "nan", "1e3" and "0x10" are refused
// rather than read in some surprising way.
int ParseWaitMs(const std::string& text) {
  const bool valid = text.find_first_not_of("0123456789.") == std::string::npos &&
                     std::count(text.begin(), text.end(), '.') <= 1 && text != "." && !text.empty();
  if (!valid) {
    throw UsageError("--wait needs a non-negative number of SECONDS, not '" + text + "'");
  }
  const double ms = std::strtod(text.c_str(), nullptr) * 1000;
  return ms >= INT_MAX ? INT_MAX : static_cast<int>(std::lround(ms));
}

// The value of "--name VALUE" or "--name=VALUE" at args[at], or nullopt when
// args[at] is not that option. Advances "at" past a separate value.
std::optional<std::string> OptionValue(const std::vector<std::string>& args, std::size_t& at,
                                       const std::string& name, const std::string& what) {
  const std::string& arg = args[at];
  if (arg.compare(0, name.size() + 1, name + "=") == 0) return arg.substr(name.size() + 1);
  if (arg != name) return std::nullopt;
  if (++at == args.size()) throw UsageError(name + " needs " + what + kSeeHelp);
  return args[at];
}

// A whole number, negative ones included: an operand, such as a version
// given as "-1", that the command itself then names as wrong, rather than
// an unknown option.
bool IsNumber(const std::string& arg) {
  const std::size_t digits = arg.compare(0, 1, "-") == 0 ? 1 : 0;
  return arg.size() > digits && arg.find_first_not_of("0123456789", digits) == std::string::npos;
}

// The group word ("blob") of commands named by two words.
bool IsGroup(const std::string& word) {
  for (const auto& entry : CommandTable()) {
    if (entry.words.size() > 1 && entry.words[0] == word) return true;
  }
  return false;
}

std::vector<const CommandEntry*> EntriesStartingWith(const std::vector<std::string>& words) {
  std::vector<const CommandEntry*> entries;
  for (const auto& entry : CommandTable()) {
    if (StartsWith(entry.words, words)) entries.push_back(&entry);
  }
  return entries;
}

const CommandEntry& MatchCommand(const std::vector<std::string>& words) {
  if (words.empty()) throw UsageError(std::string("missing command") + kSeeHelp);
  for (const auto& entry : CommandTable()) {
    if (StartsWith(words, entry.words)) return entry;
  }
  if (IsGroup(words[0]) && words.size() == 1) {
    std::vector<std::string> subcommands;
    for (const CommandEntry* entry : EntriesStartingWith({words[0]})) {
      subcommands.push_back(entry->words[1]);
    }
    throw UsageError("missing subcommand: " + words[0] + " needs one of " +
                     Join(subcommands, ", "));
  }
  const std::string command = IsGroup(words[0]) ? words[0] + " " + words[1] : words[0];
  throw UsageError("unknown command '" + command + "'" + kSeeHelp);
}

OutputForm ParseOutputForm(const std::string& text) {
  if (text == "pretty") return OutputForm::kPretty;
  if (text == "json") return OutputForm::kJson;
  if (text == "lines") return OutputForm::kLines;
  throw UsageError("--output needs pretty, json or lines, not '" + text + "'");
}

// Options that only some commands take are refused by the others, so that a
// mistaken one is not silently ignored.
void RequireTakes(const CommandEntry& command, const std::vector<std::string>& given) {
  for (const auto& option : given) {
    if (std::find(command.options.begin(), command.options.end(), option) ==
        command.options.end()) {
      throw UsageError("'" + Join(command.words) + "' takes no " + option + kSeeHelp);
    }
  }
}

}  // namespace

const std::vector<OptionEntry>& OptionTable() {
  static const std::vector<OptionEntry> table = {
      {"--store", "PATH", "the store file or etcd locator; by default $TAVO_CONFIGSTORE_PATH"},
      {"--wait", "SECONDS", "how long to wait for another writer's lock or an etcd request"},
      {"--output", "FORM", "pretty, json (one line) or lines (a record a line); json: errors too"},
      {"--quiet", "", "print warnings as one line of counts per kind"},
      {"--strict", "", "exit 2 at any warning, before the store is written"},
      {"--require", "", "exit 3 when the look-up finds no blob"},
  };
  return table;
}

bool AsksForJsonErrors(const std::vector<std::string>& args) {
  for (std::size_t at = 0; at < args.size() && args[at] != "--"; ++at) {
    if (args[at] == "--output=json" ||
        (args[at] == "--output" && at + 1 < args.size() && args[at + 1] == "json")) {
      return true;
    }
  }
  return false;
}

Invocation ParseArgs(const std::vector<std::string>& args) {
  Invocation invocation;
  std::vector<std::string> words;  // the command and its operands
  bool help = false, version = false, optionsEnded = false;
  std::vector<std::string> commandOptions;  // those only some commands take
  for (std::size_t at = 0; at < args.size(); ++at) {
    const std::string& arg = args[at];
    if (optionsEnded || arg == "-" || arg.compare(0, 1, "-") != 0 || IsNumber(arg)) {
      words.push_back(arg);
    } else if (arg == "--") {
      optionsEnded = true;
    } else if (arg == "--help" || arg == "-h") {
      help = true;
    } else if (arg.compare(0, 10, "--version=") == 0) {
      invocation.kept = arg.substr(10);
    } else if (arg == "--version") {
      // Followed by a number, a kept version to read; alone, this tool's.
      if (at + 1 < args.size() && IsNumber(args[at + 1])) {
        invocation.kept = args[++at];
      } else {
        version = true;
      }
    } else if (auto path = OptionValue(args, at, "--store", "a PATH")) {
      if (path->empty()) throw UsageError("--store needs a non-empty PATH");
      invocation.store = *path;
    } else if (auto seconds = OptionValue(args, at, "--wait", "SECONDS")) {
      invocation.waitMs = ParseWaitMs(*seconds);
    } else if (auto form = OptionValue(args, at, "--output", "a FORM")) {
      invocation.output = ParseOutputForm(*form);
    } else if (arg == "--quiet" || arg == "--strict" || arg == "--require") {
      (arg == "--quiet"    ? invocation.quiet
       : arg == "--strict" ? invocation.strict
                           : invocation.require) = true;
      commandOptions.push_back(arg);
    } else {
      throw UsageError("unknown option '" + arg + "'" + kSeeHelp);
    }
  }
  if (version && !help) {
    invocation.version = true;
    return invocation;
  }
  if (help) {
    if (words.empty()) return invocation;
    // A group word alone asks about the whole group.
    invocation.helpTopics = EntriesStartingWith({words[0]});
    if (words.size() == 1 && IsGroup(words[0])) return invocation;
    invocation.helpTopics = {&MatchCommand(words)};
    return invocation;
  }

  const CommandEntry& match = MatchCommand(words);
  const std::string name = Join(match.words);
  const std::size_t given = words.size() - match.words.size();
  if (given < match.operands.size()) {
    throw UsageError("'" + name + "' needs " + Join(match.operands) + kSeeHelp);
  }
  if (given > match.operands.size()) {
    throw UsageError("too many arguments for '" + name + "'" + kSeeHelp);
  }
  RequireTakes(match, commandOptions);
  invocation.command = &match;
  invocation.operands.assign(words.begin() + static_cast<std::ptrdiff_t>(match.words.size()),
                             words.end());
  return invocation;
}

}  // namespace karstctl
