#include "RawSqlite.h"

#include <stdexcept>

namespace karst_test {

RawDb::RawDb(const std::string& path, int flags) {
  if (sqlite3_open_v2(path.c_str(), &db_, flags, nullptr) != SQLITE_OK) {
    const std::string error = sqlite3_errmsg(db_);
    sqlite3_close(db_);
    throw std::runtime_error("cannot open " + path + ": " + error);
  }
}

RawDb::~RawDb() { sqlite3_close(db_); }

int RawDb::Exec(const std::string& sql) {
  return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr);
}

std::string RawDb::QueryText(const std::string& sql) {
  sqlite3_stmt* s = nullptr;
  if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr) != SQLITE_OK) {
    throw std::runtime_error(sql + ": " + sqlite3_errmsg(db_));
  }
  std::string out;
  const int rc = sqlite3_step(s);
  if (rc == SQLITE_ROW) {
    const auto* text = static_cast<const char*>(sqlite3_column_blob(s, 0));
    out.assign(text == nullptr ? "" : text, static_cast<std::size_t>(sqlite3_column_bytes(s, 0)));
  }
  sqlite3_finalize(s);
  if (rc != SQLITE_ROW && rc != SQLITE_DONE) {
    throw std::runtime_error(sql + ": " + sqlite3_errstr(rc));
  }
  return out;
}

}  // namespace karst_test
