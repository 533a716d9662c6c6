#ifndef KARSTCTL_STORE_SESSION_H_
#define KARSTCTL_STORE_SESSION_H_

#include "Args.h"

namespace karstctl {

// The store one command works on, installed as the library's store for as
// long as this object lives: the --store path or else the default one,
// opened with the --wait lock timeout. For a read, a path with nothing there
// fails with "no store at PATH" (std::runtime_error) instead of reading as
// an empty catalogue. Store failures throw ConfigStoreException.
class StoreSession {
 public:
  StoreSession(const Invocation& invocation, StoreUse use);
  ~StoreSession();
  StoreSession(const StoreSession&) = delete;
  StoreSession& operator=(const StoreSession&) = delete;
};

}  // namespace karstctl

#endif  // KARSTCTL_STORE_SESSION_H_
