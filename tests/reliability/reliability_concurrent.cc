// Four writer and four reader processes on one store file for about a
// minute, while writers are SIGKILLed (and restarted) or SIGSTOPped for a
// while and continued. Every record names its writer, round and list length,
// so a reader can tell a whole list from a torn one, and shared memory holds
// the last round each writer began, so a reader can tell a list nobody wrote.

#include "reliability_util.h"

namespace karst_reliability {

constexpr int kWriters = 4, kReaders = 4;

struct Shared {
  std::atomic<bool> stop;
  std::atomic<long long> started[kWriters];  // the last round each writer began
  std::atomic<long long> commits, reads, torn, unwritten, empty, busy, errors;
};

// Process "id" below kWriters replaces a collection each round from "first"
// on; the others list one each round.
[[noreturn]] void Work(Shared* s, int id, long long first) {
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  for (long long r = first; !s->stop.load(); ++r) {
    try {
      if (id < kWriters) {
        s->started[id] = r;
        if (r % 2 == 0) KarstLib::AddPolicyInfo(PoliciesFor(Tag{id, r}));
        if (r % 2 == 1) KarstLib::AddDatastoreInfo(DatastoresFor(Tag{id, r}));
        ++s->commits;
        continue;
      }
      const std::string seen = r % 2 == 0 ? Classify(KarstLib::ListPolicyInfo())
                                          : Classify(KarstLib::ListDatastoreInfo());
      Tag t;
      ++s->reads;
      if (seen.empty()) {
        ++s->empty;
      } else if (std::sscanf(seen.c_str(), "w=%d r=%lld", &t.writer, &t.round) != 2) {
        ++s->torn;
      } else if (t.writer < 0 || t.writer >= kWriters || t.round > s->started[t.writer]) {
        ++s->unwritten;
      }
      usleep(500);  // leaves the CPUs some room for the writers
    } catch (const ConfigStoreException& e) {
      // A caller starved past the store's busy timeout gets SQLITE_BUSY and
      // the catalogue stays as it was: allowed, and counted.
      ++(e.Code() % 256 == SQLITE_BUSY ? s->busy : s->errors);
    }
  }
  _exit(0);
}

TEST(ConcurrentProcesses, WritersKilledAndStoppedReadersNeverSeeATornList) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  // In shared memory, so a killed process keeps what it counted.
  Shared* s =
      new (mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0))
          Shared();

  const int seconds = Scaled(60, 12);
  auto spawn = [s](int id, long long first) {
    const pid_t pid = fork();
    if (pid == 0) Work(s, id, first);
    return pid;
  };
  std::vector<pid_t> pids;
  for (int id = 0; id < kWriters + kReaders; ++id) pids.push_back(spawn(id, 0));

  std::mt19937 rng(42);
  int kills = 0, stops = 0;
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
  while (std::chrono::steady_clock::now() < end) {
    std::this_thread::sleep_for(std::chrono::milliseconds(300 + rng() % 600));
    const int w = static_cast<int>(rng() % kWriters);
    if (rng() % 2 == 0) {
      kill(pids[w], SIGKILL);
      waitpid(pids[w], nullptr, 0);
      // A new incarnation counts its rounds from a million further on.
      pids[w] = spawn(w, ++kills * 1000000LL);
    } else {
      // Stopped while it may hold the write lock: the others wait for it.
      kill(pids[w], SIGSTOP);
      ++stops;
      std::this_thread::sleep_for(std::chrono::milliseconds(100 + rng() % 700));
      kill(pids[w], SIGCONT);
    }
  }
  s->stop.store(true);
  int abnormal = 0;
  for (pid_t pid : pids) {
    int status = 0;
    waitpid(pid, &status, 0);
    abnormal += !WIFEXITED(status) || WEXITSTATUS(status) != 0;
  }

  const std::string final = ReadInFreshProcess();
  ReportFigures("concurrent",
                "concurrent: %d writers + %d readers for %d s, %d writer kills, %d stops: reads "
                "%lld, torn %lld, unwritten lists %lld, empty %lld; commits %lld; busy errors "
                "%lld, other errors %lld; final store %s",
                kWriters, kReaders, seconds, kills, stops, s->reads.load(), s->torn.load(),
                s->unwritten.load(), s->empty.load(), s->commits.load(), s->busy.load(),
                s->errors.load(), final.c_str());
  EXPECT_EQ(s->torn.load() + s->unwritten.load() + s->errors.load() + abnormal, 0);
  EXPECT_TRUE(s->commits.load() > 0 && s->reads.load() > 0);
  // Both collections whole.
  EXPECT_TRUE(final.find("torn") == std::string::npos && final.find(" | w=") != std::string::npos &&
              final.rfind("w=", 0) == 0)
      << final;
  munmap(s, sizeof(Shared));
}

}  // namespace karst_reliability
