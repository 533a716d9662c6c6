// One SQLite connection and the calls every part of the SQLite store makes
// on it. Each failure is a ConfigStoreException that names the store and what
// was being done, with SQLite's own message and extended result code.

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_CONNECTION_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_CONNECTION_H_

#include <sqlite3.h>

#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>

namespace TavoConfigStore {
namespace sqlite {

// Resets a statement on leaving scope: a statement left mid-result would keep
// its read transaction, and with it a stale snapshot, open.
struct Reset {
  void operator()(sqlite3_stmt* s) const { sqlite3_reset(s); }
};
using Resetter = std::unique_ptr<sqlite3_stmt, Reset>;

class Connection {
 public:
  // "where" starts every message: "configuration store PATH".
  explicit Connection(std::string where) : where_(std::move(where)) {}
  ~Connection() { Close(); }
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Opens the file "name" for reading and writing, never creating it; when
  // that fails, nothing is left open.
  void Open(const std::string& name, int busyTimeoutMs);
  // Finalizes every statement and closes; SQLite rolls back an open
  // transaction.
  void Close();

  sqlite3* Db() const { return db_; }
  bool IsOpen() const { return db_ != nullptr; }
  const std::string& Where() const { return where_; }
  // No transaction open: none was begun, or SQLite rolled one back by itself.
  bool Idle() const { return sqlite3_get_autocommit(db_) != 0; }

  // Throws the connection's current error; call before the statement is reset.
  [[noreturn]] void Fail(const std::string& what) const;

  // A statement prepared for many runs and kept until the caller finalizes
  // it or Close does; a failure to prepare it is a failure of "what", else
  // of preparing "sql".
  sqlite3_stmt* Prepare(std::string_view sql, const char* what = nullptr);
  // The statement of "sql", a string literal, prepared on first use and kept
  // until Close; a failure to prepare it is a failure of "what".
  sqlite3_stmt* Cached(std::string_view sql, const char* what);
  // Runs a cached statement to its end, its rows unread.
  void Run(std::string_view sql, const char* what);
  // The first column of the first row of a cached statement.
  long long Int(std::string_view sql, const char* what);
  // Runs "sql", prepared for this once.
  void Exec(const std::string& sql, const char* what);
  // Rolls back the open transaction, if any, without reporting a failure:
  // for cleaning up while another error is on its way.
  void RollbackQuietly();

  // As a BLOB with its length: every byte, NUL included, survives, and BLOB
  // comparison is plain byte equality.
  void Bind(sqlite3_stmt* s, int index, const std::string& bytes) const;
  // A column's bytes, valid until the statement steps again or is reset.
  static std::string_view Column(sqlite3_stmt* s, int column);

 private:
  std::string where_;
  sqlite3* db_ = nullptr;
  std::unordered_map<std::string_view, sqlite3_stmt*> cached_;
};

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_CONNECTION_H_
