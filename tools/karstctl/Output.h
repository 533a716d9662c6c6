#ifndef KARSTCTL_OUTPUT_H_
#define KARSTCTL_OUTPUT_H_

#include <string>
#include <vector>

#include "Args.h"
#include "Json.h"
#include "Warnings.h"

namespace karstctl {

// "value" as "form" prints it, ending in a newline: pretty is indented, json
// one line, and lines puts each element of an array on a line of its own
// (nothing for an empty one) and anything else on one line.
std::string RenderJson(const Json& value, OutputForm form);

// Writes RenderJson(value, form) to standard output.
void PrintJson(const Json& value, OutputForm form);

// Writes the warnings to standard error, one line each or, with --quiet,
// one line of counts per kind: text, or with --output json one JSON object a
// line ({"warning": KIND, "message": TEXT}, or {"warnings": N, "kinds":
// {KIND: COUNT, ...}}). With --strict any warning then throws InputError, so
// the caller writes nothing.
void ReportWarnings(const std::vector<Warning>& warnings, const Invocation& invocation);

// An error as --output json reports it on standard error: one line holding
// {"code": NAME, "number": N or null, "exit": STATUS, "message": TEXT}.
std::string ErrorJsonLine(const std::string& code, const Json& number, int exitStatus,
                          const std::string& message);

}  // namespace karstctl

#endif  // KARSTCTL_OUTPUT_H_
