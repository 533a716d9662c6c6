#ifndef KARSTCTL_RUN_H_
#define KARSTCTL_RUN_H_

#include "Args.h"

namespace karstctl {

// Carries out a store command (not --help or --version) against the store
// the library opens. Input is read and decoded whole before the first
// library call. Throws InputError, the store's ConfigStoreException, or
// std::runtime_error when output cannot be written.
void RunCommand(const Invocation& invocation);

}  // namespace karstctl

#endif  // KARSTCTL_RUN_H_
