// A plain SQLite connection to a store file, for tests that read, change or
// lock the file behind the store's back.

#ifndef KARST_TESTS_SUPPORT_RAW_SQLITE_H_
#define KARST_TESTS_SUPPORT_RAW_SQLITE_H_

#include <sqlite3.h>

#include <string>

namespace karst_test {

class RawDb {
 public:
  // Throws std::runtime_error when the file cannot be opened.
  explicit RawDb(const std::string& path, int flags = SQLITE_OPEN_READWRITE);
  ~RawDb();
  RawDb(const RawDb&) = delete;
  RawDb& operator=(const RawDb&) = delete;

  // SQLite's result code; rows are ignored.
  int Exec(const std::string& sql);
  // The first column of the first row ("" when there is none); throws
  // std::runtime_error when the statement fails.
  std::string QueryText(const std::string& sql);

 private:
  sqlite3* db_ = nullptr;
};

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_RAW_SQLITE_H_
