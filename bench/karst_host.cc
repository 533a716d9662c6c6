// One host of the many-host benchmark (bench/hosts.py): a program that links
// the library and keeps its copy of the catalogue current, as a host agent
// would, against the store TAVO_CONFIGSTORE_PATH names.
//
//   karst_host fill N              writes karst_bench's catalogue of N
//   karst_host poll T OUT          GetDbHash every T seconds
//   karst_host watch OUT           GetDbHash at each change WaitForChange reports
//   karst_host replace N T OUT     replaces the N policies every T seconds
//   karst_host repeat KIND N [THREADS [PAUSE_MS]] OUT
//                                  N calls back to back (from THREADS
//                                  threads, 1 unless given; each pausing
//                                  PAUSE_MS after each call), KIND one of:
//     dbhash        GetDbHash
//     both          the two collections GetDbHash digests, listed in one
//                   call of the store, as a GetDbHash that read them
//                   together would
//     range         a linearizable Range of one key on the locator's first
//                   member, through gRPC alone (EtcdFloor.h)
//     serializable  the same, serializable
//
// poll, watch and replace run until the file OUT.stop exists. Each call is a line of
// OUT: "call START_S ELAPSED_MS CPU_MS CHANGED", START_S the wall clock
// (seconds since the epoch) when it began, CPU_MS the process's CPU time
// over all its threads while it ran, CHANGED 1 when the digests differ from
// the previous call's. The first call is a cold read ("cold"); a call that
// failed is "error", with the message after it. OUT.ready appears once the
// first call is done. At the end: "end CPU_MS RSS_KB",
// the whole run's CPU time and the peak resident set.
//
// "repeat" makes one call first in each thread (the cold read, or
// connecting), then creates OUT.ready and waits for OUT.go, so that the
// driver can read the cluster's counters around the N calls alone; then it
// writes "repeat ELAPSED_MS CPU_MS N" to OUT.

#include <sys/resource.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <functional>
#include <memory>
#include <mutex>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "BenchData.h"
#include "EtcdFloor.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoKarst/KarstLib.h"

namespace {

using TavoKarst::KarstLib;
using Clock = std::chrono::steady_clock;

double CpuMs() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return (usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1e3 +
         (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e3;
}

double WallSeconds() {
  timeval now{};
  gettimeofday(&now, nullptr);
  return now.tv_sec + now.tv_usec / 1e6;
}

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// The calls of one run, written as they are made.
class Log {
 public:
  explicit Log(const std::string& out) : out_(out), file_(out) {}

  // Runs "call", which returns the digests, and writes its line.
  template <typename Call>
  void Time(const Call& call) {
    const double wall = WallSeconds();
    const double cpu = CpuMs();
    const auto start = Clock::now();
    std::pair<std::string, std::string> digests;
    std::string error;
    try {
      digests = call();
    } catch (const TavoConfigStore::ConfigStoreException& e) {
      error = e.what();
    }
    const double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
    const double cpuMs = CpuMs() - cpu;
    char line[160];
    std::snprintf(line, sizeof line, "%s %.6f %.3f %.3f %d", error.empty() ? "call" : "error", wall,
                  ms, cpuMs, !first_ && digests != last_);
    if (error.empty() && first_) std::memcpy(line, "cold", 4);
    file_ << line << (error.empty() ? "" : " ") << error << "\n" << std::flush;
    if (!error.empty()) return;
    if (first_) std::ofstream(out_ + ".ready") << "ready\n";
    first_ = false;
    last_ = std::move(digests);
  }

  bool Stopped() const { return Exists(out_ + ".stop"); }

  ~Log() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    file_ << "end " << CpuMs() << " " << usage.ru_maxrss << "\n";
  }

 private:
  std::string out_;
  std::ofstream file_;
  bool first_ = true;
  std::pair<std::string, std::string> last_;
};

// Sleeps until "until" or until the run is stopped, checking every 100 ms.
bool SleepUntil(Clock::time_point until, const Log& log) {
  while (Clock::now() < until) {
    if (log.Stopped()) return false;
    std::this_thread::sleep_for(
        std::min<Clock::duration>(until - Clock::now(), std::chrono::milliseconds(100)));
  }
  return !log.Stopped();
}

// GetDbHash every "period", starting at a random point of the first period
// so that the hosts' calls spread over it.
void Poll(double periodSeconds, const std::string& out) {
  Log log(out);
  const auto period =
      std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(periodSeconds));
  std::mt19937_64 random(std::random_device{}());
  auto next = Clock::now() + Clock::duration(random() % (period.count() + 1));
  while (SleepUntil(next, log)) {
    log.Time([] { return KarstLib::GetDbHash(); });
    next += period;
    if (next < Clock::now()) next = Clock::now();  // behind: no burst to catch up
  }
}

void Watch(const std::string& out) {
  Log log(out);
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  log.Time([] { return KarstLib::GetDbHash(); });
  while (!log.Stopped()) {
    if (store->WaitForChange(500)) log.Time([] { return KarstLib::GetDbHash(); });
  }
}

// Policy 0's generation number moves with each replace, so that every
// replace changes the policies' digest.
void Replace(std::size_t n, double periodSeconds, const std::string& out) {
  Log log(out);
  std::vector<TavoKarst::KarstPolicyInfo> policies = karst_bench::Policies(n);
  const auto period =
      std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(periodSeconds));
  auto next = Clock::now();
  while (SleepUntil(next, log)) {
    log.Time([&] {
      ++policies[0].generation_number;
      KarstLib::AddPolicyInfo(policies);
      return std::make_pair(std::to_string(policies[0].generation_number), std::string());
    });
    next += period;
  }
}

// The first member and the prefix of an etcd locator
// ("etcd://HOST:PORT[,...]/PREFIX[?...]"); the benchmark's locators carry
// no user.
std::pair<std::string, std::string> FirstMemberAndPrefix(const std::string& locator) {
  const std::size_t hosts = locator.find("://");
  if (hosts == std::string::npos) throw std::runtime_error("not an etcd locator: " + locator);
  const std::size_t path = locator.find('/', hosts + 3);
  const std::size_t end = locator.find_first_of(",/", hosts + 3);
  if (path == std::string::npos) throw std::runtime_error("no prefix in " + locator);
  return {locator.substr(hosts + 3, end - hosts - 3),
          locator.substr(path + 1, locator.find('?', path) - path - 1)};
}

// One caller of "kind": GetDbHash through the thread's own store, or a
// Range through a channel of its own.
std::function<void()> Caller(const std::string& kind) {
  if (kind == "dbhash") return [] { KarstLib::GetDbHash(); };
  if (kind == "both") {
    // The library's two collections: the key left open names both.
    return [] {
      TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace)
          ->GetObjects(std::make_shared<TavoConfigStore::FilterSpecObject>(
              TavoConfigStore::ConfigStoreObjectId("", "storage", "tavo")));
    };
  }
  if (kind != "range" && kind != "serializable") {
    throw std::runtime_error("unknown kind of call: " + kind);
  }
  const char* locator = std::getenv("TAVO_CONFIGSTORE_PATH");
  const auto [member, prefix] = FirstMemberAndPrefix(locator ? locator : "");
  auto range = std::make_shared<karst_bench::OneKeyRange>(member, "/" + prefix + "/",
                                                          kind == "serializable");
  return [range] { range->Read(); };
}

// "n" calls in all, shared among "threads" threads, each a caller of its
// own as another host would be, so that their requests reach etcd at once;
// each thread pauses "pauseMs" after each call.
void Repeat(const std::string& kind, std::size_t n, std::size_t threads, int pauseMs,
            const std::string& out) {
  std::atomic<std::size_t> ready{0};
  std::atomic<bool> go{false};
  std::atomic<bool> failed{false};
  std::string failure;
  std::mutex failureMu;
  std::vector<std::thread> callers;
  for (std::size_t t = 0; t < threads; ++t) {
    callers.emplace_back([&, t] {
      try {
        const std::function<void()> call = Caller(kind);
        call();  // the cold read, or connecting
        ++ready;
        while (!go) std::this_thread::sleep_for(std::chrono::milliseconds(1));
        for (std::size_t i = t; i < n && !failed; i += threads) {
          call();
          std::this_thread::sleep_for(std::chrono::milliseconds(pauseMs));
        }
      } catch (const std::exception& e) {
        std::lock_guard<std::mutex> lock(failureMu);
        failure = e.what();
        failed = true;
        ++ready;
      }
    });
  }
  while (ready < threads) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  if (!failed) std::ofstream(out + ".ready") << "ready\n";
  while (!failed && !Exists(out + ".go"))
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  const double cpu = CpuMs();
  const auto start = Clock::now();
  go = true;
  for (std::thread& caller : callers) caller.join();
  if (failed) throw std::runtime_error(failure);
  const double ms = std::chrono::duration<double, std::milli>(Clock::now() - start).count();
  std::ofstream(out) << "repeat " << ms << " " << CpuMs() - cpu << " " << n << "\n";
}

int Usage() {
  std::fprintf(stderr,
               "usage: karst_host fill N | poll SECONDS OUT | watch OUT | replace N SECONDS OUT"
               " | repeat dbhash|both|range|serializable N [THREADS [PAUSE_MS]] OUT\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  const std::string mode = argc > 1 ? argv[1] : "";
  try {
    if (mode == "fill" && argc == 3) {
      const std::size_t n = std::stoul(argv[2]);
      KarstLib::AddPolicyInfo(karst_bench::Policies(n));
      KarstLib::AddDatastoreInfo(karst_bench::Datastores(n));
    } else if (mode == "poll" && argc == 4) {
      Poll(std::stod(argv[2]), argv[3]);
    } else if (mode == "watch" && argc == 3) {
      Watch(argv[2]);
    } else if (mode == "replace" && argc == 5) {
      Replace(std::stoul(argv[2]), std::stod(argv[3]), argv[4]);
    } else if (mode == "repeat" && argc >= 5 && argc <= 7) {
      Repeat(argv[2], std::stoul(argv[3]), argc >= 6 ? std::stoul(argv[4]) : 1,
             argc == 7 ? std::stoi(argv[5]) : 0, argv[argc - 1]);
    } else {
      return Usage();
    }
  } catch (const std::exception& e) {
    std::fprintf(stderr, "karst_host %s: %s\n", mode.c_str(), e.what());
    return 1;
  }
  return 0;
}
