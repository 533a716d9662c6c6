// karstctl: the storage policy and datastore catalogue from a shell.
#include <cstdlib>
#include <string>
#include <vector>

#include "Cli.h"

int main(int argc, char** argv) {
  // The etcd client library logs connection trouble to stderr on its own;
  // karstctl reports each failure once, in its one-line error.
  setenv("GRPC_VERBOSITY", "NONE", 0);
  return karstctl::RunKarstctl(std::vector<std::string>(argv + (argc > 0 ? 1 : 0), argv + argc));
}
