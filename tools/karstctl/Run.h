#ifndef KARSTCTL_RUN_H_
#define KARSTCTL_RUN_H_

#include "Args.h"

namespace karstctl {

// Carries out a store command (not --help or --version), opening the store
// itself. A bad etcd locator is reported first; input is read and decoded
// whole before the store is opened; warnings about records the store would
// collapse go to standard error. "watch" returns at SIGINT or SIGTERM.
// Throws InputError, the store's ConfigStoreException, or
// std::runtime_error when there is no store to read or output cannot be
// written.
void RunCommand(const Invocation& invocation);

}  // namespace karstctl

#endif  // KARSTCTL_RUN_H_
