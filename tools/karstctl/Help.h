#ifndef KARSTCTL_HELP_H_
#define KARSTCTL_HELP_H_

#include <string>
#include <vector>

#include "Args.h"

namespace karstctl {

// The --help text: every command on one aligned line, the record shapes and
// the exit statuses.
std::string HelpText();

// Each command's usage line and summary, for "karstctl COMMAND --help".
std::string CommandHelpText(const std::vector<const CommandEntry*>& topics);

// "karstctl <version>\n".
std::string VersionText();

}  // namespace karstctl

#endif  // KARSTCTL_HELP_H_
