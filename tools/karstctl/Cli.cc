#include "Cli.h"

#include <cstdlib>
#include <exception>

#include "Errors.h"
#include "Help.h"
#include "Io.h"
#include "StoreErrors.h"
#include "StoreSession.h"

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
    const Invocation invocation = ParseArgs(args);
    if (invocation.command) {
      StoreSession store(invocation);  // a bad locator fails here, before any input
      invocation.command->run(invocation.operands, store);
    } else if (invocation.version) {
      WriteOutput(VersionText());
    } else {
      WriteOutput(invocation.helpTopics.empty() ? HelpText()
                                                : CommandHelpText(invocation.helpTopics));
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
