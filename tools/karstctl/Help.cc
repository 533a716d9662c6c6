#include "Help.h"

#include <algorithm>

#include "Args.h"

#ifndef KARSTCTL_VERSION
#error "KARSTCTL_VERSION must be defined by the build"
#endif

namespace karstctl {

namespace {

std::string Synopsis(const CommandEntry& entry) {
  std::string out;
  for (const auto& word : entry.words) out += (out.empty() ? "" : " ") + word;
  for (const auto& operand : entry.operands) out += " " + operand;
  return out;
}

}  // namespace

std::string HelpText() {
  std::size_t width = 0;
  for (const auto& entry : CommandTable()) width = std::max(width, Synopsis(entry).size());
  auto line = [width](std::string left, const std::string& right) {
    left.resize(std::max(width + 2, left.size()), ' ');
    return "  " + left + right + "\n";
  };

  std::string out =
      "Usage: karstctl [--store PATH] [--wait SECONDS] [--output FORM] COMMAND [ARGS]\n"
      "       karstctl COMMAND --help\n"
      "\n"
      "Reads and replaces the storage policy and datastore catalogues.\n"
      "\n"
      "Commands:\n";
  for (const auto& entry : CommandTable()) out += line(Synopsis(entry), entry.summary);
  out += "\nOptions:\n";
  out += line("--store PATH", "the store file or etcd locator (see below); by default");
  out += line("", "$TAVO_CONFIGSTORE_PATH, else $XDG_STATE_HOME/tavo/configstore.db,");
  out += line("", "else ~/.local/state/tavo/configstore.db");
  out += line("--wait SECONDS", "how long to wait for another process's write lock");
  out += line("", "(default 10, fractions allowed), or for each etcd request");
  out += line("", "(default the locator's timeout, else 5)");
  out += line("--output FORM", "pretty (indented JSON, the default), json (one document on one");
  out += line("", "line) or lines (each record of a list on a line of its own), for");
  out += line("", "what a command prints (watch's default is lines; diff's and");
  out += line("", "status's is text); with json an error is one JSON object on stderr");
  out += line("--quiet", "writes, check and diff: warnings as one line of counts per kind");
  out += line("--strict", "writes, check and diff: any warning exits 2, the store unwritten");
  out += line("--require", "blob commands: exit 3 when the look-up finds no blob");
  out += line("--help", "print this help, or with a COMMAND that command's options");
  out += line("--version", "print the version");
  out += line("--version N", "with a command that reads: read kept version N (see history)");
  out += line("--", "ends the options: later words starting with - are operands");
  out +=
      "\n"
      "Options may come anywhere on the line.\n"
      "FILE - reads standard input. Records, as read and printed:\n"
      "  policy     {\"name\": S, \"policy_id\": S, \"description\": S, \"generation_number\": I,\n"
      "              \"blobs\": [{\"datastore_namespace\": S, \"blob\": S}, ...]}\n"
      "  datastore  {\"url\": S, \"datastore_namespace\": S, \"drp_policy_id\": S}\n"
      "S is a string standing for its UTF-8 bytes, or {\"base64\": \"...\"} for any bytes;\n"
      "output uses the base64 form only for bytes that are not valid UTF-8. I is a\n"
      "signed 64-bit integer. A missing field is \"\", 0 or []; an unknown or repeated key is\n"
      "an error.\n"
      "A blob is written raw with nothing added; finding none prints nothing (and\n"
      "exits 3 with --require).\n"
      "Reading commands fail when there is no store file; writing ones create it and\n"
      "watch waits for it. Writing commands, check and diff warn about records the\n"
      "store would collapse, drop or leave dangling (repeated names, ids or urls, empty\n"
      "names, a drp_policy_id naming no policy, stored datastores a policy write\n"
      "would leave without one). check and diff read the import form or a list of\n"
      "policies or datastores.\n"
      "An etcd locator is\n"
      "  etcd[s]://[USER[:PASSWORD]@]HOST:PORT[,HOST:PORT...]/PREFIX\n"
      "            [?cacert=FILE&cert=FILE&key=FILE&timeout=MS&cache=MIB]\n"
      "with %XX for any of @/?&,% in its parts; etcds:// uses TLS. What it leaves out\n"
      "comes from ETCDCTL_USER (USER[:PASSWORD]), ETCDCTL_PASSWORD and, for etcds://,\n"
      "ETCDCTL_CACERT, ETCDCTL_CERT and ETCDCTL_KEY. A new etcd catalogue reads as empty.\n"
      "Anything else that looks like a URL (http:/, ETCD://, etcd:/, etcd//, in any case)\n"
      "is refused rather than taken as a file; ./ in front makes it a path.\n"
      "\n"
      "Exit status:\n"
      "  0  success\n"
      "  1  store error, or any other failure\n"
      "  2  usage or input error, or a locator that cannot be used; the input is checked\n"
      "     whole before the store is touched\n"
      "  3  get found no such record, or blob --require found no blob\n"
      "diff exits 0 when the file would change nothing, 1 when it would, 2 on any failure.\n";
  return out;
}

std::string CommandHelpText(const std::vector<const CommandEntry*>& topics) {
  std::string out;
  for (const CommandEntry* entry : topics) {
    out += (out.empty() ? "" : "\n") + std::string("Usage: karstctl [OPTIONS] ") +
           Synopsis(*entry) + "\n  " + entry->summary + "\nOptions:\n";
    for (const OptionEntry& option : OptionTable()) {
      // --store and --wait serve every command that opens the store, and
      // --output every command (its errors, at least).
      const bool storeOption = option.name == "--store" || option.name == "--wait";
      const bool takes = option.name == "--output" ||
                         std::find(entry->options.begin(), entry->options.end(), option.name) !=
                             entry->options.end();
      if (!(storeOption ? entry->store != StoreUse::kNone : takes)) continue;
      std::string left = option.name + (option.value.empty() ? "" : " " + option.value);
      left.resize(std::max<std::size_t>(18, left.size() + 2), ' ');
      out += "  " + left + option.summary + "\n";
    }
    out += "Example:\n  " + entry->example + "\n";
  }
  return out;
}

std::string VersionText() { return std::string("karstctl ") + KARSTCTL_VERSION + "\n"; }

}  // namespace karstctl
