#include "Output.h"

#include <cstdio>

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
  // With --output json, a script reads standard error as JSON lines, one
  // object a warning or one summary, as it reads an error.
  const bool json = invocation.output == OutputForm::kJson;
  auto write = [json](const Json& object, const std::string& text) {
    if (json) {
      const std::string line = Compact(object) + "\n";
      std::fwrite(line.data(), 1, line.size(), stderr);
    } else {
      WriteDiagnostic("warning: " + text);
    }
  };
  if (invocation.quiet) {
    // Kinds in the order they first occur, so the summary reads like the file.
    Json counts = Json::object();
    for (const Warning& warning : warnings) {
      counts[warning.kind] = counts.value(warning.kind, 0) + 1;
    }
    std::string text = Count(warnings.size(), "warning") + ":";
    for (const auto& [kind, count] : counts.items()) {
      text += (text.back() == ':' ? " " : ", ") + count.dump() + " " + kind;
    }
    Json summary = Json::object();
    summary["warnings"] = warnings.size();
    summary["kinds"] = counts;
    write(summary, text);
  } else {
    for (const Warning& warning : warnings) {
      Json object = Json::object();
      object["warning"] = warning.kind;
      object["message"] = warning.message;
      write(object, warning.message);
    }
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
