#include "reliability_util.h"

#include <poll.h>
#include <signal.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <cstring>
#include <exception>
#include <filesystem>
#include <fstream>
#include <iostream>

#include "SqliteStoreTesting.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_reliability {

using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

bool Sanitized() {
#ifdef KARST_RELIABILITY_SANITIZED
  return true;
#else
  return false;
#endif
}

int Scaled(int full, int reduced) { return Sanitized() ? reduced : full; }

namespace {

std::string TagText(Tag tag, int count, int index) {
  char text[96];
  std::snprintf(text, sizeof text, "w=%d r=%lld n=%d i=%d", tag.writer, tag.round, count, index);
  return text;
}

// Reads back what TagText wrote at the start of "text".
bool ParseTag(const std::string& text, Tag* tag, int* countOut) {
  long long round = 0;
  int writer = 0, count = 0, index = 0;
  if (std::sscanf(text.c_str(), "w=%d r=%lld n=%d i=%d", &writer, &round, &count, &index) != 4) {
    return false;
  }
  tag->writer = writer;
  tag->round = round;
  *countOut = count;
  return count > 0;
}

int Mod(long long value, int m) { return static_cast<int>(((value % m) + m) % m); }

}  // namespace

std::vector<KarstPolicyInfo> PoliciesFor(Tag tag, int count) {
  const int n = count > 0 ? count : 1 + Mod(tag.round * 7 + tag.writer * 3, 11);
  const std::string filler(n > 100 ? 1200 : 0, 'x');
  std::vector<KarstPolicyInfo> out(n);
  for (int i = 0; i < n; ++i) {
    const std::string text = TagText(tag, n, i);
    KarstPolicyInfo& p = out[i];
    p.name = "policy-" + std::to_string(i);
    p.policy_id = "id-" + std::to_string(i % 3);
    p.description = text;
    p.generation_number = tag.round;
    p.blobs.push_back(KarstPolicyBlob{std::string("corra\0", 6) + text + "\xff", "CORRA"});
    p.blobs.push_back(KarstPolicyBlob{"blob\xfe" + text + filler, "ns-" + std::to_string(i % 2)});
  }
  return out;
}

std::vector<KarstDatastoreInfo> DatastoresFor(Tag tag, int count) {
  const int m = count > 0 ? count : 1 + Mod(tag.round * 5 + tag.writer, 7);
  std::vector<KarstDatastoreInfo> out(m);
  for (int i = 0; i < m; ++i) {
    // The url carries the tag; namespace and default policy are those of the
    // policy lists, so every look-up finds something.
    out[i].url = "ds-" + std::to_string(i) + "/" + TagText(tag, m, i);
    out[i].datastore_namespace = "ns-" + std::to_string(i % 2);
    out[i].drp_policy_id = "id-" + std::to_string(i % 3);
  }
  return out;
}

std::string Observed::Describe() const {
  switch (kind) {
    case kEmpty:
      return "empty";
    case kTorn:
      return "TORN";
    case kWhole:
      break;
  }
  return "whole(w=" + std::to_string(tag.writer) + " r=" + std::to_string(tag.round) + ")";
}

Observed Classify(const std::vector<KarstPolicyInfo>& policies) {
  Observed o;
  if (policies.empty()) return o;
  o.kind = Observed::kTorn;
  Tag tag;
  int n = 0;
  // The length is checked first so a garbled count never builds a huge list.
  if (ParseTag(policies.front().description, &tag, &n) &&
      static_cast<std::size_t>(n) == policies.size() && policies == PoliciesFor(tag, n)) {
    o.kind = Observed::kWhole;
    o.tag = tag;
  }
  return o;
}

Observed Classify(const std::vector<KarstDatastoreInfo>& datastores) {
  Observed o;
  if (datastores.empty()) return o;
  o.kind = Observed::kTorn;
  Tag tag;
  int n = 0;
  const std::string& url = datastores.front().url;
  const std::size_t slash = url.find('/');
  if (slash != std::string::npos && ParseTag(url.substr(slash + 1), &tag, &n) &&
      static_cast<std::size_t>(n) == datastores.size() && datastores == DatastoresFor(tag, n)) {
    o.kind = Observed::kWhole;
    o.tag = tag;
  }
  return o;
}

ScratchDir::ScratchDir() {
  std::string pattern = ::testing::TempDir() + "/karst-reliability-XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp: " << std::strerror(errno);
  path_ = pattern;
}

ScratchDir::~ScratchDir() {
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
}

void UseStoreAt(const std::string& path) { setenv("TAVO_CONFIGSTORE_PATH", path.c_str(), 1); }

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

ChildResult RunChild(const std::function<void(int resultFd)>& body, double timeoutSeconds) {
  ChildResult result;
  int fds[2];
  if (pipe(fds) != 0) {
    result.output = "pipe failed";
    return result;
  }
  std::cout.flush();
  std::cerr.flush();
  const pid_t pid = fork();
  if (pid == 0) {
    close(fds[0]);
    int status = 0;
    try {
      body(fds[1]);
    } catch (const TavoConfigStore::ConfigStoreException& e) {
      WriteAll(fds[1], "ConfigStoreException " + std::to_string(e.Code()) + ": " + e.Message());
      status = 3;
    } catch (const std::exception& e) {
      WriteAll(fds[1], std::string("exception: ") + e.what());
      status = 3;
    } catch (...) {
      WriteAll(fds[1], "unknown exception");
      status = 3;
    }
    _exit(status);
  }
  close(fds[1]);
  if (pid < 0) {
    close(fds[0]);
    result.output = "fork failed";
    return result;
  }
  const auto deadline = std::chrono::steady_clock::now() +
                        std::chrono::microseconds(static_cast<long long>(timeoutSeconds * 1e6));
  char buffer[65536];
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                          deadline - std::chrono::steady_clock::now())
                          .count();
    if (left <= 0) {
      result.timedOut = true;
      kill(pid, SIGKILL);
      break;
    }
    pollfd p{fds[0], POLLIN, 0};
    const int ready = poll(&p, 1, static_cast<int>(std::min<long long>(left, 1000)));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) continue;
    const ssize_t n = read(fds[0], buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;  // EOF: the child is done with the pipe
    result.output.append(buffer, static_cast<std::size_t>(n));
  }
  close(fds[0]);
  int status = 0;
  // EOF may come before the exit; a child stuck after closing its pipe is
  // killed at the deadline all the same.
  for (;;) {
    const pid_t r = waitpid(pid, &status, WNOHANG);
    if (r == pid) break;
    if (r < 0 && errno != EINTR) break;
    if (std::chrono::steady_clock::now() > deadline) {
      result.timedOut = true;
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      break;
    }
    usleep(1000);
  }
  result.exited = WIFEXITED(status);
  result.code = result.exited ? WEXITSTATUS(status) : WTERMSIG(status);
  return result;
}

std::string Verdict::Describe() const {
  if (!ok) return "verification failed: " + error;
  return "policies " + policies.Describe() + ", datastores " + datastores.Describe();
}

Verdict VerifyInFreshProcess(double timeoutSeconds) {
  // The child classifies both listings and sends the verdict back as text.
  ChildResult r = RunChild(
      [](int fd) {
        const Observed p = Classify(KarstLib::ListPolicyInfo());
        const Observed d = Classify(KarstLib::ListDatastoreInfo());
        char line[128];
        std::snprintf(line, sizeof line, "%d %d %lld %d %d %lld", static_cast<int>(p.kind),
                      p.tag.writer, p.tag.round, static_cast<int>(d.kind), d.tag.writer,
                      d.tag.round);
        WriteAll(fd, line);
      },
      timeoutSeconds);
  Verdict v;
  int pk = 0, dk = 0;
  if (!r.exited || r.code != 0 ||
      std::sscanf(r.output.c_str(), "%d %d %lld %d %d %lld", &pk, &v.policies.tag.writer,
                  &v.policies.tag.round, &dk, &v.datastores.tag.writer,
                  &v.datastores.tag.round) != 6) {
    v.error = r.Describe();
    return v;
  }
  v.policies.kind = static_cast<Observed::Kind>(pk);
  v.datastores.kind = static_cast<Observed::Kind>(dk);
  v.ok = true;
  return v;
}

namespace {
void SetAutoCheckpoint(int pages) {
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  sqlite3* db = TavoConfigStore::SqliteConnectionForTesting(*store);
  if (db != nullptr) sqlite3_wal_autocheckpoint(db, pages);
}
}  // namespace

CheckpointEveryCommit::CheckpointEveryCommit() { SetAutoCheckpoint(1); }
CheckpointEveryCommit::~CheckpointEveryCommit() { SetAutoCheckpoint(1000); }

void ReportFigures(const std::string& part, const std::string& line) {
  std::cout << line << std::endl;
#ifdef KARST_RELIABILITY_FIGURES_DIR
  std::error_code ec;
  std::filesystem::create_directories(KARST_RELIABILITY_FIGURES_DIR, ec);
  std::ofstream out(std::string(KARST_RELIABILITY_FIGURES_DIR) + "/" + part + ".txt",
                    std::ios::trunc);
  out << line << "\n";
#endif
}

double Percentile(std::vector<double> values, double fraction) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const std::size_t index =
      std::min(values.size() - 1, static_cast<std::size_t>(fraction * (values.size() - 1) + 0.5));
  return values[index];
}

}  // namespace karst_reliability

namespace TavoKarst {

bool operator==(const KarstPolicyBlob& a, const KarstPolicyBlob& b) {
  return a.blob == b.blob && a.datastore_namespace == b.datastore_namespace;
}
bool operator==(const KarstPolicyInfo& a, const KarstPolicyInfo& b) {
  return a.name == b.name && a.policy_id == b.policy_id && a.description == b.description &&
         a.generation_number == b.generation_number && a.blobs == b.blobs;
}
bool operator==(const KarstDatastoreInfo& a, const KarstDatastoreInfo& b) {
  return a.url == b.url && a.datastore_namespace == b.datastore_namespace &&
         a.drp_policy_id == b.drp_policy_id;
}
void PrintTo(const KarstPolicyInfo& p, std::ostream* os) {
  *os << "{name=" << ::testing::PrintToString(p.name)
      << " policy_id=" << ::testing::PrintToString(p.policy_id)
      << " description=" << ::testing::PrintToString(p.description)
      << " generation=" << p.generation_number << " blobs=" << p.blobs.size() << "}";
}
void PrintTo(const KarstDatastoreInfo& d, std::ostream* os) {
  *os << "{" << ::testing::PrintToString(d.url) << ", "
      << ::testing::PrintToString(d.datastore_namespace) << ", "
      << ::testing::PrintToString(d.drp_policy_id) << "}";
}

}  // namespace TavoKarst
