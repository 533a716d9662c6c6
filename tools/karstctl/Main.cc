// karstctl: the storage policy and datastore catalogue from a shell.
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string>
#include <vector>

#include "Args.h"
#include "Errors.h"
#include "Help.h"
#include "Io.h"
#include "Run.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "Utf8.h"

namespace {

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

// Every error is exactly one line: control bytes (a newline in a store
// message, say) become '?', and so does every byte of a message that is not
// UTF-8.
int Fail(int status, const std::string& message) {
  const bool utf8 = karstctl::IsValidUtf8(message);
  std::string line = "karstctl: ";
  for (char c : message) {
    auto byte = static_cast<unsigned char>(c);
    line += (byte < 0x20 || byte == 0x7F || (!utf8 && byte >= 0x80)) ? '?' : c;
  }
  line += '\n';
  std::fwrite(line.data(), 1, line.size(), stderr);
  return status;
}

int Main(const std::vector<std::string>& args) {
  try {
    karstctl::Invocation invocation = karstctl::ParseArgs(args);
    if (invocation.command == karstctl::Command::kHelp) {
      karstctl::WriteOutput(karstctl::HelpText());
      return EXIT_SUCCESS;
    }
    if (invocation.command == karstctl::Command::kVersion) {
      karstctl::WriteOutput(karstctl::VersionText());
      return EXIT_SUCCESS;
    }
    // The library opens the store named by this variable on its first call.
    if (invocation.store && setenv("TAVO_CONFIGSTORE_PATH", invocation.store->c_str(), 1) != 0) {
      return Fail(kExitFailure, "cannot set TAVO_CONFIGSTORE_PATH");
    }
    karstctl::RunCommand(invocation);
    return EXIT_SUCCESS;
  } catch (const karstctl::UsageError& e) {
    return Fail(kExitUsage, e.what());
  } catch (const karstctl::InputError& e) {
    return Fail(kExitUsage, e.what());
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    return Fail(kExitFailure, "store error " + std::to_string(e.Code()) + ": " + e.Message());
  } catch (const std::exception& e) {
    return Fail(kExitFailure, e.what());
  } catch (...) {
    return Fail(kExitFailure, "unexpected error");
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + (argc > 0 ? 1 : 0), argv + argc);
  return Main(args);
}
