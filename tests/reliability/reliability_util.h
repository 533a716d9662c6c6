// Shared by the reliability tests: self-describing catalogues, child
// processes with a result pipe and a deadline, and the one-line figures each
// test prints at its end.

#ifndef KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_
#define KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <ostream>
#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"

namespace karst_reliability {

// True in sanitizer builds, where every loop runs fewer rounds.
bool Sanitized();
// "full" in a normal build, "reduced" under the sanitizers.
int Scaled(int full, int reduced);

// Names one list a writer replaced a collection with: the writer and its
// round. Every record of the list carries both, the list's length and the
// record's index, so a reader can tell a whole list from a torn one.
struct Tag {
  int writer = 0;
  long long round = 0;
  bool operator==(const Tag& other) const { return writer == other.writer && round == other.round; }
  bool operator!=(const Tag& other) const { return !(*this == other); }
};

// The lists for a tag: deterministic, 1..11 policies and 1..7 datastores
// depending on the tag unless "count" says otherwise, NUL and 0xFF bytes in
// the blobs. Policy names are shared between tags, so a replace overwrites
// keys that exist as well as adding and dropping some; datastore urls carry
// the tag. Every datastore's namespace and default policy exist in every
// policy list, so each look-up finds a blob. Lists of more than 100 policies
// carry 1200 more bytes a policy, to span many pages.
std::vector<TavoKarst::KarstPolicyInfo> PoliciesFor(Tag tag, int count = 0);
std::vector<TavoKarst::KarstDatastoreInfo> DatastoresFor(Tag tag, int count = 0);

// What a listing held.
struct Observed {
  enum Kind { kEmpty, kWhole, kTorn };
  Kind kind = kEmpty;
  Tag tag;  // for kWhole
  std::string Describe() const;
};
// kWhole only when the list equals PoliciesFor(tag) byte for byte.
Observed Classify(const std::vector<TavoKarst::KarstPolicyInfo>& policies);
Observed Classify(const std::vector<TavoKarst::KarstDatastoreInfo>& datastores);

// A fresh directory under the test temp dir, removed with its content.
class ScratchDir {
 public:
  ScratchDir();
  ~ScratchDir();
  ScratchDir(const ScratchDir&) = delete;
  ScratchDir& operator=(const ScratchDir&) = delete;
  const std::string& Path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Points the library's default store at "path" for this process and every
// child forked afterwards.
void UseStoreAt(const std::string& path);

// How a child process ended and what it wrote to its result pipe.
struct ChildResult {
  bool exited = false;    // normal exit, see code
  int code = -1;          // exit status, or the signal that ended it
  bool timedOut = false;  // killed by the parent at the deadline
  std::string output;
  std::string Describe() const;
};

// Runs "body" in a forked child; whatever it writes to the fd it is given
// comes back in "output". An exception out of "body" is written there and
// the child exits with 3. A child still running after "timeoutSeconds" is
// killed and reported as timed out. The child never returns into gtest.
ChildResult RunChild(const std::function<void(int resultFd)>& body, double timeoutSeconds = 120);

// Writes all of "bytes" to "fd", retrying short writes.
void WriteAll(int fd, const std::string& bytes);

// Reads the whole catalogue in a new process with a new connection, the way
// the next program on the host would, and returns how each collection looks.
struct Verdict {
  Observed policies;
  Observed datastores;
  bool ok = false;  // the verifying process ran and listed both
  std::string error;
  std::string Describe() const;
};
Verdict VerifyInFreshProcess(double timeoutSeconds = 120);

// While alive, every commit on this thread's cached store connection is
// followed at once by a checkpoint (the copy of the log into the database
// file), so a test can fail or crash inside one without writing the
// thousand pages SQLite waits for by default.
class CheckpointEveryCommit {
 public:
  CheckpointEveryCommit();
  ~CheckpointEveryCommit();
  CheckpointEveryCommit(const CheckpointEveryCommit&) = delete;
  CheckpointEveryCommit& operator=(const CheckpointEveryCommit&) = delete;
};

// Prints "line" and keeps it as this run's figures of "part", which the test
// script prints at the end of the whole run.
void ReportFigures(const std::string& part, const std::string& line);

// Percentile of a set of durations in microseconds, e.g. 0.99.
double Percentile(std::vector<double> values, double fraction);

}  // namespace karst_reliability

namespace TavoKarst {
// Record comparison and printing for gtest, found by argument-dependent lookup.
bool operator==(const KarstPolicyBlob& a, const KarstPolicyBlob& b);
bool operator==(const KarstPolicyInfo& a, const KarstPolicyInfo& b);
bool operator==(const KarstDatastoreInfo& a, const KarstDatastoreInfo& b);
void PrintTo(const KarstPolicyInfo& p, std::ostream* os);
void PrintTo(const KarstDatastoreInfo& d, std::ostream* os);
}  // namespace TavoKarst

#endif  // KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_
