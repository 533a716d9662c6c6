#include "Args.h"

#include <cstddef>

#include "Errors.h"

namespace karstctl {

namespace {

constexpr char kSeeHelp[] = " (see karstctl --help)";

std::string Join(const std::vector<std::string>& words) {
  std::string out;
  for (const auto& word : words) out += (out.empty() ? "" : " ") + word;
  return out;
}

bool StartsWith(const std::vector<std::string>& args, std::size_t at,
                const std::vector<std::string>& words) {
  if (args.size() - at < words.size()) return false;
  for (std::size_t i = 0; i < words.size(); ++i) {
    if (args[at + i] != words[i]) return false;
  }
  return true;
}

}  // namespace

const std::vector<CommandSpec>& CommandTable() {
  static const std::vector<CommandSpec> table = {
      {Command::kReset, {"reset"}, {}, "clear both catalogues"},
      {Command::kPoliciesSet,
       {"policies", "set"},
       {"FILE|-"},
       "replace the policy catalogue with a JSON array of policies"},
      {Command::kPoliciesList,
       {"policies", "list"},
       {},
       "print the policy catalogue as a JSON array"},
      {Command::kDatastoresSet,
       {"datastores", "set"},
       {"FILE|-"},
       "replace the datastore catalogue with a JSON array of datastores"},
      {Command::kDatastoresList,
       {"datastores", "list"},
       {},
       "print the datastore catalogue as a JSON array"},
      {Command::kImport,
       {"import"},
       {"FILE|-"},
       "replace each catalogue present in {\"policies\": [...], \"datastores\": [...]}"},
      {Command::kExport, {"export"}, {}, "print {\"policies\": [...], \"datastores\": [...]}"},
      {Command::kBlobById,
       {"blob", "by-id"},
       {"POLICY_ID", "URL"},
       "blob of the first policy POLICY_ID for datastore URL's namespace"},
      {Command::kBlobCorraById,
       {"blob", "corra-by-id"},
       {"POLICY_ID"},
       "CORRA blob of the first policy POLICY_ID"},
      {Command::kBlobCorraByName,
       {"blob", "corra-by-name"},
       {"NAME"},
       "CORRA blob of the policy named NAME"},
      {Command::kBlobDefault,
       {"blob", "default"},
       {"URL"},
       "blob of datastore URL's default policy for its namespace"},
      {Command::kHash,
       {"hash"},
       {},
       "print {\"policies\": \"<crc32>\", \"datastores\": \"<crc32>\"}"},
  };
  return table;
}

Invocation ParseArgs(const std::vector<std::string>& args) {
  Invocation invocation;
  std::size_t at = 0;
  // Options come before the command.
  for (; at < args.size() && args[at].compare(0, 1, "-") == 0 && args[at] != "-"; ++at) {
    const std::string& arg = args[at];
    if (arg == "--help" || arg == "-h") {
      invocation.command = Command::kHelp;
      return invocation;
    }
    if (arg == "--version") {
      invocation.command = Command::kVersion;
      return invocation;
    }
    std::string path;
    if (arg == "--store") {
      if (++at == args.size()) throw UsageError(std::string("--store needs a PATH") + kSeeHelp);
      path = args[at];
    } else if (arg.compare(0, 8, "--store=") == 0) {
      path = arg.substr(8);
    } else {
      throw UsageError("unknown option '" + arg + "'" + kSeeHelp);
    }
    if (path.empty()) throw UsageError("--store needs a non-empty PATH");
    invocation.store = path;
  }
  if (at == args.size()) throw UsageError(std::string("missing command") + kSeeHelp);

  const CommandSpec* match = nullptr;
  for (const auto& spec : CommandTable()) {
    if (StartsWith(args, at, spec.words)) {
      match = &spec;
      break;
    }
  }
  if (match == nullptr) {
    std::string command = args[at];
    if ((command == "policies" || command == "datastores" || command == "blob") &&
        at + 1 < args.size()) {
      command += " " + args[at + 1];
    }
    throw UsageError("unknown command '" + command + "'" + kSeeHelp);
  }
  at += match->words.size();
  const std::string name = Join(match->words);
  const std::size_t given = args.size() - at;
  if (given < match->operands.size()) {
    throw UsageError("'" + name + "' needs " + Join(match->operands) + kSeeHelp);
  }
  if (given > match->operands.size()) {
    throw UsageError("too many arguments for '" + name + "'" + kSeeHelp);
  }
  invocation.command = match->command;
  invocation.operands.assign(args.begin() + static_cast<std::ptrdiff_t>(at), args.end());
  return invocation;
}

}  // namespace karstctl
