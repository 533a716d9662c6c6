#ifndef KARSTCTL_STORE_ERRORS_H_
#define KARSTCTL_STORE_ERRORS_H_

#include <cstdint>
#include <string>

#include "TavoConfigStore/ConfigStoreException.h"

namespace karstctl {

// The name of a store error code: SQLite's ("SQLITE_BUSY",
// "SQLITE_IOERR_FSYNC"), the store's own ("not a store"), or etcd's
// ("etcd UNAVAILABLE"). An extended SQLite code without a name of its own
// is named by its primary code.
std::string StoreErrorName(std::int32_t code);

// "<the store's message> (<name>, <code>)", so an operator can read what went
// wrong and still search for the number.
std::string DescribeStoreError(const TavoConfigStore::ConfigStoreException& error);

}  // namespace karstctl

#endif  // KARSTCTL_STORE_ERRORS_H_
