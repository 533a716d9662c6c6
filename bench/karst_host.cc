// One host of the many-host benchmark (bench/hosts.py): a program that links
// the library and keeps its copy of the catalogue current, as a host agent
// would, against the store TAVO_CONFIGSTORE_PATH names.
//
//   karst_host fill N              writes karst_bench's catalogue of N
//   karst_host poll T OUT          GetDbHash every T seconds
//   karst_host watch OUT           GetDbHash at each change WaitForChange reports
//   karst_host replace N T OUT     replaces the N policies every T seconds
//
// The last three run until the file OUT.stop exists. Each call is a line of
// OUT: "call START_S ELAPSED_MS CPU_MS CHANGED", START_S the wall clock
// (seconds since the epoch) when it began, CPU_MS the process's CPU time
// over all its threads while it ran, CHANGED 1 when the digests differ from
// the previous call's. The first call is a cold read ("cold"); a call that
// failed is "error", with the message after it. OUT.ready appears once the
// first call is done. At the end: "end CPU_MS RSS_KB",
// the whole run's CPU time and the peak resident set.

#include <sys/resource.h>
#include <sys/time.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <fstream>
#include <random>
#include <string>
#include <thread>
#include <utility>

#include "BenchData.h"
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

int Usage() {
  std::fprintf(stderr,
               "usage: karst_host fill N | poll SECONDS OUT | watch OUT | replace N SECONDS OUT\n");
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
    } else {
      return Usage();
    }
  } catch (const std::exception& e) {
    std::fprintf(stderr, "karst_host %s: %s\n", mode.c_str(), e.what());
    return 1;
  }
  return 0;
}
