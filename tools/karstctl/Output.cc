#include "Output.h"

#include <map>

#include "Errors.h"
#include "Io.h"

namespace karstctl {

namespace {

std::string Count(std::size_t n, const std::string& what) {
  return std::to_string(n) + " " + what + (n == 1 ? "" : "s");
}

// Bytes that are not UTF-8 cannot reach here in records (EncodeBytes wraps
// them), but a store's message may hold some; they become U+FFFD.
std::string Compact(const Json& value) {
  return value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

}  // namespace

std::string RenderJson(const Json& value, OutputForm form) {
  switch (form) {
    case OutputForm::kPretty:
      return DumpJsonText(value);
    case OutputForm::kJson:
      return Compact(value) + "\n";
    case OutputForm::kLines:
      break;
  }
  if (!value.is_array()) return Compact(value) + "\n";
  std::string out;
  for (const Json& element : value) out += Compact(element) + "\n";
  return out;
}

void PrintJson(const Json& value, OutputForm form) { WriteOutput(RenderJson(value, form)); }

void ReportWarnings(const std::vector<Warning>& warnings, const Invocation& invocation) {
  if (warnings.empty()) return;
  if (invocation.quiet) {
    // Kinds in the order they first occur, so the summary reads like the file.
    std::vector<std::string> order;
    std::map<std::string, std::size_t> counts;
    for (const Warning& warning : warnings) {
      if (counts[warning.kind]++ == 0) order.push_back(warning.kind);
    }
    std::string line = "warning: " + Count(warnings.size(), "warning") + ":";
    for (const auto& kind : order) {
      line += (&kind == &order.front() ? " " : ", ") + std::to_string(counts[kind]) + " " + kind;
    }
    WriteDiagnostic(line);
  } else {
    for (const Warning& warning : warnings) WriteDiagnostic("warning: " + warning.message);
  }
  if (invocation.strict) {
    throw InputError(Count(warnings.size(), "warning") +
                     " and --strict: the store is left as it was");
  }
}

std::string ErrorJsonLine(const std::string& code, const Json& number, int exitStatus,
                          const std::string& message) {
  Json error = Json::object();
  error["code"] = code;
  error["number"] = number;
  error["exit"] = exitStatus;
  error["message"] = message;
  return Compact(error) + "\n";
}

}  // namespace karstctl
