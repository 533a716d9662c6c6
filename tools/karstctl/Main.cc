// karstctl: the storage policy and datastore catalogue from a shell.
#include <string>
#include <vector>

#include "Cli.h"

int main(int argc, char** argv) {
  return karstctl::RunKarstctl(std::vector<std::string>(argv + (argc > 0 ? 1 : 0), argv + argc));
}
