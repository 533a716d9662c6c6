#include "Child.h"

#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <iostream>

#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_test {

std::string ChildResult::Describe() const {
  std::string s = timedOut ? "timed out"
                  : exited ? "exit " + std::to_string(code)
                           : "signal " + std::to_string(code) + " (" + strsignal(code) + ")";
  return s + ", output: " + output;
}

void WriteAll(int fd, const std::string& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    done += static_cast<std::size_t>(n);
  }
}

void Exec(const std::vector<std::string>& argv) {
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  execvp(args[0], args.data());
  std::perror(args[0]);
  _exit(127);
}

int WaitFor(pid_t pid, double seconds) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (int status = 0;; usleep(1000)) {
    const pid_t r = waitpid(pid, &status, WNOHANG);
    if (r == pid || (r < 0 && errno != EINTR)) return r == pid ? status : 0;
    if (std::chrono::steady_clock::now() >= deadline) return -1;
  }
}

namespace {

[[noreturn]] void RunInChild(const std::function<void(int)>& body, int fd) {
  int status = 0;
  try {
    body(fd);
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    WriteAll(fd, "ConfigStoreException " + std::to_string(e.Code()) + ": " + e.Message());
    status = 3;
  } catch (const std::exception& e) {
    WriteAll(fd, std::string("exception: ") + e.what());
    status = 3;
  } catch (...) {
    WriteAll(fd, "unknown exception");
    status = 3;
  }
  _exit(status);
}

// Reads until EOF or the deadline; true at EOF.
bool ReadUntilEof(int fd, std::chrono::steady_clock::time_point deadline, std::string* out) {
  char buffer[65536];
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                          deadline - std::chrono::steady_clock::now())
                          .count();
    if (left <= 0) return false;
    pollfd p{fd, POLLIN, 0};
    const int ready = poll(&p, 1, static_cast<int>(std::min<long long>(left, 1000)));
    if (ready <= 0) continue;
    const ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return true;
    out->append(buffer, static_cast<std::size_t>(n));
  }
}

}  // namespace

ChildResult RunChild(const std::function<void(int resultFd)>& body, double timeoutSeconds) {
  ChildResult result;
  int fds[2];
  if (pipe(fds) != 0) {
    result.output = "pipe failed";
    return result;
  }
  std::cout.flush();
  std::cerr.flush();
  const pid_t parent = getpid();
  const pid_t pid = fork();
  if (pid == 0) {
    // A child must not outlive a test that was killed (a timeout, say).
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) _exit(4);
    close(fds[0]);
    RunInChild(body, fds[1]);
  }
  close(fds[1]);
  if (pid < 0) {
    close(fds[0]);
    result.output = "fork failed";
    return result;
  }
  const auto deadline = std::chrono::steady_clock::now() +
                        std::chrono::microseconds(static_cast<long long>(timeoutSeconds * 1e6));
  if (!ReadUntilEof(fds[0], deadline, &result.output)) {
    result.timedOut = true;
    kill(pid, SIGKILL);
  }
  close(fds[0]);
  // EOF may come before the exit; a child stuck after closing its pipe is
  // killed at the deadline all the same.
  const std::chrono::duration<double> left = deadline - std::chrono::steady_clock::now();
  int status = WaitFor(pid, std::max(left.count(), 0.0));
  if (status == -1) {
    result.timedOut = true;
    kill(pid, SIGKILL);
    waitpid(pid, &status, 0);
  }
  result.exited = WIFEXITED(status);
  result.code = result.exited ? WEXITSTATUS(status) : WTERMSIG(status);
  return result;
}

}  // namespace karst_test
