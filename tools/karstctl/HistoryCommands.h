#ifndef KARSTCTL_HISTORY_COMMANDS_H_
#define KARSTCTL_HISTORY_COMMANDS_H_

#include <cstdint>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

namespace karstctl {

class StoreSession;
struct Invocation;

// The commands on the versions the store keeps, for the command table.
// Each returns the exit status or throws, as CommandEntry says.

// The kept versions, newest first, each with its record counts and the
// digests hash printed for it.
int ListHistory(const Invocation& invocation, StoreSession& store);
// Keeps the last K versions from now on.
int SetHistoryDepth(const Invocation& invocation, StoreSession& store);
// Makes a kept version current again, as a new version.
int RollBack(const Invocation& invocation, StoreSession& store);

// For status: {"depth": K, "newest": N} of the store installed for the
// process, or null for a store that keeps no history.
nlohmann::ordered_json HistoryStatus();

// A version number as given on the command line: digits, at least 1.
// Throws UsageError naming "what".
std::uint64_t ParseVersionNumber(const std::string& text, const std::string& what);

}  // namespace karstctl

#endif  // KARSTCTL_HISTORY_COMMANDS_H_
