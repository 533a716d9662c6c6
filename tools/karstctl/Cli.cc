#include "Cli.h"

#include <cstdlib>
#include <exception>

#include "Errors.h"
#include "Help.h"
#include "Io.h"
#include "Run.h"
#include "StoreErrors.h"

namespace karstctl {

namespace {
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

int Fail(int status, const std::string& message) {
  WriteDiagnostic(message);
  return status;
}
}  // namespace

int RunKarstctl(const std::vector<std::string>& args) {
  try {
    Invocation invocation = ParseArgs(args);
    if (invocation.command == Command::kHelp) {
      WriteOutput(invocation.helpTopics.empty() ? HelpText()
                                                : CommandHelpText(invocation.helpTopics));
    } else if (invocation.command == Command::kVersion) {
      WriteOutput(VersionText());
    } else {
      RunCommand(invocation);
    }
    return EXIT_SUCCESS;
  } catch (const UsageError& e) {
    return Fail(kExitUsage, e.what());
  } catch (const InputError& e) {
    return Fail(kExitUsage, e.what());
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    return Fail(kExitFailure, DescribeStoreError(e));
  } catch (const std::exception& e) {
    return Fail(kExitFailure, e.what());
  } catch (...) {
    return Fail(kExitFailure, "unexpected error");
  }
}

}  // namespace karstctl
