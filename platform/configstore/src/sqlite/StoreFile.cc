#include "StoreFile.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "TavoConfigStore/ConfigStore.h"

namespace TavoConfigStore {
namespace sqlite {

bool StoreFile::Exists(const char* suffix) const {
  const std::string file = path_ + suffix;
  struct stat st {};
  if (lstat(file.c_str(), &st) == 0) {
    if (S_ISLNK(st.st_mode)) {
      throw ConfigStoreException(where_ + ": " + RedactLocator(file) +
                                     " is a symbolic link; the store does not follow links",
                                 kErrorSymlink);
    }
    return true;
  }
  const int error = errno;
  if (error == ENOENT || error == ENOTDIR) return false;
  throw ConfigStoreException(
      where_ + ": cannot look up " + RedactLocator(file) + ": " + std::strerror(error),
      SQLITE_CANTOPEN);
}

void StoreFile::Create() const {
  const std::size_t lastSlash = path_.rfind('/');
  std::size_t at = 0;
  while (lastSlash != std::string::npos && at < lastSlash) {
    const std::size_t next = path_.find('/', at + 1);
    const std::string dir = path_.substr(0, next);
    at = next;
    if (dir.empty() || dir.back() == '/') continue;  // "/" or "a//b"
    if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
      const int error = errno;
      // A folder's name could end inside a password the whole path hides.
      const bool hidden = RedactLocator(path_) != path_;
      throw ConfigStoreException(where_ + ": cannot create directory " +
                                     (hidden ? "on its path" : dir) + ": " + std::strerror(error),
                                 SQLITE_CANTOPEN);
    }
  }
  // Made under a name of its own and linked into place: closing a descriptor
  // of the store file itself would drop the POSIX locks of any connection to
  // it in this process (another thread may connect the moment the name
  // appears), and link() never replaces what another process put there first.
  std::string temp = path_ + ".new-XXXXXX";
  const int fd = mkostemp(temp.data(), O_CLOEXEC);  // 0600
  if (fd < 0) {
    throw ConfigStoreException(where_ + ": cannot create: " + std::strerror(errno),
                               SQLITE_CANTOPEN);
  }
  close(fd);
  const int linked = link(temp.c_str(), path_.c_str());
  const int linkErrno = errno;
  unlink(temp.c_str());
  if (linked != 0 && linkErrno != EEXIST) {
    throw ConfigStoreException(where_ + ": cannot create: " + std::strerror(linkErrno),
                               SQLITE_CANTOPEN);
  }
}

void StoreFile::NoteConnected() {
  struct stat st {};
  connected_ =
      lstat(path_.c_str(), &st) == 0 ? std::pair{st.st_dev, st.st_ino} : std::pair<dev_t, ino_t>{};
}

bool StoreFile::Replaced() const {
  struct stat st {};
  if (lstat(path_.c_str(), &st) != 0) return errno == ENOENT || errno == ENOTDIR;
  return std::pair{st.st_dev, st.st_ino} != connected_;
}

void StoreFile::FollowModeInCompanions() const {
  struct stat store {};
  if (stat(path_.c_str(), &store) != 0) return;
  for (const char* suffix : {"-wal", "-shm"}) {
    const std::string file = path_ + suffix;
    struct stat st {};
    if (lstat(file.c_str(), &st) != 0 || st.st_uid != geteuid() ||
        (st.st_mode & 0777) == (store.st_mode & 0777)) {
      continue;
    }
    // By name, not through a descriptor: closing one would drop this
    // process's locks on the file. Never through a link.
    [[maybe_unused]] const int ignored =
        fchmodat(AT_FDCWD, file.c_str(), store.st_mode & 0777, AT_SYMLINK_NOFOLLOW);
  }
}

}  // namespace sqlite
}  // namespace TavoConfigStore
