#ifndef KARSTCTL_ERRORS_H_
#define KARSTCTL_ERRORS_H_

#include <stdexcept>
#include <string>

namespace karstctl {

// A command line that does not name a valid command. Exit status 2.
class UsageError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Input that cannot be read or does not hold valid records; raised before the
// store is touched. Exit status 2. The message names the source and the
// position or field.
class InputError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// A record asked for by its key (policies get NAME), or a blob asked for
// with --require, that is not there. Exit status 3.
class NotFoundError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

}  // namespace karstctl

#endif  // KARSTCTL_ERRORS_H_
