// The baselines: the policy catalogue kept directly in SQLite with the least
// work a purpose-built store would do (statements prepared once, one
// transaction per replacement, a schema made for the records), on the same
// connection settings (journal, sync, cache) as the configuration store.

#ifndef KARST_BENCH_RAW_SQLITE_H_
#define KARST_BENCH_RAW_SQLITE_H_

#include <sqlite3.h>

#include <string>
#include <vector>

#include "TavoKarst/KarstLib.h"

namespace karst_bench {

// The configuration store's connection settings, as PRAGMA assignments.
struct ConnectionSettings {
  std::vector<std::string> pragmas;
  std::string Describe() const;
};

// Read from the connection GetStore hands out, so the baselines always run
// on what the store runs on.
ConnectionSettings StoreConnectionSettings();

class RawPolicyDb {
 public:
  enum class Layout {
    // policies(id, name UNIQUE, policy_id, description, generation, blobs):
    // the blobs of a policy packed into one column of its row.
    kOneRow,
    // policies(id, name UNIQUE, policy_id, description, generation) and
    // blobs(policy, seq, ns, blob) clustered on (policy, seq).
    kTwoTables,
    // Not a contender: the configuration store's former single table (every
    // collection in one table, a four-part identifier index, a body per
    // object) used the least wasteful way, with a packed body. It shows what
    // that layout cost, against which the table per collection is measured.
    kStoreSchema,
  };

  RawPolicyDb(const std::string& path, Layout layout, const ConnectionSettings& settings);
  ~RawPolicyDb();
  RawPolicyDb(const RawPolicyDb&) = delete;
  RawPolicyDb& operator=(const RawPolicyDb&) = delete;

  // Replaces every policy in one transaction.
  void Replace(const std::vector<TavoKarst::KarstPolicyInfo>& policies);
  // Every policy with its blobs, in the order of writing.
  std::vector<TavoKarst::KarstPolicyInfo> List();
  // The blob of namespace "ns" of the policy called "name"; "" when absent.
  std::string BlobByName(const std::string& name, const std::string& ns);

 private:
  sqlite3_stmt* Prepare(const char* sql);
  void Exec(const char* sql);
  void Run(sqlite3_stmt* s);
  [[noreturn]] void Fail(const char* what);
  // kStoreSchema: the lowest and highest seq of the collection; false when empty.
  bool Bounds(sqlite3_int64* low, sqlite3_int64* high);
  void Pack(const TavoKarst::KarstPolicyInfo& p);

  Layout layout_;
  sqlite3* db_ = nullptr;
  sqlite3_stmt* begin_ = nullptr;
  sqlite3_stmt* commit_ = nullptr;
  sqlite3_stmt* clearPolicies_ = nullptr;
  sqlite3_stmt* clearBlobs_ = nullptr;
  sqlite3_stmt* insertPolicy_ = nullptr;
  sqlite3_stmt* insertBlob_ = nullptr;
  sqlite3_stmt* selectPolicies_ = nullptr;
  sqlite3_stmt* selectBlobs_ = nullptr;
  sqlite3_stmt* selectByName_ = nullptr;
  sqlite3_stmt* bounds_ = nullptr;
  std::string packed_;  // reused packing buffer
};

}  // namespace karst_bench

#endif  // KARST_BENCH_RAW_SQLITE_H_
