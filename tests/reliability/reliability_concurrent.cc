// Four writer and four reader processes on one store file for about a
// minute, while writers are SIGKILLed (and restarted) or SIGSTOPped for a
// while and continued. Every list a writer writes names the writer, its
// round and its length in each record, so a reader can tell a whole list
// from a torn one and can check the list was really written: torn reads must
// be 0, and so must lists no writer started.

#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoKarst/KarstLib.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

constexpr int kWriters = 4;
constexpr int kReaders = 4;
constexpr long long kIncarnationRounds = 1000000;

// Durations in a log scale, eight buckets per doubling, in shared memory so a
// killed process keeps what it measured.
struct Histogram {
  static constexpr int kBuckets = 256;
  std::atomic<long long> counts[kBuckets];
  void Add(double micros) {
    int b = static_cast<int>(std::log2(micros + 1) * 8);
    counts[std::min(std::max(b, 0), kBuckets - 1)].fetch_add(1, std::memory_order_relaxed);
  }
  // The upper bound, in milliseconds, of the bucket holding the quantile.
  double QuantileMs(double q) const {
    long long total = 0;
    for (const auto& c : counts) total += c.load();
    long long seen = 0;
    for (int b = 0; b < kBuckets; ++b) {
      seen += counts[b].load();
      if (total > 0 && seen >= q * total) return (std::exp2((b + 1) / 8.0) - 1) / 1000.0;
    }
    return 0;
  }
  double MaxMs() const { return QuantileMs(1.0); }
};

struct Shared {
  std::atomic<bool> stop;
  std::atomic<long long> started[kWriters];  // the last round each writer began
  std::atomic<long long> commits, busy, writeErrors;
  std::atomic<long long> reads, torn, phantom, empty, readErrors;
  Histogram replaceWait, readWait;
  char lastProblem[256];
  std::atomic<bool> problemNoted;
};

void Note(Shared* s, const std::string& what) {
  bool expected = false;
  if (s->problemNoted.compare_exchange_strong(expected, true)) {
    std::snprintf(s->lastProblem, sizeof s->lastProblem, "%s", what.c_str());
  }
}

double Micros(std::chrono::steady_clock::time_point since) {
  return std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - since)
      .count();
}

[[noreturn]] void Writer(Shared* s, int writer, int incarnation) {
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  for (long long r = incarnation * kIncarnationRounds; !s->stop.load(); ++r) {
    const Tag tag{writer, r};
    long long prev = s->started[writer].load();
    while (prev < r && !s->started[writer].compare_exchange_weak(prev, r)) {
    }
    const auto start = std::chrono::steady_clock::now();
    try {
      if (r % 2 == 0) {
        KarstLib::AddPolicyInfo(PoliciesFor(tag));
      } else {
        KarstLib::AddDatastoreInfo(DatastoresFor(tag));
      }
      s->commits.fetch_add(1);
    } catch (const ConfigStoreException& e) {
      if ((e.Code() & 0xff) == SQLITE_BUSY) {
        s->busy.fetch_add(1);
      } else {
        s->writeErrors.fetch_add(1);
        Note(s, std::string("writer: ") + e.what());
      }
    } catch (...) {
      s->writeErrors.fetch_add(1);
    }
    s->replaceWait.Add(Micros(start));
  }
  _exit(0);
}

void Check(Shared* s, const Observed& o) {
  s->reads.fetch_add(1);
  if (o.kind == Observed::kTorn) {
    s->torn.fetch_add(1);
    Note(s, "torn list");
  } else if (o.kind == Observed::kEmpty) {
    s->empty.fetch_add(1);
  } else if (o.tag.writer < 0 || o.tag.writer >= kWriters ||
             o.tag.round > s->started[o.tag.writer].load()) {
    s->phantom.fetch_add(1);
    Note(s, "a list no writer started: " + o.Describe());
  }
}

[[noreturn]] void Reader(Shared* s) {
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  for (long long i = 0; !s->stop.load(); ++i) {
    const auto start = std::chrono::steady_clock::now();
    try {
      if (i % 2 == 0) {
        Check(s, Classify(KarstLib::ListPolicyInfo()));
      } else {
        Check(s, Classify(KarstLib::ListDatastoreInfo()));
      }
    } catch (const ConfigStoreException& e) {
      s->readErrors.fetch_add(1);
      Note(s, std::string("reader: ") + e.what());
    }
    s->readWait.Add(Micros(start));
    // Leaves the CPUs some room for the writers (and for whatever else runs).
    usleep(500);
  }
  _exit(0);
}

template <typename Body>
pid_t Spawn(Body body) {
  const pid_t pid = fork();
  if (pid == 0) body();
  return pid;
}

TEST(ConcurrentProcesses, WritersKilledAndStoppedReadersNeverSeeATornList) {
  ScratchDir dir;
  UseStoreAt(dir.File("store.db"));
  void* memory =
      mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(memory, MAP_FAILED);
  Shared* s = new (memory) Shared();

  const int seconds = Scaled(60, 12);
  std::vector<pid_t> writers(kWriters), readers(kReaders);
  std::vector<int> incarnation(kWriters, 0);
  for (int w = 0; w < kWriters; ++w) writers[w] = Spawn([&] { Writer(s, w, 0); });
  for (int r = 0; r < kReaders; ++r) readers[r] = Spawn([&] { Reader(s); });

  std::mt19937 rng(42);
  int kills = 0, stops = 0;
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
  while (std::chrono::steady_clock::now() < end) {
    std::this_thread::sleep_for(std::chrono::milliseconds(300 + rng() % 600));
    const int w = static_cast<int>(rng() % kWriters);
    if (rng() % 2 == 0) {
      kill(writers[w], SIGKILL);
      waitpid(writers[w], nullptr, 0);
      ++kills;
      const int next = ++incarnation[w];
      writers[w] = Spawn([&] { Writer(s, w, next); });
    } else {
      // Stopped while it may hold the write lock: the others wait for it.
      kill(writers[w], SIGSTOP);
      ++stops;
      std::this_thread::sleep_for(std::chrono::milliseconds(100 + rng() % 700));
      kill(writers[w], SIGCONT);
    }
  }
  s->stop.store(true);
  int abnormal = 0;
  for (pid_t pid : writers) {
    kill(pid, SIGCONT);
    int status = 0;
    waitpid(pid, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) ++abnormal;
  }
  for (pid_t pid : readers) {
    int status = 0;
    waitpid(pid, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) ++abnormal;
  }

  const Verdict final = VerifyInFreshProcess();
  char line[640];
  std::snprintf(line, sizeof line,
                "concurrent: %d writers + %d readers for %d s, %d writer kills, %d stops: "
                "reads %lld, torn %lld, unwritten lists %lld, empty %lld, read errors "
                "%lld; commits %lld, busy errors %lld, other write errors %lld; p99 wait: "
                "replace %.1f ms, listing %.1f ms (longest %.0f ms, %.0f ms); final store %s",
                kWriters, kReaders, seconds, kills, stops, s->reads.load(), s->torn.load(),
                s->phantom.load(), s->empty.load(), s->readErrors.load(), s->commits.load(),
                s->busy.load(), s->writeErrors.load(), s->replaceWait.QuantileMs(0.99),
                s->readWait.QuantileMs(0.99), s->replaceWait.MaxMs(), s->readWait.MaxMs(),
                final.Describe().c_str());
  ReportFigures("concurrent", line);
  if (s->problemNoted.load()) std::cout << "first problem: " << s->lastProblem << std::endl;

  EXPECT_EQ(s->torn.load(), 0);
  EXPECT_EQ(s->phantom.load(), 0);
  EXPECT_EQ(s->readErrors.load(), 0);
  EXPECT_EQ(s->writeErrors.load(), 0);
  EXPECT_EQ(abnormal, 0);
  EXPECT_GT(s->commits.load(), 0);
  EXPECT_GT(s->reads.load(), 0);
  ASSERT_TRUE(final.ok) << final.error;
  EXPECT_EQ(final.policies.kind, Observed::kWhole);
  EXPECT_EQ(final.datastores.kind, Observed::kWhole);
  munmap(memory, sizeof(Shared));
}

}  // namespace
}  // namespace karst_reliability
