// The SQLite store's file on disk. The file is the catalogue, so it is
// handled as a secret: created 0600 in directories made 0700 (whatever the
// umask allows), never through a symbolic link, and not at all by a reader (a
// store nobody wrote reads as empty).

#ifndef TAVOCONFIGSTORE_SRC_SQLITE_STORE_FILE_H_
#define TAVOCONFIGSTORE_SRC_SQLITE_STORE_FILE_H_

#include <sys/types.h>

#include <string>
#include <utility>

namespace TavoConfigStore {
namespace sqlite {

class StoreFile {
 public:
  // "where" starts every message.
  StoreFile(std::string path, std::string where)
      : path_(std::move(path)), where_(std::move(where)) {}

  // The name to give SQLite: a relative path goes as "./name", since SQLite
  // reads ":memory:" and, in some builds, "file:..." as something else.
  std::string SqliteName() const { return path_[0] == '/' ? path_ : "./" + path_; }

  // Whether something is at the path plus "suffix" ("-wal", say) that is not
  // a symbolic link; a link throws kErrorSymlink: following a link planted in
  // a shared directory would write the catalogue wherever its owner chose.
  bool Exists(const char* suffix = "") const;

  // Makes the missing directories and an empty file at the path. Something
  // another process put there first is left as it is.
  void Create() const;

  // Notes which file is at the path, just before connecting to it: should the
  // file be replaced in between, the next look finds another file and
  // connects again, rather than never.
  void NoteConnected();

  // Whether the path now names another file than the connected one, or none:
  // a deploy may move a new store over it, or remove it and create it again.
  // A failed look (a folder made unreadable) changes nothing.
  bool Replaced() const;

  // SQLite gives a new -wal and -shm the mode of the store file; after a
  // chmod of the file (to let a group read it, say) they follow it here, so
  // that whoever may read the file may read the store. Best effort: the owner
  // reads the store either way.
  void FollowModeInCompanions() const;

 private:
  std::string path_;
  std::string where_;
  std::pair<dev_t, ino_t> connected_{};
};

}  // namespace sqlite
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_SQLITE_STORE_FILE_H_
