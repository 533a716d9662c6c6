// A writer process replaces the catalogue over and over and is SIGKILLed at a
// random moment; a new process then reads the store. Every collection must
// hold exactly the last list the writer reported as replaced, or the one it
// was replacing when it died: never a mixture, never an older list.

#include "reliability_util.h"

namespace karst_reliability {

// Replace j goes to the policies when j is even, else to the datastores.
void Replace(long long j) {
  if (j % 2 == 0) KarstLib::AddPolicyInfo(PoliciesFor(Tag{0, j}));
  if (j % 2 == 1) KarstLib::AddDatastoreInfo(DatastoresFor(Tag{0, j}));
}

// The catalogue once replaces 0..j are stored.
std::string After(long long j) { return State(Tag{0, j - j % 2}, Tag{0, j - 1 + j % 2}); }

// The writer starts at replace "first" and announces each replace on "fds"
// before making it; 8 bytes to a pipe arrive whole.
pid_t StartWriter(long long first, const int fds[2]) {
  const pid_t pid = fork();
  if (pid != 0) return pid;
  close(fds[0]);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  for (long long j = first; write(fds[1], &j, sizeof j) == sizeof j; ++j) Replace(j);
  _exit(4);
}

TEST(KillLoop, EveryKillLeavesEachCollectionOldOrNew) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  ASSERT_TRUE(RunChild([](int) { Replace(0), Replace(1); }).Ok());

  const int kills = Scaled(500, 100);
  std::mt19937 rng(20261123);
  long long done = 1;  // replaces 0..done are known to be stored
  int oldOrNew = 0, partial = 0, lost = 0, keptOld = 0, reported = 0;
  unsigned windowUs = 20000;
  for (int k = 0; k < kills && partial + lost < 5; ++k) {
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    const pid_t pid = StartWriter(done + 1, fds);
    close(fds[1]);
    // The window follows how fast this machine (or sanitizer) writes,
    // aiming at 1-4 replaces a child.
    usleep(rng() % windowUs);
    kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << "writer status " << status;
    // The last number announced is the replace in flight; the ones before
    // it returned.
    long long j = 0, inFlight = done + 1;
    while (read(fds[0], &j, sizeof j) == sizeof j) inFlight = j;
    close(fds[0]);
    const int made = static_cast<int>(inFlight - done - 1);
    reported += made;
    if (made == 0) windowUs += windowUs / 16;
    if (made >= 4 && windowUs > 2000) windowUs -= windowUs / 8;

    const std::string seen = ReadInFreshProcess(), old = After(inFlight - 1);
    const bool isNew = seen == After(inFlight);
    done = inFlight - !isNew;
    keptOld += seen == old;
    oldOrNew += isNew || seen == old;
    if (!isNew && seen != old) {
      (seen.find("torn") != std::string::npos ? partial : lost)++;
      ADD_FAILURE() << "kill " << k << ": store holds " << seen << ", expected " << old
                    << " or the replace in flight";
    }
  }
  ReportFigures("kill-loop",
                "kill-loop: %d kills, old-or-new %d, partial %d, lost %d (%d replaces returned; "
                "the one in flight kept the old list %d times)",
                kills, oldOrNew, partial, lost, reported, keptOld);
  EXPECT_EQ(oldOrNew, kills);
}

}  // namespace karst_reliability
