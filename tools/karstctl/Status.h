#ifndef KARSTCTL_STATUS_H_
#define KARSTCTL_STATUS_H_

#include "Args.h"
#include "StoreSession.h"

namespace karstctl {

// Prints the store in use and what chose it, its kind and format version,
// its history and its record counts: as "key: value" lines, or with
// --output as one JSON object {"store", "chosen_by", "kind", "format",
// "history", "policies", "datastores"}. Opens the store for reading, so one
// that cannot be read fails as any read does.
void PrintStatus(const Invocation& invocation, StoreSession& store);

}  // namespace karstctl

#endif  // KARSTCTL_STATUS_H_
