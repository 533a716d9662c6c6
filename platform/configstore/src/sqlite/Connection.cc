#include "Connection.h"

#include "TavoConfigStore/ConfigStoreException.h"

namespace TavoConfigStore {
namespace sqlite {

void Connection::Open(const std::string& name, int busyTimeoutMs) {
  // NOMUTEX turns off SQLite's own locking: the store serializes its calls.
  // Without SQLITE_OPEN_CREATE: the file exists, and should it vanish
  // meanwhile, SQLite must not make one with its own default mode.
  const int rc =
      sqlite3_open_v2(name.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  if (rc != SQLITE_OK) {
    // Without memory for a handle, SQLite gives none to ask for the message.
    const std::string message =
        where_ + ": cannot open: " + (db_ != nullptr ? sqlite3_errmsg(db_) : sqlite3_errstr(rc));
    const int code = db_ != nullptr ? sqlite3_extended_errcode(db_) : rc;
    Close();
    throw ConfigStoreException(message, code);
  }
  sqlite3_extended_result_codes(db_, 1);
  sqlite3_busy_timeout(db_, busyTimeoutMs);
}

void Connection::Close() {
  if (db_ == nullptr) return;
  while (sqlite3_stmt* s = sqlite3_next_stmt(db_, nullptr)) sqlite3_finalize(s);
  sqlite3_close(db_);
  db_ = nullptr;
  cached_.clear();
}

void Connection::Fail(const std::string& what) const {
  throw ConfigStoreException(where_ + ": " + what + ": " + sqlite3_errmsg(db_),
                             sqlite3_extended_errcode(db_));
}

sqlite3_stmt* Connection::Prepare(std::string_view sql, const char* what) {
  sqlite3_stmt* s = nullptr;
  if (sqlite3_prepare_v3(db_, sql.data(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT,
                         &s, nullptr) != SQLITE_OK) {
    Fail(what != nullptr ? what : "preparing \"" + std::string(sql) + "\"");
  }
  return s;
}

sqlite3_stmt* Connection::Cached(std::string_view sql, const char* what) {
  sqlite3_stmt*& s = cached_[sql];
  if (s == nullptr) s = Prepare(sql, what);
  return s;
}

void Connection::Run(std::string_view sql, const char* what) {
  sqlite3_stmt* s = Cached(sql, what);
  Resetter reset(s);
  int rc;
  while ((rc = sqlite3_step(s)) == SQLITE_ROW) {
  }
  if (rc != SQLITE_DONE) Fail(what);
}

long long Connection::Int(std::string_view sql, const char* what) {
  sqlite3_stmt* s = Cached(sql, what);
  Resetter reset(s);
  if (sqlite3_step(s) != SQLITE_ROW) Fail(what);
  return sqlite3_column_int64(s, 0);
}

void Connection::Exec(const std::string& sql, const char* what) {
  if (sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr) != SQLITE_OK) Fail(what);
}

void Connection::RollbackQuietly() {
  if (!Idle()) sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
}

void Connection::Bind(sqlite3_stmt* s, int index, const std::string& bytes) const {
  if (sqlite3_bind_blob64(s, index, bytes.data(), bytes.size(), SQLITE_STATIC) != SQLITE_OK) {
    Fail("binding a value");
  }
}

std::string_view Connection::Column(sqlite3_stmt* s, int column) {
  // A zero-length BLOB comes back as a null pointer.
  const void* data = sqlite3_column_blob(s, column);
  if (data == nullptr) return {};
  return {static_cast<const char*>(data),
          static_cast<std::size_t>(sqlite3_column_bytes(s, column))};
}

}  // namespace sqlite
}  // namespace TavoConfigStore
