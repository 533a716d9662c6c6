// The etcd store's own behaviour on a real cluster: replaces larger than one
// etcd request that readers see whole or not at all, writers racing on one
// collection, a dead writer's leftovers, members that refuse or do not
// answer, TLS and users, and change notification. What all backends share
// runs in configstore_test.

#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "Certificates.h"
#include "EtcdCluster.h"
#include "EtcdKeys.h"
#include "Files.h"
#include "Records.h"
#include "StoreObjects.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/EtcdStore.h"
#include "TavoConfigStore/StoreHistory.h"
#include "TavoKarst/KarstLib.h"

namespace TavoConfigStore {
namespace {

using karst_test::ErrorOf;
using karst_test::EtcdCluster;
using karst_test::EtcdKeys;
using karst_test::EtcdOptions;
using karst_test::Filter;
using karst_test::Set;
using karst_test::SharedEtcdCluster;
using karst_test::StoreRoot;
using karst_test::Valued;
using karst_test::ValuesOf;
using Clock = std::chrono::steady_clock;

void Clear(ConfigStore& store, const std::string& key = "k") {
  store.DeleteObjects(Filter(key, "g", "c"));
}

// The keys etcd holds under "area" of the store at "prefix".
std::vector<std::string> RawKeys(const EtcdCluster& etcd, const std::string& prefix,
                                 const std::string& area) {
  std::vector<std::string> keys;
  for (const auto& kv : EtcdKeys(etcd.Endpoint(0)).List(StoreRoot(prefix) + area)) {
    keys.push_back(kv.first);
  }
  return keys;
}

std::vector<TavoKarst::KarstPolicyInfo> Catalogue(int count, long long generation) {
  std::vector<TavoKarst::KarstPolicyInfo> policies;
  for (int i = 0; i < count; ++i) {
    std::vector<TavoKarst::KarstPolicyBlob> blobs;
    for (const char* ns : {"CORRA", "ns-b", "ns-c", "ns-d"}) {
      blobs.push_back({std::string(256, static_cast<char>(i + generation)), ns});
    }
    policies.push_back(karst_test::Policy("p" + std::to_string(i), "id" + std::to_string(i),
                                          std::move(blobs), "", generation));
  }
  return policies;
}

// 10,000 policies of four 256-byte blobs (about 14 MB, far over one etcd
// request) replace one another while a reader on its own connection lists
// them: every listing is one whole catalogue, and nothing of the writes but
// the current generation stays behind.
TEST(EtcdStoreTest, LargeReplacesAreAllOrNothingForReaders) {
  EtcdCluster& etcd = SharedEtcdCluster();
  SetGlobalStore(OpenStore(etcd.Locator("large")));
  TavoKarst::KarstLib::AddPolicyInfo(Catalogue(10000, 1));

  std::atomic<bool> done{false};
  std::atomic<int> listings{0};
  std::atomic<int> torn{0};
  std::thread reader([&] {
    auto store = OpenStore(etcd.Locator("large"));
    auto filter = Filter("karst_policies");
    while (!done) {
      const auto objects = store->GetObjects(filter);
      long long first = -1;
      for (const auto& o : objects) {
        long long generation = 0;
        o->GetValue("generation_number", &generation);
        if (first == -1) first = generation;
        if (generation != first) ++torn;
      }
      if (objects.size() != 10000) ++torn;
      ++listings;
    }
  });
  for (long long generation = 2; generation <= 4; ++generation) {
    TavoKarst::KarstLib::AddPolicyInfo(Catalogue(10000, generation));
  }
  while (listings < 3) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  done = true;
  reader.join();
  EXPECT_EQ(torn, 0) << "of " << listings << " listings";
  EXPECT_EQ(TavoKarst::KarstLib::ListPolicyInfo(), Catalogue(10000, 4));
  // One generation for each of the four versions kept.
  EXPECT_EQ(RawKeys(etcd, "large", "r/").size(), 4u);
  EXPECT_THAT(RawKeys(etcd, "large", "w/"), ::testing::IsEmpty());
  SetGlobalStore(nullptr);
}

// A large collection listed again is read in two halves at once; a small
// commit that changes the first and the last object together, in place,
// while listings run must never be seen half applied.
TEST(EtcdStoreTest, ListingsInHalvesAreOneSnapshot) {
  const std::string locator = SharedEtcdCluster().Locator("halves");
  auto writer = OpenStore(locator);
  const int objects = 600;
  writer->BeginTransaction();
  for (int i = 0; i < objects; ++i) Set(*writer, Valued("o" + std::to_string(1000 + i), "0"));
  writer->CommitTransaction();

  auto change = [&](int n) {
    writer->BeginTransaction();
    Set(*writer, Valued("o1000", std::to_string(n)));
    Set(*writer, Valued("o" + std::to_string(1000 + objects - 1), std::to_string(n)));
    writer->CommitTransaction();
  };
  change(1);
  std::atomic<bool> done{false};
  std::thread changes([&] {
    for (int n = 2; !done; ++n) change(n);
  });
  auto reader = OpenStore(locator);
  int torn = 0;
  int misordered = 0;
  for (int listing = 0; listing < 150; ++listing) {
    const std::vector<std::string> seen = ValuesOf(*reader, Filter("k", "g", "c"));
    if (seen.size() != static_cast<std::size_t>(objects)) {
      ++torn;
      continue;
    }
    // Both halves in write order: the two changed objects last, the rest as
    // first written.
    misordered += seen[objects - 3] != "o" + std::to_string(1000 + objects - 2) + "=0";
    const std::string first = seen[objects - 2].substr(seen[objects - 2].find('='));
    const std::string last = seen[objects - 1].substr(seen[objects - 1].find('='));
    torn += first != last;
  }
  done = true;
  changes.join();
  EXPECT_EQ(torn, 0);
  EXPECT_EQ(misordered, 0);
}

// A 10 MiB value is stored in parts, each under etcd's request limit, and
// comes back byte for byte, in place of a smaller object and replaced again.
TEST(EtcdStoreTest, ValuesLargerThanARequestRoundTrip) {
  auto store = OpenStore(SharedEtcdCluster().Locator("parts"));
  std::string big(10 << 20, '\0');
  for (std::size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7919 >> 5);
  Set(*store, Valued("small", "x"));
  for (const std::string& value : {big, std::string("short again"), big + "tail"}) {
    Set(*store, Valued("big", value));
    std::string read;
    store->GetObject(ConfigStoreObjectId("k", "g", "c", "big"))->GetValue("v", &read);
    EXPECT_TRUE(read == value) << "size " << read.size() << " of " << value.size();
    EXPECT_EQ(ValuesOf(*store).size(), 2u);
  }
}

// A transaction that read a collection fails if another writer changed it
// before the commit; one that only replaced it is applied to the new state.
TEST(EtcdStoreTest, RacingWritersConflictOnlyWhenWhatTheyReadChanged) {
  const std::string locator = SharedEtcdCluster().Locator("race");
  auto mine = OpenStore(locator);
  auto other = OpenStore(locator);
  Set(*mine, Valued("a", "0"));

  mine->BeginTransaction();
  EXPECT_EQ(ValuesOf(*mine), std::vector<std::string>{"a=0"});
  Set(*other, Valued("a", "other"));
  Set(*mine, Valued("a", "mine"));
  EXPECT_EQ(ErrorOf([&] { mine->CommitTransaction(); }).Code(), kErrorConflict);
  mine->AbortTransaction();
  EXPECT_EQ(ValuesOf(*other), std::vector<std::string>{"a=other"});

  mine->BeginTransaction();
  Clear(*mine);
  Set(*mine, Valued("b", "mine"));
  Set(*other, Valued("c", "other"));  // lands between, and is replaced
  mine->CommitTransaction();
  EXPECT_EQ(ValuesOf(*other), std::vector<std::string>{"b=mine"});

  // Every commit is a version, so a commit to another collection that lands
  // between a commit's read and its switch moves the history on under it;
  // the collections it writes are unchanged, so it goes through, written
  // into new generations (versions kept) or in place (none kept).
  for (const unsigned depth : {10u, 0u}) {
    SetHistoryDepth(*mine, depth);
    const std::uint64_t newest = NewestVersion(*mine);
    std::thread racer([&] {
      for (int i = 0; i < 20; ++i) Set(*other, Valued("x", std::to_string(i), "k2"));
    });
    for (int i = 0; i < 20; ++i) {
      mine->BeginTransaction();
      ValuesOf(*mine, Filter("k"));
      Set(*mine, Valued("b", std::to_string(i)));
      EXPECT_NO_THROW(mine->CommitTransaction()) << "depth " << depth;
      mine->AbortTransaction();  // after a failed commit; nothing after a good one
    }
    racer.join();
    EXPECT_EQ(NewestVersion(*other), newest + 40);
    EXPECT_EQ(ValuesOf(*other, Filter("k")), std::vector<std::string>{"b=19"});
    EXPECT_EQ(ValuesOf(*other, Filter("k2")), std::vector<std::string>{"x=19"});
  }
}

// "instance=value" of each object of collection "k", or "instance!why" for
// one that cannot be read, in order.
std::vector<std::string> Describe(ConfigStore& store) {
  std::vector<std::string> out;
  auto filter = std::make_shared<FilterSpecObject>(ConfigStoreObjectId("k", "g", "c"));
  for (const auto& o : store.GetObjects(filter)) {
    try {
      std::string v;
      o->GetValue("v", &v);
      out.push_back(o->Id().InstanceId() + "=" + v);
    } catch (const ConfigStoreException& e) {
      out.push_back(o->Id().InstanceId() + "!" + e.Message());
    }
  }
  return out;
}

// The cluster's current revision.
std::string Revision(const EtcdCluster& etcd) {
  const std::string status = etcd.Etcdctl({"get", "-w", "json", "none"});
  const std::size_t at = status.find("\"revision\":") + 11;
  return status.substr(at, status.find_first_not_of("0123456789", at) - at);
}

// Whatever changes a collection, a reader that keeps listings between reads
// lists and looks up, read after read, exactly what a reader that keeps none
// finds: order, values, damage and all, also once another writer has moved
// the collection to a new generation or removed it; and what a caller does
// to the objects it got does not reach the next listing.
TEST(EtcdStoreTest, AKeptListingIsWhatAFreshReadFinds) {
  EtcdCluster& etcd = SharedEtcdCluster();
  const std::string locator = etcd.Locator("kept");
  auto writer = OpenStore(locator);
  auto another = OpenStore(locator + "?cache=0");
  auto keeping = OpenStore(locator);
  auto fresh = OpenStore(locator + "?cache=0");
  const EtcdKeys raw(etcd.Endpoint(0));
  const auto generation = [&] {
    return raw.List(StoreRoot("kept") + "p/").begin()->second.substr(0, 16);
  };
  // A first part whose header is sound and whose body is not.
  const std::string damaged("\x01\x01\x00\x00\x01\x01\x05", 7);
  const std::pair<const char*, std::function<void()>> changes[] = {
      {"first objects",
       [&] {
         writer->BeginTransaction();
         for (const char* i : {"a", "b", "c"}) Set(*writer, Valued(i, i));
         writer->CommitTransaction();
       }},
      {"nothing", [] {}},
      {"an object changed in place", [&] { Set(*writer, Valued("a", "a2")); }},
      {"an object deleted",
       [&] {
         writer->DeleteObjects(
             std::make_shared<FilterSpecObject>(ConfigStoreObjectId("k", "g", "c", "b")));
       }},
      {"another writer's commit", [&] { Set(*another, Valued("d", "d")); }},
      {"a replace",
       [&] {
         writer->BeginTransaction();
         Clear(*writer);
         for (const char* i : {"f", "e"}) Set(*writer, Valued(i, i));
         writer->CommitTransaction();
       }},
      {"a compaction",
       [&] {
         etcd.Etcdctl({"compact", Revision(etcd)});
       }},
      {"a commit after the compaction", [&] { Set(*writer, Valued("g", "g")); }},
      {"a damaged object",
       [&] {
         raw.Put(StoreRoot("kept") + "g/" + generation() + "/h" + '\0' + "0000", damaged);
         Set(*writer, Valued("i", "i"));
       }},
      {"the collection cleared", [&] { Clear(*writer); }},
      {"written again", [&] { Set(*another, Valued("j", "j")); }},
  };
  // Describe's entries, found by looking up each object ever written, in
  // name order.
  const auto lookUp = [](ConfigStore& store) {
    std::vector<std::string> found;
    for (const std::string i : {"a", "b", "c", "d", "e", "f", "g", "h", "i", "j"}) {
      const auto o = store.GetObject(ConfigStoreObjectId("k", "g", "c", i));
      if (!o) continue;
      std::string v;
      const ConfigStoreException e = ErrorOf([&] { o->GetValue("v", &v); });
      found.push_back(i + (e.Code() ? "!" + e.Message() : "=" + v));
    }
    return found;
  };
  // What both must list where a reader stuck on the generation it read last
  // would show the old one.
  const std::map<std::string, std::vector<std::string>> known = {
      {"a replace", {"f=f", "e=e"}}, {"the collection cleared", {}}, {"written again", {"j=j"}}};
  for (const auto& [what, change] : changes) {
    change();
    // The keeping reader looks up before it lists, the fresh one lists first.
    const std::vector<std::string> keptLookUps = lookUp(*keeping);
    const std::vector<std::string> expected = Describe(*fresh);
    EXPECT_EQ(Describe(*keeping), expected) << "after " << what;
    if (known.count(what)) {
      EXPECT_EQ(expected, known.at(what));
    }
    std::vector<std::string> byName = expected;
    std::sort(byName.begin(), byName.end());
    EXPECT_EQ(keptLookUps, byName) << "after " << what;
    EXPECT_EQ(lookUp(*fresh), byName) << "after " << what;
    for (const auto& o : keeping->GetObjects(
             std::make_shared<FilterSpecObject>(ConfigStoreObjectId("k", "g", "c")))) {
      o->SetValue("v", "changed by a caller");
      o->CreateSubObject(SubObjectId("s", "x"))->SetValue("v", "y");
    }
    EXPECT_EQ(Describe(*keeping), expected) << "again after " << what;
  }
}

// While nobody changes a collection, a reader that listed it lists it again
// for a few hundred bytes of etcd's; any store of the process that names the
// same cluster and prefix does. A changed collection is fetched again, once;
// one larger than the cache every time; and the kept listings go with the
// last store that used them.
TEST(EtcdStoreTest, AnUnchangedCollectionCostsTheClusterASmallRead) {
  EtcdCluster& etcd = SharedEtcdCluster();
  const std::string locator = etcd.Locator("cost") + "?cache=2";
  auto writer = OpenStore(locator);
  writer->BeginTransaction();
  for (int i = 0; i < 100; ++i)
    Set(*writer, Valued("o" + std::to_string(i), std::string(4096, 'k')));
  for (int i = 0; i < 600; ++i) {
    Set(*writer, Valued("o" + std::to_string(i), std::string(4096, 'b'), "big"));
  }
  writer->CommitTransaction();
  auto reader = OpenStore(locator);
  const auto sent = [&](const std::shared_ptr<ConfigStore>& store, const char* key) {
    const double before = etcd.ClientBytesSent();
    ValuesOf(*store, Filter(key, "g", "c"));
    return etcd.ClientBytesSent() - before;
  };
  constexpr double kSmall = 4096;
  constexpr double kSmallCollection = 100 * 4096;
  EXPECT_GT(sent(reader, "k"), kSmallCollection);
  EXPECT_LT(sent(reader, "k"), kSmall);
  EXPECT_LT(sent(OpenStore(locator), "k"), kSmall);
  EXPECT_GT(sent(reader, "big"), 6 * kSmallCollection);
  EXPECT_GT(sent(reader, "big"), 6 * kSmallCollection);
  EXPECT_LT(sent(reader, "k"), kSmall);

  Set(*writer, Valued("o1", "changed"));
  EXPECT_GT(sent(reader, "k"), kSmallCollection);
  EXPECT_LT(sent(reader, "k"), kSmall);

  reader.reset();
  writer.reset();
  EXPECT_GT(sent(OpenStore(locator), "k"), kSmallCollection);
}

// A writer that dies mid-replace leaves a generation nobody points at; once
// its lease is gone the next writer removes it, and readers never saw it. A
// writer renews its one lease from replace to replace rather than granting
// one each time, and gets a new one when it has gone.
TEST(EtcdStoreTest, ADeadWritersGenerationGoesWithItsLeaseAndAWriterKeepsOne) {
  EtcdCluster& etcd = SharedEtcdCluster();
  auto leases = [&] {
    std::istringstream out(etcd.Etcdctl({"lease", "list"}));
    std::string line;
    std::vector<std::string> ids;
    std::getline(out, line);  // "found N leases"
    while (out >> line) ids.push_back(line);
    return ids;
  };
  for (const std::string& id : leases()) etcd.Etcdctl({"lease", "revoke", id});
  auto store = OpenStore(etcd.Locator("dead"));
  SetHistoryDepth(*store, 1);  // no generation but the current one kept
  Set(*store, Valued("kept", "old"));
  // What a writer leaves when it dies after its first batch.
  const EtcdKeys raw(etcd.Endpoint(0));
  const std::int64_t lease = raw.GrantLease(60);
  const std::string root = StoreRoot("dead");
  raw.Put(root + "w/0123456789abcdef", "k", lease);
  raw.Put(root + "r/0123456789abcdef", "k");
  raw.Put(root + "g/0123456789abcdef/x" + '\0' + "0000", "junk");
  raw.Put(root + "g/0123456789abcdef/y", "junk");

  EXPECT_EQ(ValuesOf(*store), std::vector<std::string>{"kept=old"});
  Clear(*store);
  Set(*store, Valued("new", "1"));  // the writer's lease still runs: left alone
  EXPECT_EQ(RawKeys(etcd, "dead", "g/0123456789abcdef/").size(), 2u);
  raw.RevokeLease(lease);
  for (int i = 0; i < 3; ++i) {
    Clear(*store);
    Set(*store, Valued("newer", std::to_string(i)));
  }
  EXPECT_THAT(RawKeys(etcd, "dead", "g/0123456789abcdef/"), ::testing::IsEmpty());
  EXPECT_EQ(RawKeys(etcd, "dead", "r/").size(), 1u);
  EXPECT_EQ(ValuesOf(*store), std::vector<std::string>{"newer=2"});

  const std::vector<std::string> kept = leases();
  ASSERT_EQ(kept.size(), 1u);
  etcd.Etcdctl({"lease", "revoke", kept[0]});
  Clear(*store);
  Set(*store, Valued("a", "after"));
  EXPECT_EQ(ValuesOf(*store), std::vector<std::string>{"a=after"});
  EXPECT_EQ(leases().size(), 1u);
  EXPECT_THAT(RawKeys(etcd, "dead", "w/"), ::testing::IsEmpty());
}

// With every member refusing, every operation fails at once (not at the
// timeout), naming the cluster and why; so does the library's Reset, which
// goes on past a failed deletion and so can fail only at its commit.
TEST(EtcdStoreTest, AClusterThatRefusesFailsEveryOperationAtOnce) {
  auto etcd = std::make_unique<EtcdCluster>();
  const std::string endpoint = etcd->Endpoint(0);
  auto store = OpenStore(etcd->Locator("down"));
  Set(*store, Valued("a"));
  etcd.reset();
  SetGlobalStore(store);
  auto filter = Filter("k", "g", "c");
  const std::vector<std::function<void()>> operations = {
      [&] { store->GetObject(ConfigStoreObjectId("k", "g", "c", "a")); },
      [&] { store->GetObjects(filter); },
      [&] { Set(*store, Valued("b")); },
      [&] { store->DeleteObjects(filter); },
      [&] { TavoKarst::KarstLib::Reset(); },
      [&] {
        store->BeginTransaction();
        Set(*store, Valued("c"));
        store->CommitTransaction();
      },
  };
  for (std::size_t i = 0; i < operations.size(); ++i) {
    const auto start = Clock::now();
    const ConfigStoreException e = ErrorOf(operations[i]);
    EXPECT_LT(Clock::now() - start, std::chrono::milliseconds(1500)) << "operation " << i;
    EXPECT_EQ(e.Code(), kErrorEtcdBase + 14) << i;
    EXPECT_THAT(e.what(), ::testing::HasSubstr(endpoint + ": connection refused")) << i;
  }
  store->AbortTransaction();
  SetGlobalStore(nullptr);
}

// A member that is down is said to refuse, at once, however long it has
// been down (gRPC waits longer and longer before it connects again). Once it
// is back, the next call reaches it, from that store and from one opened
// since alike.
TEST(EtcdStoreTest, EveryCallConnectsAfreshToAMemberThatFailed) {
  EtcdCluster etcd;
  auto before = OpenStore(etcd.Locator("back"));
  Set(*before, Valued("a"));
  etcd.Kill(0);
  for (const auto end = Clock::now() + std::chrono::milliseconds(1500); Clock::now() < end;
       usleep(10000)) {
    const auto start = Clock::now();
    ASSERT_THAT(ErrorOf([&] { ValuesOf(*before); }).what(), ::testing::HasSubstr("refused"));
    ASSERT_LT(Clock::now() - start, std::chrono::milliseconds(500));
  }
  etcd.Restart(0);
  const auto since = OpenStore(etcd.Locator("back"));
  for (const auto& store : {since, before}) {
    const auto start = Clock::now();
    EXPECT_EQ(ValuesOf(*store), std::vector<std::string>{"a="});
    EXPECT_LT(Clock::now() - start, std::chrono::milliseconds(500));
  }
}

// A loopback port that accepts connections (the kernel does, up to its
// backlog) and never answers, as a hung member would.
class SilentMember {
 public:
  SilentMember() : fd_(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t size = sizeof address;
    if (bind(fd_, reinterpret_cast<sockaddr*>(&address), size) != 0 || listen(fd_, 64) != 0 ||
        getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &size) != 0) {
      throw std::runtime_error("no loopback port to listen on");
    }
    endpoint_ = "127.0.0.1:" + std::to_string(ntohs(address.sin_port));
  }
  ~SilentMember() { close(fd_); }
  const std::string& Endpoint() const { return endpoint_; }

 private:
  int fd_;
  std::string endpoint_;
};

// A port nobody listens on: connections to it are refused.
std::string RefusingEndpoint() {
  SilentMember taken;
  return taken.Endpoint();  // closed again on return
}

// A member that does not answer holds a request about a second before the
// next member gets it; one that refuses holds it not at all. The member that
// answered is asked first from then on, so the next call is not held again.
// With no member answering, a request ends at the timeout.
TEST(EtcdStoreTest, ARequestGoesToAMemberThatAnswers) {
  const SilentMember silent;
  const std::string good = SharedEtcdCluster().Endpoint(0);
  const std::string refusing = RefusingEndpoint();
  const struct {
    const char* name;
    std::string endpoints;
    int timeoutMs;
    int code;  // 0: the call works
    int atLeastMs;
    int withinMs;
  } cases[] = {
      {"silent first", silent.Endpoint() + "," + good, 5000, 0, 900, 2500},
      {"refusing first", refusing + "," + good, 5000, 0, 0, 1000},
      {"all silent", silent.Endpoint() + "," + silent.Endpoint(), 1500, kErrorEtcdBase + 4, 1400,
       3000},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    auto store =
        OpenStore("etcd://" + c.endpoints + "/failover?timeout=" + std::to_string(c.timeoutMs));
    const auto start = Clock::now();
    const ConfigStoreException e = ErrorOf([&] { Set(*store, Valued("a", c.name)); });
    const auto took = Clock::now() - start;
    EXPECT_EQ(e.Code(), c.code) << e.what();
    EXPECT_GE(took, std::chrono::milliseconds(c.atLeastMs));
    EXPECT_LT(took, std::chrono::milliseconds(c.withinMs));
    if (c.code != 0) continue;
    const auto again = Clock::now();
    EXPECT_EQ(ValuesOf(*store), std::vector<std::string>{std::string("a=") + c.name});
    EXPECT_LT(Clock::now() - again, std::chrono::milliseconds(500));
  }
}

// TLS and users. The right certificate and password work. What is wrong
// with the files is found before connecting, and what a member refuses
// after a handshake that says why; each kind has its code, and none waits
// for the timeout. No message repeats a password.
TEST(EtcdStoreTest, CertificatesAndUsersAreChecked) {
  EtcdOptions options;
  options.tls = true;
  options.auth = true;
  EtcdCluster etcd(options);
  Set(*OpenStore(etcd.Locator("secure")), Valued("a", "1"));
  EXPECT_EQ(ValuesOf(*OpenStore(etcd.Locator("secure"))), std::vector<std::string>{"a=1"});

  karst_test::ScratchDir dir;
  const karst_test::CertificateFiles otherCa = karst_test::MakeCa(dir.Path(), "other-ca");
  const karst_test::CertificateFiles expiredCa =
      karst_test::MakeCa(dir.Path(), "expired-ca", {-30, -1});
  const karst_test::CertificateFiles foreign =
      karst_test::MakeSigned(dir.Path(), "foreign", otherCa);
  const karst_test::CertificateFiles expired =
      karst_test::MakeSigned(dir.Path(), "expired", otherCa, {-30, -1});
  const std::string json = dir.File("ca.json");
  karst_test::WriteFile(json, "{\"ca\": \"not a certificate\"}\n");
  const std::string ca = etcd.CaFile(), cert = etcd.CertFile(), key = etcd.KeyFile();
  const std::string port = etcd.Endpoint(0).substr(etcd.Endpoint(0).find(':'));
  const auto tls = [&](const std::string& cacert, const std::string& certFile,
                       const std::string& keyFile, const std::string& host = "127.0.0.1") {
    return "etcds://" + host + port + "/secure?cacert=" + cacert +
           (certFile.empty() ? "" : "&cert=" + certFile + "&key=" + keyFile);
  };

  const std::string wrongPassword = "not-the-root-password";
  const std::string wrongUser = "etcds://root:" + wrongPassword + "@" + etcd.Endpoints() +
                                "/secure?cacert=" + ca + "&cert=" + cert + "&key=" + key;
  const struct {
    std::string locator;
    int code;
    std::string says;
  } cases[] = {
      {wrongUser, kErrorEtcdBase + 3, "authenticating as user root"},
      {etcd.Locator("secure", {"", true}), kErrorEtcdBase + 7, "permission denied"},
      {etcd.Locator("secure", {"limited", true}), kErrorEtcdBase + 7, "permission denied"},
      {tls(dir.File("missing.pem"), cert, key), kErrorTlsFile, "cannot read the CA file"},
      {tls(json, cert, key), kErrorTlsFile, json + " is not PEM"},
      {tls(key, cert, key), kErrorTlsFile, key + " holds a private key, not a certificate"},
      {tls(ca, cert, foreign.key), kErrorTlsFile, foreign.key + " is not the one of"},
      {tls(ca, ca, ca), kErrorTlsFile, ca + " holds a certificate, not a private key"},
      {tls(expiredCa.cert, cert, key), kErrorTlsExpired,
       "CA certificate in " + expiredCa.cert + " expired on"},
      {tls(ca, expired.cert, expired.key), kErrorTlsExpired,
       "client certificate in " + expired.cert + " expired on"},
      {tls(otherCa.cert, cert, key), kErrorTlsUntrusted, "not signed by the CA in " + otherCa.cert},
      {tls(ca, cert, key, "localhost"), kErrorTlsName, "does not name localhost"},
      {tls(ca, "", ""), kErrorTlsClientCertificate, "asks for a client certificate"},
      {tls(ca, foreign.cert, foreign.key), kErrorTlsClientCertificate,
       "refused the client certificate in " + foreign.cert},
      {"etcd://" + etcd.Endpoints() + "/secure", kErrorTlsProtocol, "speaks TLS, not plain text"},
      {"etcds://" + SharedEtcdCluster().Endpoint(0) + "/secure?cacert=" + ca, kErrorTlsProtocol,
       "speaks plain text, not TLS"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.locator);
    const auto start = Clock::now();
    const ConfigStoreException e = ErrorOf([&] { ValuesOf(*OpenStore(c.locator)); });
    EXPECT_LT(Clock::now() - start, std::chrono::milliseconds(2500));
    EXPECT_EQ(e.Code(), c.code) << e.what();
    EXPECT_THAT(e.what(), ::testing::HasSubstr(c.says));
    EXPECT_THAT(e.what(), ::testing::Not(::testing::HasSubstr(etcd.Password("root"))));
    EXPECT_THAT(e.what(), ::testing::Not(::testing::HasSubstr(wrongPassword)));
  }
}

// WaitForChange wakes when another connection commits, not otherwise.
TEST(EtcdStoreTest, WaitForChangeWakesOnAnotherWritersCommit) {
  const std::string locator = SharedEtcdCluster().Locator("watch");
  auto watcher = OpenStore(locator);
  auto writer = OpenStore(locator);
  EXPECT_FALSE(watcher->WaitForChange(300));
  std::thread later([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    Set(*writer, Valued("a"));
  });
  const auto start = Clock::now();
  EXPECT_TRUE(watcher->WaitForChange(5000));
  EXPECT_LT(Clock::now() - start, std::chrono::seconds(1));
  later.join();
  EXPECT_FALSE(watcher->WaitForChange(300));
}

}  // namespace
}  // namespace TavoConfigStore
