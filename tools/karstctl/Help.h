#ifndef KARSTCTL_HELP_H_
#define KARSTCTL_HELP_H_

#include <string>

namespace karstctl {

// The --help text: every command on one aligned line, the record shapes and
// the exit statuses.
std::string HelpText();

// "karstctl <version>\n".
std::string VersionText();

}  // namespace karstctl

#endif  // KARSTCTL_HELP_H_
