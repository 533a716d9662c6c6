// A writer process replaces the catalogue over and over and is SIGKILLed at a
// random moment; a new process then reads the store. Every collection must
// hold exactly the last list the writer reported as replaced, or the one it
// was replacing when it died: never a mixture, never an older list.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <random>
#include <set>
#include <string>

#include "TavoKarst/KarstLib.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoKarst::KarstLib;

// Replace number j goes to the policies when j is even and to the datastores
// when it is odd, with the lists of Tag{0, j}.
void Replace(long long j) {
  if (j % 2 == 0) {
    KarstLib::AddPolicyInfo(PoliciesFor(Tag{0, j}));
  } else {
    KarstLib::AddDatastoreInfo(DatastoresFor(Tag{0, j}));
  }
}

// Starts the writer at replace "first"; it reports every replace that
// returned by writing its number to "fd".
pid_t StartWriter(long long first, int fd, int readEnd) {
  const pid_t pid = fork();
  if (pid != 0) return pid;
  close(readEnd);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  try {
    for (long long j = first;; ++j) {
      Replace(j);
      // One write of 8 bytes to a pipe is atomic: the parent sees whole numbers.
      if (write(fd, &j, sizeof j) != sizeof j) _exit(4);
    }
  } catch (...) {
    _exit(3);
  }
}

TEST(KillLoop, EveryKillLeavesEachCollectionOldOrNew) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  ASSERT_EQ(RunChild([](int) {
              Replace(0);
              Replace(1);
            }).code,
            0);

  const int kills = Scaled(500, 100);
  std::mt19937 rng(20261123);
  long long last[2] = {0, 1};  // last replace of each collection known to be in the store
  int oldOrNew = 0, partial = 0, lost = 0, keptOld = 0, tookNew = 0, unexpected = 0;
  long long reported = 0;
  unsigned windowUs = 20000;
  for (int k = 0; k < kills; ++k) {
    const long long first = std::max(last[0], last[1]) + 1;
    int fds[2];
    ASSERT_EQ(pipe(fds), 0) << std::strerror(errno);
    const pid_t pid = StartWriter(first, fds[1], fds[0]);
    ASSERT_GT(pid, 0);
    close(fds[1]);
    // Anywhere from start-up to a few replaces in; the window follows how
    // fast this machine (or sanitizer) writes, aiming at 1-4 replaces a child.
    usleep(static_cast<useconds_t>(rng() % windowUs));
    kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFSIGNALED(status)) << "writer ended by itself, status " << status;

    long long j = 0, latest = first - 1;
    while (read(fds[0], &j, sizeof j) == sizeof j) {
      ASSERT_EQ(j, latest + 1);
      latest = j;
      last[j % 2] = j;
      ++reported;
    }
    close(fds[0]);
    const long long done = latest - first + 1;
    if (done == 0) windowUs += windowUs / 16;
    if (done > 4 && windowUs > 2000) windowUs -= windowUs / 8;

    const Verdict v = VerifyInFreshProcess();
    ASSERT_TRUE(v.ok) << v.error;
    const long long inFlight = latest + 1;
    const Observed* seen[2] = {&v.policies, &v.datastores};
    bool bothFine = true;
    for (int c = 0; c < 2; ++c) {
      const Observed& o = *seen[c];
      const bool mayBeNew = inFlight % 2 == c;
      if (o.kind == Observed::kTorn) {
        ++partial;
        bothFine = false;
        ADD_FAILURE() << "kill " << k << ": collection " << c << " torn";
      } else if (o.kind == Observed::kWhole && o.tag.writer == 0 && o.tag.round == last[c]) {
        if (mayBeNew) ++keptOld;
      } else if (o.kind == Observed::kWhole && o.tag.writer == 0 && mayBeNew &&
                 o.tag.round == inFlight) {
        ++tookNew;
        last[c] = inFlight;
      } else if (o.kind == Observed::kWhole && o.tag.round < last[c]) {
        ++lost;
        bothFine = false;
        ADD_FAILURE() << "kill " << k << ": reported replace " << last[c] << " lost, store has "
                      << o.Describe();
      } else {
        ++unexpected;
        bothFine = false;
        ADD_FAILURE() << "kill " << k << ": collection " << c << " holds " << o.Describe()
                      << ", expected replace " << last[c] << " or " << inFlight;
      }
    }
    if (bothFine) ++oldOrNew;
    if (HasFatalFailure() || partial + lost + unexpected > 5) break;
  }

  ReportFigures("kill-loop", "kill-loop: " + std::to_string(kills) + " kills, old-or-new " +
                                 std::to_string(oldOrNew) + ", partial " + std::to_string(partial) +
                                 ", lost " + std::to_string(lost) + " (" +
                                 std::to_string(reported) +
                                 " replaces reported; the replace in flight at the kill kept "
                                 "the old list " +
                                 std::to_string(keptOld) + " times, had committed the new " +
                                 std::to_string(tookNew) + ")");
  EXPECT_EQ(oldOrNew, kills);
  EXPECT_EQ(partial, 0);
  EXPECT_EQ(lost, 0);
  EXPECT_EQ(unexpected, 0);
}

}  // namespace
}  // namespace karst_reliability
