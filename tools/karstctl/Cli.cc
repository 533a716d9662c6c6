#include "Cli.h"

#include <cstdlib>
#include <exception>

#include "Errors.h"
#include "Help.h"
#include "Io.h"
#include "Output.h"
#include "StoreErrors.h"
#include "StoreSession.h"

namespace karstctl {

namespace {
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;
constexpr int kExitNotFound = 3;

// One failure, reported as one line on standard error: text, or with
// --output json a JSON object. "number" is the store's code, null for a
// failure of karstctl's own.
struct Failure {
  int status;
  std::string code;
  Json number;
  std::string message;
};

int Report(const Failure& failure, bool json) {
  if (json) {
    // A JSON line is whole already; it goes out as is.
    const std::string line =
        ErrorJsonLine(failure.code, failure.number, failure.status, failure.message);
    std::fwrite(line.data(), 1, line.size(), stderr);
  } else {
    WriteDiagnostic(failure.message);
  }
  return failure.status;
}

int Run(const std::vector<std::string>& args, const CommandEntry** running) {
  const Invocation invocation = ParseArgs(args);
  if (invocation.command) {
    *running = invocation.command;
    StoreSession store(invocation);  // a bad locator fails here, before any input
    return invocation.command->run(invocation, store);
  }
  if (invocation.version) {
    WriteOutput(VersionText());
  } else {
    WriteOutput(invocation.helpTopics.empty() ? HelpText()
                                              : CommandHelpText(invocation.helpTopics));
  }
  return EXIT_SUCCESS;
}

}  // namespace

int RunKarstctl(const std::vector<std::string>& args) {
  const bool json = AsksForJsonErrors(args);
  const CommandEntry* running = nullptr;
  // A command may have one status for every failure (diff's 2, as cmp has it).
  auto failed = [&running](int status) {
    return running && running->failureStatus != kExitFailure ? running->failureStatus : status;
  };
  try {
    return Run(args, &running);
  } catch (const UsageError& e) {
    return Report({kExitUsage, "usage", nullptr, e.what()}, json);
  } catch (const InputError& e) {
    return Report({kExitUsage, "input", nullptr, e.what()}, json);
  } catch (const NotFoundError& e) {
    return Report({kExitNotFound, "not found", nullptr, e.what()}, json);
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    return Report({failed(kExitFailure), StoreErrorName(e.Code()), e.Code(),
                   json ? e.Message() : DescribeStoreError(e)},
                  json);
  } catch (const std::exception& e) {
    return Report({failed(kExitFailure), "failure", nullptr, e.what()}, json);
  } catch (...) {
    return Report({failed(kExitFailure), "failure", nullptr, "unexpected error"}, json);
  }
}

}  // namespace karstctl
