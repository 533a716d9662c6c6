// Child processes with a result pipe and a deadline.

#ifndef KARST_TESTS_SUPPORT_CHILD_H_
#define KARST_TESTS_SUPPORT_CHILD_H_

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace karst_test {

// How a child process ended and what it wrote to its result pipe.
struct ChildResult {
  bool exited = false;    // normal exit, see code
  int code = -1;          // exit status, or the signal that ended it
  bool timedOut = false;  // killed by the parent at the deadline
  std::string output;
  bool Ok() const { return exited && code == 0 && !timedOut; }
  std::string Describe() const;
};

// Runs "body" in a forked child; whatever it writes to the fd it is given
// comes back in "output". An exception out of "body" is written there and the
// child exits with 3. A child still running after "timeoutSeconds" is killed
// and reported as timed out. The child never returns into gtest.
ChildResult RunChild(const std::function<void(int resultFd)>& body, double timeoutSeconds = 120);

// Writes all of "bytes" to "fd", retrying short writes.
void WriteAll(int fd, const std::string& bytes);

// Replaces this process with "argv" (a program found on the PATH), or ends it
// with 127 when that fails.
[[noreturn]] void Exec(const std::vector<std::string>& argv);

// Waits up to "seconds" for the child "pid" to end: its wait status, or -1
// while it still runs.
int WaitFor(pid_t pid, double seconds);

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_CHILD_H_
