// karstctl rollback on an etcd store, SIGKILLed at a random moment, again and
// again: each rollback writes a catalogue of several etcd requests, so most
// kills land mid-batch. Afterwards a new process must find either the
// catalogue that was current or, whole, the one of the version rolled back
// to, with that version's digests, on a new connection; a rollback that exited 0 must have
// happened. Once the killed writers' leases are gone, one more commit leaves
// no more generations than the kept versions name.

#include <algorithm>
#include <set>
#include <sstream>

#include "EtcdCluster.h"
#include "EtcdKeys.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/StoreHistory.h"
#include "reliability_util.h"

#ifndef KARSTCTL_BINARY
#error "KARSTCTL_BINARY must name the built karstctl"
#endif

namespace karst_reliability {
namespace {

const std::string kPrefix = "rollback";
constexpr std::size_t kKeptVersions = 10;  // the store's default depth

// The generations etcd holds under "area" ("g/", "r/" or "w/").
std::set<std::string> Generations(const EtcdCluster& etcd, const std::string& area) {
  const std::string root = StoreRoot(kPrefix) + area;
  std::set<std::string> gens;
  for (const std::string& key : EtcdKeys(etcd.Endpoint(0)).Keys(root)) {
    gens.insert(key.substr(root.size(), 16));
  }
  return gens;
}

pid_t StartKarstctl(const std::vector<std::string>& args) {
  const pid_t pid = fork();
  if (pid != 0) return pid;
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  std::vector<std::string> argv = {KARSTCTL_BINARY};
  argv.insert(argv.end(), args.begin(), args.end());
  Exec(argv);
}

// The catalogue as a new connection lists it, and its digests. (Not in a
// child process: this one has gRPC's threads, which a fork does not copy.)
std::pair<std::string, std::pair<std::string, std::string>> Read(const std::string& locator) {
  TavoConfigStore::SetGlobalStore(TavoConfigStore::OpenStore(locator));
  return {State(ListCatalogue()), KarstLib::GetDbHash()};
}

// 3000 policies (about 5 MB, a few dozen etcd requests) and 400 datastores.
void Write(long long round) {
  KarstLib::AddPolicyInfo(PoliciesFor(Tag{0, round, 3000}));
  KarstLib::AddDatastoreInfo(DatastoresFor(Tag{0, round + 1, 400}));
}

TEST(EtcdRollbackKills, EachKillLeavesTheOldCatalogueOrTheVersionWhole) {
  EtcdCluster etcd;
  const std::string locator = etcd.Locator(kPrefix);
  auto store = TavoConfigStore::OpenStore(locator);
  TavoConfigStore::SetGlobalStore(store);

  // Two catalogues, each the state after its datastores' replace.
  struct Kept {
    std::uint64_t version;
    std::pair<std::string, std::string> hash;
  };
  std::map<std::string, Kept> latest;  // catalogue -> its newest version
  std::vector<std::string> catalogues;
  for (const long long round : {1, 3}) {
    Write(round);
    catalogues.push_back(State(Tag{0, round, 3000}, Tag{0, round + 1, 400}));
    latest[catalogues.back()] = {TavoConfigStore::NewestVersion(*store), KarstLib::GetDbHash()};
  }
  ASSERT_EQ(Read(locator).first, catalogues[1]);

  const int kills = Scaled(40, 10);
  std::mt19937 rng(20261126);
  unsigned windowUs = 400000;
  int current = 1, keptOld = 0, rolledBack = 0, completed = 0, midBatch = 0;
  for (int k = 0; k < kills; ++k) {
    const std::size_t writers = Generations(etcd, "w/").size();
    const std::string& before = catalogues[current];
    const std::string& target = catalogues[1 - current];
    const pid_t pid =
        StartKarstctl({"--store", locator, "rollback", std::to_string(latest[target].version)});
    usleep(rng() % windowUs);
    kill(pid, SIGKILL);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    const bool exited = WIFEXITED(status);
    ASSERT_FALSE(exited && WEXITSTATUS(status) != 0) << "karstctl rollback failed";
    completed += exited;
    // A killed writer's generation stays registered until its lease runs out.
    midBatch += Generations(etcd, "w/").size() > writers;

    const auto [seen, hash] = Read(locator);
    if (seen == target) {
      EXPECT_EQ(hash, latest[target].hash) << "kill " << k;
      latest[target].version = TavoConfigStore::NewestVersion(*store);
      current = 1 - current;
      ++rolledBack;
      // Aim at kills before the switch: a shorter window next time.
      windowUs -= windowUs / 4;
    } else {
      EXPECT_EQ(seen, before) << "kill " << k << ": neither the old catalogue nor the version";
      EXPECT_FALSE(exited) << "kill " << k << ": a rollback that exited 0 did not happen";
      EXPECT_EQ(hash, latest[before].hash) << "kill " << k;
      ++keptOld;
      windowUs += windowUs / 8;
    }
  }

  // What the killed writers left goes with their leases.
  std::istringstream leases(etcd.Etcdctl({"lease", "list"}));
  std::string id;
  std::getline(leases, id);  // "found N leases"
  while (leases >> id) etcd.Etcdctl({"lease", "revoke", id});
  const std::set<std::string> left = Generations(etcd, "r/");
  TavoConfigStore::SetGlobalStore(store);
  Write(5);
  const std::set<std::string> registered = Generations(etcd, "r/");
  EXPECT_LE(registered.size(), 2 * kKeptVersions);
  EXPECT_EQ(Generations(etcd, "g/"), registered);
  EXPECT_TRUE(Generations(etcd, "w/").empty());
  EXPECT_EQ(TavoConfigStore::ListVersions(*store).size(),
            std::min<std::size_t>(kKeptVersions, TavoConfigStore::NewestVersion(*store)));

  ReportFigures("etcd-rollback-kills",
                "etcd-rollback-kills: %d karstctl rollbacks killed at random (%d mid-batch): old "
                "catalogue kept %d, version rolled back to whole %d (%d of them had exited), "
                "nothing else; %zu generations registered before the leases went, %zu after",
                kills, midBatch, keptOld, rolledBack, completed, left.size(), registered.size());
  EXPECT_EQ(keptOld + rolledBack, kills);
  EXPECT_GT(midBatch, 0) << "no rollback was killed mid-batch";
  TavoConfigStore::SetGlobalStore(nullptr);
}

}  // namespace
}  // namespace karst_reliability
