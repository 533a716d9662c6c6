#include "RawSqlite.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "TavoConfigStore/ConfigStore.h"

namespace karst_bench {

using TavoKarst::KarstPolicyBlob;
using TavoKarst::KarstPolicyInfo;

namespace {

// The settings that shape SQLite's work; page_size first, since it only
// applies before the file gets its first table.
const char* const kCopiedPragmas[] = {"page_size",    "journal_mode", "synchronous",
                                      "cache_size",   "mmap_size",    "wal_autocheckpoint",
                                      "locking_mode", "temp_store",   "cache_spill"};

std::string QueryText(sqlite3* db, const std::string& sql) {
  sqlite3_stmt* s = nullptr;
  std::string out;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &s, nullptr) == SQLITE_OK &&
      sqlite3_step(s) == SQLITE_ROW) {
    const unsigned char* text = sqlite3_column_text(s, 0);
    if (text != nullptr) out = reinterpret_cast<const char*>(text);
  }
  sqlite3_finalize(s);
  return out;
}

void BindBytes(sqlite3_stmt* s, int index, const std::string& bytes) {
  sqlite3_bind_blob64(s, index, bytes.data(), bytes.size(), SQLITE_STATIC);
}

void AssignColumn(sqlite3_stmt* s, int column, std::string* out) {
  const void* data = sqlite3_column_blob(s, column);
  out->assign(static_cast<const char*>(data),
              data == nullptr ? 0 : sqlite3_column_bytes(s, column));
}

void PutU32(std::uint32_t v, std::string* out) {
  char b[4];
  std::memcpy(b, &v, 4);
  out->append(b, 4);
}

// One-row layout: the blobs column is (u32 length, namespace, u32 length,
// blob)* in native byte order.
class Unpacker {
 public:
  Unpacker(const void* data, int size)
      : p_(static_cast<const char*>(data)), end_(p_ + (data == nullptr ? 0 : size)) {}
  bool Next(const char** ns, std::uint32_t* nsSize, const char** blob, std::uint32_t* blobSize) {
    return Field(ns, nsSize) && Field(blob, blobSize);
  }

 private:
  bool Field(const char** data, std::uint32_t* size) {
    if (end_ - p_ < 4) return false;
    std::memcpy(size, p_, 4);
    p_ += 4;
    if (static_cast<std::size_t>(end_ - p_) < *size) return false;
    *data = p_;
    p_ += *size;
    return true;
  }
  const char* p_;
  const char* end_;
};

}  // namespace

std::string ConnectionSettings::Describe() const {
  std::string out;
  for (const std::string& p : pragmas) out += (out.empty() ? "" : ", ") + p;
  return out;
}

ConnectionSettings StoreConnectionSettings() {
  // The first write creates the store file with the page size and journal
  // mode it keeps there; of the per-connection settings that bear on speed
  // the store changes only synchronous, to FULL, and leaves the rest at
  // SQLite's defaults (its log size limit acts when the last connection
  // closes).
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  store->BeginTransaction();
  store->CommitTransaction();
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(TavoConfigStore::DefaultStorePath().c_str(), &db, SQLITE_OPEN_READWRITE,
                      nullptr) != SQLITE_OK) {
    std::fprintf(stderr, "cannot open the store file: %s\n", sqlite3_errmsg(db));
    std::exit(2);
  }
  sqlite3_exec(db, "PRAGMA synchronous=FULL", nullptr, nullptr, nullptr);
  ConnectionSettings settings;
  for (const char* name : kCopiedPragmas) {
    settings.pragmas.push_back(std::string(name) + "=" +
                               QueryText(db, std::string("PRAGMA ") + name));
  }
  sqlite3_close(db);
  return settings;
}

RawPolicyDb::RawPolicyDb(const std::string& path, Layout layout, const ConnectionSettings& settings)
    : layout_(layout) {
  if (sqlite3_open_v2(path.c_str(), &db_,
                      SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                      nullptr) != SQLITE_OK) {
    Fail("open");
  }
  for (const std::string& p : settings.pragmas) {
    // journal_mode and the like answer with a row; read and drop it.
    sqlite3_stmt* s = Prepare(("PRAGMA " + p).c_str());
    while (sqlite3_step(s) == SQLITE_ROW) {
    }
    sqlite3_finalize(s);
  }
  if (layout_ == Layout::kOneRow) {
    Exec(
        "CREATE TABLE IF NOT EXISTS policies(id INTEGER PRIMARY KEY, name BLOB NOT NULL UNIQUE, "
        "policy_id BLOB NOT NULL, description BLOB NOT NULL, generation INTEGER NOT NULL, "
        "blobs BLOB NOT NULL)");
    insertPolicy_ = Prepare(
        "INSERT OR REPLACE INTO policies(name, policy_id, description, generation, blobs) "
        "VALUES(?1, ?2, ?3, ?4, ?5)");
    selectPolicies_ =
        Prepare("SELECT name, policy_id, description, generation, blobs FROM policies ORDER BY id");
    selectByName_ = Prepare("SELECT blobs FROM policies WHERE name = ?1");
  } else if (layout_ == Layout::kStoreSchema) {
    Exec(
        "CREATE TABLE IF NOT EXISTS objects(seq INTEGER PRIMARY KEY, key BLOB NOT NULL, "
        "grp BLOB NOT NULL, component BLOB NOT NULL, instance BLOB NOT NULL, body BLOB NOT NULL)");
    Exec("CREATE UNIQUE INDEX IF NOT EXISTS objects_id ON objects(key, grp, component, instance)");
    // The collection is found through the index, then read or deleted in
    // seq order, as the store does.
    static const char kCollection[] = " +key = ?1 AND +grp = ?2 AND +component = ?3";
    bounds_ = Prepare(
        "SELECT min(seq), max(seq) FROM objects WHERE key = ?1 AND grp = ?2 AND component = ?3");
    clearPolicies_ = Prepare(
        (std::string("DELETE FROM objects WHERE seq BETWEEN ?4 AND ?5 AND") + kCollection).c_str());
    insertPolicy_ = Prepare(
        "INSERT OR REPLACE INTO objects(key, grp, component, instance, body) "
        "VALUES(?1, ?2, ?3, ?4, ?5)");
    selectPolicies_ =
        Prepare((std::string("SELECT body FROM objects WHERE seq BETWEEN ?4 AND ?5 AND") +
                 kCollection + " ORDER BY seq")
                    .c_str());
    selectByName_ = Prepare(
        "SELECT body FROM objects WHERE key = ?1 AND grp = ?2 AND component = ?3 AND instance = "
        "?4");
  } else {
    Exec(
        "CREATE TABLE IF NOT EXISTS policies(id INTEGER PRIMARY KEY, name BLOB NOT NULL UNIQUE, "
        "policy_id BLOB NOT NULL, description BLOB NOT NULL, generation INTEGER NOT NULL)");
    Exec(
        "CREATE TABLE IF NOT EXISTS blobs(policy INTEGER NOT NULL, seq INTEGER NOT NULL, "
        "ns BLOB NOT NULL, blob BLOB NOT NULL, PRIMARY KEY(policy, seq)) WITHOUT ROWID");
    clearBlobs_ = Prepare("DELETE FROM blobs");
    insertPolicy_ = Prepare(
        "INSERT INTO policies(name, policy_id, description, generation) VALUES(?1, ?2, ?3, ?4)");
    insertBlob_ = Prepare("INSERT INTO blobs(policy, seq, ns, blob) VALUES(?1, ?2, ?3, ?4)");
    selectPolicies_ =
        Prepare("SELECT id, name, policy_id, description, generation FROM policies ORDER BY id");
    selectBlobs_ = Prepare("SELECT policy, ns, blob FROM blobs ORDER BY policy, seq");
    selectByName_ = Prepare(
        "SELECT b.blob FROM policies p JOIN blobs b ON b.policy = p.id "
        "WHERE p.name = ?1 AND b.ns = ?2");
  }
  begin_ = Prepare("BEGIN IMMEDIATE");
  commit_ = Prepare("COMMIT");
  if (clearPolicies_ == nullptr) clearPolicies_ = Prepare("DELETE FROM policies");
}

namespace {
const std::string kKey = "karst_policies";
const std::string kGroup = "storage";
const std::string kComponent = "tavo";

void BindCollection(sqlite3_stmt* s) {
  BindBytes(s, 1, kKey);
  BindBytes(s, 2, kGroup);
  BindBytes(s, 3, kComponent);
}

// kStoreSchema body: the three strings, the generation number, then the
// blobs as in the one-row layout.
void Unpack(const void* data, int size, KarstPolicyInfo* p) {
  const auto* at = static_cast<const char*>(data);
  const char* end = at + size;
  std::string* fields[] = {&p->name, &p->policy_id, &p->description};
  for (std::string* f : fields) {
    std::uint32_t n;
    std::memcpy(&n, at, 4);
    f->assign(at + 4, n);
    at += 4 + n;
  }
  std::memcpy(&p->generation_number, at, 8);
  at += 8;
  Unpacker blobs(at, static_cast<int>(end - at));
  const char* ns;
  const char* blob;
  std::uint32_t nsSize;
  std::uint32_t blobSize;
  p->blobs.reserve(4);
  while (blobs.Next(&ns, &nsSize, &blob, &blobSize)) {
    p->blobs.push_back({std::string(blob, blobSize), std::string(ns, nsSize)});
  }
}
}  // namespace

bool RawPolicyDb::Bounds(sqlite3_int64* low, sqlite3_int64* high) {
  BindCollection(bounds_);
  bool found = false;
  if (sqlite3_step(bounds_) == SQLITE_ROW && sqlite3_column_type(bounds_, 0) != SQLITE_NULL) {
    *low = sqlite3_column_int64(bounds_, 0);
    *high = sqlite3_column_int64(bounds_, 1);
    found = true;
  }
  sqlite3_reset(bounds_);
  return found;
}

void RawPolicyDb::Pack(const KarstPolicyInfo& p) {
  packed_.clear();
  if (layout_ == Layout::kStoreSchema) {
    for (const std::string* f : {&p.name, &p.policy_id, &p.description}) {
      PutU32(static_cast<std::uint32_t>(f->size()), &packed_);
      packed_ += *f;
    }
    char g[8];
    std::memcpy(g, &p.generation_number, 8);
    packed_.append(g, 8);
  }
  for (const KarstPolicyBlob& b : p.blobs) {
    if (b.datastore_namespace.empty()) continue;
    PutU32(static_cast<std::uint32_t>(b.datastore_namespace.size()), &packed_);
    packed_ += b.datastore_namespace;
    PutU32(static_cast<std::uint32_t>(b.blob.size()), &packed_);
    packed_ += b.blob;
  }
}

RawPolicyDb::~RawPolicyDb() {
  while (sqlite3_stmt* s = sqlite3_next_stmt(db_, nullptr)) sqlite3_finalize(s);
  sqlite3_close(db_);
}

void RawPolicyDb::Fail(const char* what) {
  std::fprintf(stderr, "raw sqlite: %s: %s\n", what, db_ ? sqlite3_errmsg(db_) : "no connection");
  std::abort();
}

sqlite3_stmt* RawPolicyDb::Prepare(const char* sql) {
  sqlite3_stmt* s = nullptr;
  if (sqlite3_prepare_v3(db_, sql, -1, SQLITE_PREPARE_PERSISTENT, &s, nullptr) != SQLITE_OK) {
    Fail(sql);
  }
  return s;
}

void RawPolicyDb::Exec(const char* sql) {
  if (sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) != SQLITE_OK) Fail(sql);
}

void RawPolicyDb::Run(sqlite3_stmt* s) {
  if (sqlite3_step(s) != SQLITE_DONE) Fail(sqlite3_sql(s));
  sqlite3_reset(s);
}

void RawPolicyDb::Replace(const std::vector<KarstPolicyInfo>& policies) {
  Run(begin_);
  if (layout_ == Layout::kStoreSchema) {
    sqlite3_int64 low;
    sqlite3_int64 high;
    if (Bounds(&low, &high)) {
      BindCollection(clearPolicies_);
      sqlite3_bind_int64(clearPolicies_, 4, low);
      sqlite3_bind_int64(clearPolicies_, 5, high);
      Run(clearPolicies_);
    }
    for (const KarstPolicyInfo& p : policies) {
      BindCollection(insertPolicy_);
      BindBytes(insertPolicy_, 4, p.name);
      Pack(p);
      BindBytes(insertPolicy_, 5, packed_);
      Run(insertPolicy_);
    }
    Run(commit_);
    return;
  }
  Run(clearPolicies_);
  if (layout_ == Layout::kTwoTables) Run(clearBlobs_);
  for (const KarstPolicyInfo& p : policies) {
    BindBytes(insertPolicy_, 1, p.name);
    BindBytes(insertPolicy_, 2, p.policy_id);
    BindBytes(insertPolicy_, 3, p.description);
    sqlite3_bind_int64(insertPolicy_, 4, p.generation_number);
    if (layout_ == Layout::kOneRow) {
      Pack(p);
      BindBytes(insertPolicy_, 5, packed_);
      Run(insertPolicy_);
    } else {
      Run(insertPolicy_);
      const sqlite3_int64 id = sqlite3_last_insert_rowid(db_);
      int seq = 0;
      for (const KarstPolicyBlob& b : p.blobs) {
        if (b.datastore_namespace.empty()) continue;
        sqlite3_bind_int64(insertBlob_, 1, id);
        sqlite3_bind_int(insertBlob_, 2, seq++);
        BindBytes(insertBlob_, 3, b.datastore_namespace);
        BindBytes(insertBlob_, 4, b.blob);
        Run(insertBlob_);
      }
    }
  }
  Run(commit_);
}

std::vector<KarstPolicyInfo> RawPolicyDb::List() {
  std::vector<KarstPolicyInfo> out;
  if (layout_ == Layout::kStoreSchema) {
    Exec("BEGIN");
    sqlite3_int64 low;
    sqlite3_int64 high;
    if (Bounds(&low, &high)) {
      BindCollection(selectPolicies_);
      sqlite3_bind_int64(selectPolicies_, 4, low);
      sqlite3_bind_int64(selectPolicies_, 5, high);
      int rc;
      while ((rc = sqlite3_step(selectPolicies_)) == SQLITE_ROW) {
        Unpack(sqlite3_column_blob(selectPolicies_, 0), sqlite3_column_bytes(selectPolicies_, 0),
               &out.emplace_back());
      }
      if (rc != SQLITE_DONE) Fail("listing");
      sqlite3_reset(selectPolicies_);
    }
    Exec("COMMIT");
    return out;
  }
  if (layout_ == Layout::kOneRow) {
    sqlite3_stmt* s = selectPolicies_;
    int rc;
    while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
      KarstPolicyInfo& p = out.emplace_back();
      AssignColumn(s, 0, &p.name);
      AssignColumn(s, 1, &p.policy_id);
      AssignColumn(s, 2, &p.description);
      p.generation_number = sqlite3_column_int64(s, 3);
      Unpacker blobs(sqlite3_column_blob(s, 4), sqlite3_column_bytes(s, 4));
      const char* ns;
      const char* blob;
      std::uint32_t nsSize;
      std::uint32_t blobSize;
      p.blobs.reserve(4);
      while (blobs.Next(&ns, &nsSize, &blob, &blobSize)) {
        p.blobs.push_back({std::string(blob, blobSize), std::string(ns, nsSize)});
      }
    }
    if (rc != SQLITE_DONE) Fail("listing");
    sqlite3_reset(s);
    return out;
  }
  // Both tables in one read transaction; both come in policy order, so the
  // blobs are merged onto their policies in one pass.
  Exec("BEGIN");
  std::vector<sqlite3_int64> ids;
  int rc;
  while ((rc = sqlite3_step(selectPolicies_)) == SQLITE_ROW) {
    ids.push_back(sqlite3_column_int64(selectPolicies_, 0));
    KarstPolicyInfo& p = out.emplace_back();
    AssignColumn(selectPolicies_, 1, &p.name);
    AssignColumn(selectPolicies_, 2, &p.policy_id);
    AssignColumn(selectPolicies_, 3, &p.description);
    p.generation_number = sqlite3_column_int64(selectPolicies_, 4);
  }
  if (rc != SQLITE_DONE) Fail("listing policies");
  sqlite3_reset(selectPolicies_);
  std::size_t at = 0;
  while ((rc = sqlite3_step(selectBlobs_)) == SQLITE_ROW) {
    const sqlite3_int64 policy = sqlite3_column_int64(selectBlobs_, 0);
    while (at < ids.size() && ids[at] < policy) ++at;
    if (at == ids.size() || ids[at] != policy) continue;
    KarstPolicyBlob& b = out[at].blobs.emplace_back();
    AssignColumn(selectBlobs_, 2, &b.blob);
    AssignColumn(selectBlobs_, 1, &b.datastore_namespace);
  }
  if (rc != SQLITE_DONE) Fail("listing blobs");
  sqlite3_reset(selectBlobs_);
  Exec("COMMIT");
  return out;
}

std::string RawPolicyDb::BlobByName(const std::string& name, const std::string& ns) {
  sqlite3_stmt* s = selectByName_;
  std::string out;
  if (layout_ == Layout::kStoreSchema) {
    BindCollection(s);
    BindBytes(s, 4, name);
    if (sqlite3_step(s) == SQLITE_ROW) {
      KarstPolicyInfo p;
      Unpack(sqlite3_column_blob(s, 0), sqlite3_column_bytes(s, 0), &p);
      for (const KarstPolicyBlob& b : p.blobs) {
        if (b.datastore_namespace == ns) {
          out = b.blob;
          break;
        }
      }
    }
    sqlite3_reset(s);
    return out;
  }
  BindBytes(s, 1, name);
  if (layout_ == Layout::kOneRow) {
    if (sqlite3_step(s) == SQLITE_ROW) {
      Unpacker blobs(sqlite3_column_blob(s, 0), sqlite3_column_bytes(s, 0));
      const char* n;
      const char* blob;
      std::uint32_t nSize;
      std::uint32_t blobSize;
      while (blobs.Next(&n, &nSize, &blob, &blobSize)) {
        if (nSize == ns.size() && std::memcmp(n, ns.data(), nSize) == 0) {
          out.assign(blob, blobSize);
          break;
        }
      }
    }
  } else {
    BindBytes(s, 2, ns);
    if (sqlite3_step(s) == SQLITE_ROW) AssignColumn(s, 0, &out);
  }
  sqlite3_reset(s);
  return out;
}

}  // namespace karst_bench
