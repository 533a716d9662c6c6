// Three etcd members on loopback. A writer replaces both catalogues through
// the library while the leader is SIGKILLed and restarted, again and again;
// then karstctl imports are SIGKILLed mid-batch; then the clients' first
// member is stopped (SIGSTOP) for longer than the timeout; then the whole
// cluster goes down. Readers (one on each member, one on all) list
// throughout. A listing must be one whole list, no older than the last
// replace that returned before it began and no newer than the last one begun
// by its end, however long the reader has kept a listing it read before; a
// replace must go through once a leader is back; a dead writer's generation
// must stay unseen and go once its lease has; a stopped first member must
// not fail reads or writes; no store call may take longer than its timeout
// and a small margin; and with no member up every operation must fail in
// bounded time, naming the cluster.

#include <fcntl.h>
#include <sys/types.h>

#include <algorithm>
#include <cstdio>
#include <functional>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>

#include "EtcdCluster.h"
#include "EtcdKeys.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "reliability_util.h"

#ifndef KARSTCTL_BINARY
#error "KARSTCTL_BINARY must name the built karstctl"
#endif

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStore;
using TavoConfigStore::ConfigStoreObject;
using TavoConfigStore::ConfigStoreObjectId;
using TavoConfigStore::FilterSpecObject;
using TavoConfigStore::kErrorEtcdBase;
using TavoConfigStore::OpenStore;
using Clock = std::chrono::steady_clock;

const std::string kPrefix = "cat";
constexpr int kPolicies = 300;    // about four etcd requests a replace
constexpr int kDatastores = 150;  // two
constexpr double kDownBound = 8;  // seconds; each request gives up after 5
// What a store call may take beyond its timeout: settling a failed switch
// may take up to a second more, and the machine is shared.
constexpr int kMarginMs = 2000;
constexpr int kTimeoutMs = 5000;           // the locators' default
constexpr std::size_t kKeptVersions = 10;  // the stores' default depth

// The library finds its store through the one installed for the process;
// this one hands each call to the calling thread's own connection, and
// times it against that connection's timeout.
thread_local std::shared_ptr<ConfigStore> tStore;
thread_local int tTimeoutMs = kTimeoutMs;

std::shared_ptr<ConfigStore> Open(const std::string& locator, int timeoutMs = kTimeoutMs) {
  tTimeoutMs = timeoutMs;
  return OpenStore(locator +
                   (timeoutMs == kTimeoutMs ? "" : "?timeout=" + std::to_string(timeoutMs)));
}

// The slowest store call, and those past their timeout and the margin.
struct CallTimes {
  std::mutex mu;
  double slowest = 0;
  std::vector<std::string> over;
  void Add(const char* what, double seconds) {
    std::lock_guard<std::mutex> lock(mu);
    slowest = std::max(slowest, seconds);
    if (seconds * 1000 > tTimeoutMs + kMarginMs) {
      // Not std::to_string(double), which hands vsnprintf to a template
      // where fortification cannot reach it.
      char text[32];
      std::snprintf(text, sizeof text, " %.2f s", seconds);
      over.push_back(what + std::string(text));
    }
  }
} gCalls;

class ThreadsOwnStore final : public ConfigStore {
  // Times "call", which returns what the store returns.
  template <typename Call>
  static auto Timed(const char* what, const Call& call) {
    struct Clocked {
      const char* what;
      Clock::time_point start = Clock::now();
      ~Clocked() { gCalls.Add(what, std::chrono::duration<double>(Clock::now() - start).count()); }
    } clocked{what};
    return call();
  }

 public:
  std::shared_ptr<ConfigStoreObject> GetObject(const ConfigStoreObjectId& id) override {
    return Timed("GetObject", [&] { return tStore->GetObject(id); });
  }
  void SetObject(const std::shared_ptr<ConfigStoreObject>& o, std::int32_t& flags) override {
    Timed("SetObject", [&] { tStore->SetObject(o, flags); });
  }
  void DeleteObjects(const std::shared_ptr<FilterSpecObject>& f) override {
    Timed("DeleteObjects", [&] { tStore->DeleteObjects(f); });
  }
  std::vector<std::shared_ptr<ConfigStoreObject>> GetObjects(
      const std::shared_ptr<FilterSpecObject>& f) override {
    return Timed("GetObjects", [&] { return tStore->GetObjects(f); });
  }
  void BeginTransaction() override { tStore->BeginTransaction(); }
  void CommitTransaction() override {
    Timed("CommitTransaction", [&] { tStore->CommitTransaction(); });
  }
  void AbortTransaction() override { tStore->AbortTransaction(); }
};

// Counts by name, from any thread.
class Tally {
 public:
  void Add(const std::string& name) {
    std::lock_guard<std::mutex> lock(mu_);
    ++counts_[name];
  }
  int Of(const std::string& name) {
    std::lock_guard<std::mutex> lock(mu_);
    return counts_[name];
  }
  std::string Text() {
    std::lock_guard<std::mutex> lock(mu_);
    std::string text;
    for (const auto& [name, n] : counts_)
      text += (text.empty() ? "" : ", ") + name + " x" + std::to_string(n);
    return text.empty() ? "none" : text;
  }

 private:
  std::mutex mu_;
  std::map<std::string, int> counts_;
};

// Replace j goes to the policies when j is even, else to the datastores.
void Replace(long long j) {
  if (j % 2 == 0) KarstLib::AddPolicyInfo(PoliciesFor(Tag{0, j, kPolicies}));
  if (j % 2 == 1) KarstLib::AddDatastoreInfo(DatastoresFor(Tag{0, j, kDatastores}));
}

// The rounds a listing of each collection may show.
struct Bounds {
  long long low[2];
  long long high[2];
};

// The writers' progress: the last replace of each collection that returned,
// and the last begun.
struct Progress {
  std::atomic<long long> done[2] = {{0}, {1}};
  std::atomic<long long> begun{1};
  std::atomic<long long> replaced{0};
  // While replaces run: none older than the last that returned, none past
  // the last begun.
  Bounds Now() const { return {{done[0], done[1]}, {begun, begun}}; }
  // With none running: exactly the last that returned.
  Bounds Settled() const { return {{done[0], done[1]}, {done[0], done[1]}}; }
  void Returned(long long j) {
    done[j % 2] = j;
    ++replaced;
  }
};

// Lists both collections through the calling thread's store, with the lower
// bounds taken before and the upper ones after; counts what is wrong (torn,
// stale, unwritten) and says what it is, "" when both are right.
std::string CheckListing(const std::function<Bounds()>& bounds, Tally& wrong) {
  const Bounds before = bounds();
  const std::string seen[2] = {Classify(KarstLib::ListPolicyInfo()),
                               Classify(KarstLib::ListDatastoreInfo())};
  const Bounds after = bounds();
  std::string report;
  for (int c : {0, 1}) {
    Tag t;
    const char* verdict = std::sscanf(seen[c].c_str(), "w=%d r=%lld", &t.writer, &t.round) != 2
                              ? "torn"
                          : t.round < before.low[c]                     ? "stale"
                          : t.round > after.high[c] || t.round % 2 != c ? "unwritten"
                                                                        : nullptr;
    if (verdict == nullptr) continue;
    wrong.Add(verdict);
    report += std::string(verdict) + (c ? " datastores \"" : " policies \"") + seen[c] +
              "\" (from " + std::to_string(before.low[c]) + " to " + std::to_string(after.high[c]) +
              "); ";
  }
  return report;
}

// One member's locator, or (member -1) all members', "first" listed first.
std::string MemberLocator(const EtcdCluster& etcd, int member, int first = 0) {
  std::string endpoints = etcd.Endpoint(member < 0 ? first : member);
  for (int m = 0; m < 3 && member < 0; ++m) {
    if (m != first) endpoints += "," + etcd.Endpoint(m);
  }
  return "etcd://" + endpoints + "/" + kPrefix;
}

// The generations etcd holds under "area" ("g/", "r/" or "w/").
// Read from the first member, which is up whenever this is asked; quick
// enough to be polled while a writer works.
std::set<std::string> Generations(const EtcdCluster& etcd, const std::string& area) {
  const std::string root = karst_test::StoreRoot(kPrefix) + area;
  std::set<std::string> gens;
  for (const std::string& key : karst_test::EtcdKeys(etcd.Endpoint(0)).Keys(root)) {
    gens.insert(key.substr(root.size(), 16));
  }
  return gens;
}

// What a writer's lease would do after 60 s.
void RevokeLeases(const EtcdCluster& etcd) {
  std::istringstream out(etcd.Etcdctl({"lease", "list"}));
  std::string id;
  std::getline(out, id);  // "found N leases"
  while (out >> id) etcd.Etcdctl({"lease", "revoke", id});
}

// Nothing of the generations "gone" is left, nor of any writer, and no more
// generations than the kept versions can name: one a collection and version.
bool NoLeftovers(const EtcdCluster& etcd, const std::set<std::string>& gone) {
  const std::set<std::string> registered = Generations(etcd, "r/");
  const bool anyGone = std::any_of(gone.begin(), gone.end(),
                                   [&](const std::string& gen) { return registered.count(gen); });
  return !anyGone && registered.size() <= 2 * kKeptVersions &&
         Generations(etcd, "g/") == registered && Generations(etcd, "w/").empty();
}

// karstctl with "args", its output to the files named; dies with this thread.
pid_t StartKarstctl(const std::vector<std::string>& args, const std::string& out,
                    const std::string& err = "/dev/null") {
  const pid_t pid = fork();
  if (pid != 0) return pid;
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  dup2(open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDOUT_FILENO);
  dup2(open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDERR_FILENO);
  std::vector<std::string> argv = {KARSTCTL_BINARY};
  argv.insert(argv.end(), args.begin(), args.end());
  Exec(argv);
}

// Writes to "json", by karstctl export of the SQLite store "db", a
// catalogue of 3000 policies of round "j" and 400 datastores of round j + 1.
void ExportLargeCatalogue(long long j, const std::string& db, const std::string& json) {
  tStore = TavoConfigStore::NewSqliteStore(db);
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{0, j, 3000}));
  KarstLib::AddDatastoreInfo(DatastoresFor(Tag{0, j + 1, 400}));
  int status = 0;
  const pid_t exporter = StartKarstctl({"--store", db, "export"}, json);
  ASSERT_TRUE(waitpid(exporter, &status, 0) == exporter && status == 0);
}

template <typename Ready>
bool WaitUntil(Ready ready, std::chrono::seconds limit) {
  for (const auto end = Clock::now() + limit; !ready(); usleep(20000)) {
    if (Clock::now() > end) return false;
  }
  return true;
}

// Threads that run until Stop, which an early end of the test calls too.
class Threads {
 public:
  ~Threads() { Stop(); }
  template <typename Body>
  void Start(Body body) {
    threads_.emplace_back([this, body] {
      while (!stop_) body();
    });
  }
  void Stop() {
    stop_ = true;
    for (std::thread& t : threads_) {
      if (t.joinable()) t.join();
    }
  }

 private:
  std::atomic<bool> stop_{false};
  std::vector<std::thread> threads_;
};

TEST(EtcdFailover, LeaderKillsDeadWritersAndAClusterDown) {
  const auto start = Clock::now();
  EtcdCluster etcd({3});
  TavoConfigStore::SetGlobalStore(std::make_shared<ThreadsOwnStore>());
  Progress progress;
  const auto now = [&] { return progress.Now(); };
  const auto replaceNext = [&] {
    tStore = Open(MemberLocator(etcd, -1));
    Replace(++progress.begun);
    progress.Returned(progress.begun);
  };
  tStore = Open(MemberLocator(etcd, -1));
  Replace(0), Replace(1);
  std::mt19937 rng(20261124);

  // Readers 0-2 on one member each, 3 on all; a second's timeout keeps the
  // one whose member is down trying. Each names the members its own way, and
  // so keeps listings of its own between reads, as a reader on another host
  // would: a listing kept from before a replace must not outlive it.
  std::atomic<long long> listings{0}, readErrors{0};
  Tally wrong;
  Threads readers;
  for (int r = 0; r < 4; ++r) {
    readers.Start([&, r] {
      if (!tStore) tStore = Open(MemberLocator(etcd, r < 3 ? r : -1, 1), 1000);
      try {
        EXPECT_EQ(CheckListing(now, wrong), "") << "reader " << r;
        ++listings;
      } catch (const ConfigStoreException&) {
        ++readErrors;
      }
      usleep(10000);  // leaves the two cores to the cluster and the writer now and then
    });
  }

  // The leader goes and comes back while the writer replaces.
  Tally writerErrors;
  Threads writer;
  writer.Start([&] {
    // A proposal lost with its leader goes unanswered: the request is sent
    // again, to the next member, until a new leader takes it.
    if (!tStore) tStore = Open(MemberLocator(etcd, -1));
    const long long j = ++progress.begun;
    try {
      Replace(j);
      progress.Returned(j);
    } catch (const ConfigStoreException& e) {
      writerErrors.Add(std::to_string(e.Code()));
      ADD_FAILURE() << "a replace failed though a leader was back within the timeout: " << e.what();
    }
    // Replaces back to back would saturate the two cores: a restarted member
    // applying the entries it missed would never catch up with the others.
    usleep(50000);
  });
  const int events = Scaled(30, 10);
  int memberChecks = 0;
  for (int e = 0; e < events; ++e) {
    const long long replaced = progress.replaced;
    ASSERT_TRUE(WaitUntil([&] { return progress.replaced > replaced; }, std::chrono::seconds(20)))
        << "no replace returned within 20 s after event " << e;
    usleep(rng() % 200000);
    const int leader = etcd.LeaderIndex();
    etcd.Kill(leader);
    usleep(rng() % 300000);
    etcd.Restart(leader);
    for (int m = 0; m < 3; ++m, ++memberChecks) {
      tStore = Open(MemberLocator(etcd, m));
      EXPECT_EQ(CheckListing(now, wrong), "") << "event " << e << ", member " << m;
    }
  }
  writer.Stop();
  // A replace that failed may have left its generation, on a lease, and may
  // still land (a timeout is no answer); once the leases are gone it cannot,
  // and a replace of each collection settles the catalogue.
  const std::set<std::string> failed = Generations(etcd, "w/");
  const std::size_t orphanedByFailures = failed.size();
  RevokeLeases(etcd);
  replaceNext(), replaceNext();
  EXPECT_TRUE(NoLeftovers(etcd, failed));

  // karstctl imports a large catalogue (both collections in one transaction)
  // and is SIGKILLed once its generations are registered, or a little later.
  // An import that commits before the kill is tried again with a shorter
  // delay: how long the batches take depends on the machine and the build.
  ScratchDir dir;
  const std::string big = dir.File("big.json");
  const int wanted = Scaled(3, 1);
  unsigned maxDelayUs = 200000;
  int imports = 0, midBatch = 0, keptOld = 0, leftAlone = 0, removed = 0;
  for (int k = 0; midBatch < wanted && k < 4 * wanted; ++k) {
    ++imports;
    const long long j = progress.begun + 1 + (progress.begun + 1) % 2;
    ExportLargeCatalogue(j, dir.File("big" + std::to_string(k) + ".db"), big);
    int status = 0;

    const Bounds old = progress.Settled();
    progress.begun = j + 1;
    const pid_t importer =
        StartKarstctl({"--store", etcd.Locator(kPrefix), "import", big}, "/dev/null");
    // An import may also end before its generations are seen.
    bool ended = false;
    ASSERT_TRUE(WaitUntil(
        [&] {
          ended = waitpid(importer, &status, WNOHANG) == importer;
          return ended || !Generations(etcd, "w/").empty();
        },
        std::chrono::seconds(30)));
    if (!ended) {
      usleep(rng() % maxDelayUs);
      kill(importer, SIGKILL);
      ASSERT_EQ(waitpid(importer, &status, 0), importer);
    }
    ASSERT_FALSE(WIFEXITED(status) && WEXITSTATUS(status) != 0) << "karstctl import failed";
    const std::set<std::string> orphans = Generations(etcd, "w/");
    if (orphans.empty()) {  // too late: it had committed
      progress.Returned(j), progress.Returned(j + 1);
      maxDelayUs = std::max(1000u, maxDelayUs / 4);
      continue;
    }
    ++midBatch;
    int whole = 0;
    for (int m = 0; m < 3; ++m) {
      tStore = Open(MemberLocator(etcd, m));
      const std::string report = CheckListing([&] { return old; }, wrong);
      EXPECT_EQ(report, "") << "import kill " << k << ", member " << m;
      whole += report.empty();
    }
    keptOld += whole == 3;
    // The next writer leaves a generation alone while its writer's lease
    // runs, and removes it once the lease has gone.
    replaceNext();
    const std::set<std::string> registered = Generations(etcd, "r/");
    leftAlone +=
        std::includes(registered.begin(), registered.end(), orphans.begin(), orphans.end());
    RevokeLeases(etcd);
    EXPECT_TRUE(Generations(etcd, "w/").empty());
    replaceNext();
    removed += NoLeftovers(etcd, orphans);
  }
  EXPECT_GT(midBatch, 0) << "no import was killed mid-batch";
  EXPECT_EQ(keptOld, midBatch);
  EXPECT_EQ(leftAlone, midBatch);
  EXPECT_EQ(removed, midBatch);

  // A follower that is every client's first member stops answering
  // (SIGSTOP) for longer than the timeout. An import, then a writer and a
  // reader, all with that member first, go on without a failure, each call
  // within its timeout; the import takes about a second more than with the
  // member up, not a timeout more.
  const int follower = (etcd.LeaderIndex() + 1) % 3;
  const std::string followerFirst = MemberLocator(etcd, -1, follower);
  const auto import = [&](int k) {
    const long long j = progress.begun + 1 + (progress.begun + 1) % 2;
    ExportLargeCatalogue(j, dir.File("paused" + std::to_string(k) + ".db"), big);
    int status = 0;
    progress.begun = j + 1;
    const auto start = Clock::now();
    const pid_t importer = StartKarstctl({"--store", followerFirst, "import", big}, "/dev/null",
                                         dir.File("import-errors"));
    EXPECT_EQ(waitpid(importer, &status, 0), importer);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0)
        << "import with member " << follower << " stopped: " << ReadFile(dir.File("import-errors"));
    progress.Returned(j), progress.Returned(j + 1);
    return std::chrono::duration<double>(Clock::now() - start).count();
  };
  const double importUp = import(0);
  const auto pausedAt = Clock::now();
  etcd.Pause(follower);
  const double importPaused = import(1);
  EXPECT_LT(importPaused, importUp + 1 + kMarginMs / 1000.0);
  std::atomic<long long> pausedListings{0};
  Tally pausedErrors;
  {
    Threads paused;
    paused.Start([&] {
      if (!tStore) tStore = Open(followerFirst);
      const long long j = ++progress.begun;
      try {
        Replace(j);
        progress.Returned(j);
      } catch (const ConfigStoreException& e) {
        pausedErrors.Add(e.what());
      }
    });
    paused.Start([&] {
      if (!tStore) tStore = Open(followerFirst);
      try {
        EXPECT_EQ(CheckListing(now, wrong), "") << "member " << follower << " stopped";
        ++pausedListings;
      } catch (const ConfigStoreException& e) {
        pausedErrors.Add(e.what());
      }
      usleep(10000);
    });
    std::this_thread::sleep_until(pausedAt + std::chrono::milliseconds(kTimeoutMs + 2000));
    // A slow build's import may have used up most of that: the member stays
    // stopped until the reader has listed too.
    WaitUntil([&] { return pausedListings > 0; }, std::chrono::seconds(20));
  }
  etcd.Resume(follower);
  EXPECT_EQ(pausedErrors.Text(), "none");
  EXPECT_GT(pausedListings, 0);
  readers.Stop();

  // A watch held on a member that is killed moves on to another: it goes
  // quiet again, and wakes at the next commit.
  tStore = Open(MemberLocator(etcd, -1, (follower + 1) % 3));
  const std::shared_ptr<ConfigStore> watcher = Open(followerFirst);
  watcher->WaitForChange(100);  // watching from here on, on the first member
  etcd.Kill(follower);
  const bool quiet =
      WaitUntil([&] { return !watcher->WaitForChange(1500); }, std::chrono::seconds(10));
  EXPECT_TRUE(quiet) << "the watch did not settle on another member";
  const auto replaced = Clock::now();
  replaceNext();
  EXPECT_TRUE(watcher->WaitForChange(5000));
  const double watchWoke = std::chrono::duration<double>(Clock::now() - replaced).count();
  EXPECT_LT(watchWoke, 2);
  etcd.Restart(follower);

  // The whole cluster down: every library call fails in bounded time, naming
  // the cluster. (karstctl turns such an error into its exit status, as
  // karstctl_test checks.)
  const Bounds last = progress.Settled();
  for (int m = 0; m < 3; ++m) etcd.Kill(m);
  const std::pair<const char*, std::function<void()>> calls[] = {
      {"Reset", [] { KarstLib::Reset(); }},
      {"AddPolicyInfo",
       [] {
         KarstLib::AddPolicyInfo(PoliciesFor(Tag{1, 1}));
       }},
      {"AddDatastoreInfo",
       [] {
         KarstLib::AddDatastoreInfo(DatastoresFor(Tag{1, 1}));
       }},
      {"ListPolicyInfo", [] { KarstLib::ListPolicyInfo(); }},
      {"ListDatastoreInfo", [] { KarstLib::ListDatastoreInfo(); }},
      {"GetPolicyBlobById", [] { KarstLib::GetPolicyBlobById("id-0", "ds-0"); }},
      {"GetCorraPolicyBlobById", [] { KarstLib::GetCorraPolicyBlobById("id-0"); }},
      {"GetCorraPolicyBlobByName", [] { KarstLib::GetCorraPolicyBlobByName("policy-0"); }},
      {"GetDefaultPolicyBlob", [] { KarstLib::GetDefaultPolicyBlob("ds-0"); }},
      {"GetDbHash", [] { KarstLib::GetDbHash(); }},
  };
  int downWrong = 0;
  double downSlowest = 0;
  for (const auto& [name, call] : calls) {
    tStore = Open(MemberLocator(etcd, -1));
    const auto begin = Clock::now();
    std::string error = "no store error";
    try {
      call();
    } catch (const ConfigStoreException& e) {
      error = e.what();
    }
    const double seconds = std::chrono::duration<double>(Clock::now() - begin).count();
    downSlowest = std::max(downSlowest, seconds);
    const bool right = error.find(etcd.Endpoints()) != std::string::npos && seconds < kDownBound;
    downWrong += !right;
    EXPECT_TRUE(right) << name << " after " << seconds << " s: " << error;
  }
  etcd.RestartAll();
  int intact = 0;
  for (int m = 0; m < 3; ++m) {
    tStore = Open(MemberLocator(etcd, m));
    const std::string report = CheckListing([&] { return last; }, wrong);
    EXPECT_EQ(report, "") << "after the restart, member " << m;
    intact += report.empty();
  }
  tStore.reset();
  TavoConfigStore::SetGlobalStore(nullptr);

  std::string overs;
  for (const std::string& call : gCalls.over) overs += call + "; ";
  EXPECT_EQ(overs, "") << "store calls past their timeout and margin";

  ReportFigures(
      "etcd-cluster",
      "etcd-cluster: 3 members, %d leader kills: replaces returned %lld, failed by code %s; "
      "%lld listings by 4 readers (one on each member, one on all), read errors %lld, "
      "%d member checks; torn %d, stale %d, unwritten %d; failed replaces left %zu generations, "
      "gone after their lease; %d of %d karstctl imports killed mid-batch: old catalogue kept "
      "%d, left alone while leased %d, removed after %d; first member stopped %d s: import "
      "%.2f s (%.2f s with it up), %lld listings, errors %s; watch moved on, woke %.2f s after "
      "a commit began; slowest store call %.2f s, past timeout + %d ms %zu; cluster down: %zu "
      "operations, wrong %d, slowest %.2f s; intact after restart on %d of 3 members; %.0f s",
      events, progress.replaced.load(), writerErrors.Text().c_str(), listings.load(),
      readErrors.load(), memberChecks, wrong.Of("torn"), wrong.Of("stale"), wrong.Of("unwritten"),
      orphanedByFailures, midBatch, imports, keptOld, leftAlone, removed,
      (kTimeoutMs + 2000) / 1000, importPaused, importUp, pausedListings.load(),
      pausedErrors.Text().c_str(), watchWoke, gCalls.slowest, kMarginMs, gCalls.over.size(),
      std::size(calls), downWrong, downSlowest, intact,
      std::chrono::duration<double>(Clock::now() - start).count());
}

}  // namespace
}  // namespace karst_reliability
