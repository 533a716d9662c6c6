// Damaged and foreign store files. Each case runs in its own process with a
// deadline, which lists both catalogues, makes every kind of look-up and
// then a write: no case may crash or hang. Damage the store can detect must
// come back as a ConfigStoreException naming the file. Bytes changed inside
// a stored value, an identifier or the index cannot be detected (nothing
// carries a checksum); the figures count those cases.
//
// An empty (0-byte) file is a new, empty store: that is how SQLite reads it,
// and the store never leaves one (the first commit writes the header).

#include "reliability_util.h"

namespace karst_reliability {

const Tag kGood{1, 5, 200}, kNew{2, 9};  // 200 policies: about 70 pages

// What one process can do with the store at "path", one word a step: the
// listing ("intact", "empty", or "differs": records dropped or values
// changed, which nothing can tell), "looked-up", then "wrote" (or
// "wrote-differs": the damage hides part of the new write too). A store
// error ends it: "refused" when its message names the file, else
// "error-<code>".
std::string Probe(
    const std::string& path, const std::function<void()>& asUser = [] {}) {
  const ChildResult r = RunChild(
      [&](int fd) {
        asUser();
        UseStoreAt(path);
        const std::string url = DatastoresFor(kGood)[0].url;
        try {
          const std::string seen = State(ListCatalogue());
          WriteAll(fd, seen == State(kGood, kGood) ? "intact "
                       : seen == " | "             ? "empty "
                                                   : "differs ");
          // Every kind of look-up.
          KarstLib::GetCorraPolicyBlobByName("policy-1") +
              KarstLib::GetCorraPolicyBlobById("id-2") + KarstLib::GetPolicyBlobById("id-1", url) +
              KarstLib::GetDefaultPolicyBlob(url) + KarstLib::GetDbHash().first;
          WriteAll(fd, "looked-up ");
          KarstLib::AddDatastoreInfo(DatastoresFor(kNew));
          WriteAll(fd, KarstLib::ListDatastoreInfo() == DatastoresFor(kNew) ? "wrote "
                                                                            : "wrote-differs ");
        } catch (const ConfigStoreException& e) {
          WriteAll(fd, e.Message().find(path) != std::string::npos
                           ? "refused "
                           : "error-" + std::to_string(e.Code()) + " ");
        }
      },
      Scaled(30, 90));
  return r.Ok() ? r.output.substr(0, r.output.size() - 1) : "CRASH " + r.Describe();
}

class DamagedFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    UseStoreAt(good_);
    TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(good_));
    StoreCatalogue({PoliciesFor(kGood), DatastoresFor(kGood)});
    TavoConfigStore::SetGlobalStore(nullptr);  // closes: the file, an empty log and its index
    bytes_ = ReadFile(good_);
  }

  // A file with "bytes" as its content and no log beside it.
  std::string Damaged(const std::string& name, const std::string& bytes) {
    const std::string path = dir_.File(name);
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(path + suffix);
    WriteFile(path, bytes);
    return path;
  }

  ScratchDir dir_;
  const std::string good_ = dir_.File("good.db");
  std::string bytes_;
  std::mt19937_64 rng_{7};
};

TEST_F(DamagedFileTest, TruncatedGarbledAndForeignFiles) {
  const std::string foreign = dir_.File("foreign.db");
  RawDb(foreign, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE)
      .Exec("CREATE TABLE t(x); INSERT INTO t VALUES('theirs');");
  std::filesystem::create_directory(dir_.File("dir.db"));
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"truncated to 100 bytes", Damaged("t100.db", bytes_.substr(0, 100))},
      {"truncated to 4096 bytes", Damaged("t4096.db", bytes_.substr(0, 4096))},
      {"truncated to half", Damaged("half.db", bytes_.substr(0, bytes_.size() / 2))},
      {"header replaced with random bytes",
       Damaged("header.db", RandomBytes(100, rng_) + bytes_.substr(100))},
      {"header fields garbled after the magic string",
       Damaged("fields.db", bytes_.substr(0, 16) + RandomBytes(84, rng_) + bytes_.substr(100))},
      {"random bytes of the same size", Damaged("noise.db", RandomBytes(bytes_.size(), rng_))},
      {"text file", Damaged("text.db", "policies: none\n")},
      {"a SQLite database of another program", foreign},
      {"a directory where the file should be", dir_.File("dir.db")},
      {"a path under a regular file", good_ + "/store.db"}};
  int refused = 0;
  for (const auto& [name, path] : cases) {
    const std::string before = std::filesystem::is_regular_file(path) ? ReadFile(path) : "";
    const std::string outcome = Probe(path);
    // No store can be under a file: reads find none, the write is refused.
    const bool underFile = path == good_ + "/store.db";
    refused += outcome == (underFile ? "empty looked-up refused" : "refused");
    EXPECT_EQ(outcome, underFile ? "empty looked-up refused" : "refused") << name;
    // A file the store refuses is left as it was.
    EXPECT_TRUE(before.empty() || ReadFile(path) == before) << name;
  }
  const std::string empty = Probe(Damaged("empty.db", ""));
  EXPECT_EQ(empty, "empty looked-up wrote");
  ReportFigures("damaged-files",
                "damaged-files: %zu truncated, garbled, foreign or misplaced files: refused with "
                "an error naming the file %d, wrong (crashes, hangs, other) %zu; a 0-byte file is "
                "a new empty store: %s",
                cases.size(), refused, cases.size() - refused, empty.c_str());
}

// Damage to an identifier or the index drops a record, which SQLite cannot
// tell from a deletion; bytes changed inside a value cannot be seen either,
// as nothing keeps a checksum of values. Neither may crash, hang, or fail the
// listing with an error that does not name the file.
TEST_F(DamagedFileTest, RandomBytesInEveryPage) {
  const std::size_t pageSize = 4096, pages = bytes_.size() / pageSize, stride = Scaled(1, 4);
  std::map<std::string, int> outcomes;
  for (std::size_t base = 0; base < pages * pageSize; base += stride * pageSize) {
    for (bool whole : {false, true}) {
      std::string bytes = bytes_;
      if (whole) bytes.replace(base, pageSize, RandomBytes(pageSize, rng_));
      for (int i = 0; i < 8 && !whole; ++i)
        bytes[base + rng_() % pageSize] = static_cast<char>(rng_());
      const std::string outcome = Probe(Damaged("page.db", bytes));
      const bool bad = outcome.rfind("CRASH", 0) == 0 || outcome.rfind("error", 0) == 0;
      EXPECT_FALSE(bad) << "page " << base / pageSize + 1 << (whole ? " all random: " : ": ")
                        << outcome;
      ++outcomes[bad ? "WRONG" : outcome];
    }
  }
  std::string detail;
  for (const auto& [what, n] : outcomes) detail += "; " + what + " " + std::to_string(n);
  ReportFigures("damaged-pages",
                "damaged-pages: %zu pages, each given 8 random bytes, then made all random: "
                "crashes, hangs or unclear errors %d%s",
                (pages + stride - 1) / stride, outcomes["WRONG"], detail.c_str());
}

// A store whose last commits are still in the log when the process died,
// with the log damaged: SQLite's frame checksums keep each collection whole.
TEST_F(DamagedFileTest, DamagedLog) {
  const std::string path = dir_.File("wal.db");
  UseStoreAt(path);
  const int rounds = Scaled(40, 10);
  int wrong = 0;
  for (int round = 0; round < rounds; ++round) {
    Damaged("wal.db", bytes_);
    ASSERT_TRUE(RunChild([](int) {
                  StoreCatalogue({PoliciesFor(kNew), DatastoresFor(kNew)});
                  _exit(0);  // the commits stay in the log
                }).Ok());
    std::filesystem::remove(path + "-shm");
    std::string log = ReadFile(path + "-wal");
    for (int i = 0; i <= round % 8; ++i) log[rng_() % log.size()] = static_cast<char>(rng_());
    WriteFile(path + "-wal", log);
    const std::string seen = ReadInFreshProcess();
    const bool right = seen == State(kNew, kNew) || seen == State(kGood, kGood) ||
                       seen == State(kNew, kGood) || seen == State(kGood, kNew);
    wrong += !right;
    EXPECT_TRUE(right) << seen;
  }
  ReportFigures("damaged-log",
                "damaged-log: %d logs with unchecked commits and random damage: each collection "
                "old or new %d, wrong (crashes, torn) %d",
                rounds, rounds - wrong, wrong);
}

// Permissions only bind a user that is not root: the cases run as "nobody".
// Each case either lists intact and only the write is refused, or is refused
// with an error naming the file.
TEST_F(DamagedFileTest, UnreadableAndReadOnlyPaths) {
  const passwd* nobody = getuid() == 0 ? getpwnam("nobody") : getpwuid(getuid());
  if (nobody == nullptr) GTEST_SKIP() << "no user \"nobody\" to run the permission cases as";
  auto becomeUser = [nobody] {
    if (getuid() == 0 && (setgroups(0, nullptr) | setgid(nobody->pw_gid) | setuid(nobody->pw_uid)))
      _exit(5);
  };
  chmod(dir_.Path().c_str(), 0755);  // the scratch folder is private
  struct Case {
    const char* folder;
    mode_t folderMode, fileMode;  // 0: a store to be created
    bool withLog;                 // the -wal and -shm a writer leaves, readable as the file
    const char* outcome;
  };
  // In "closed" there is no room for the log next to the file; "shared" is
  // a store others may read but not write, as an operator would set it up.
  const Case cases[] = {{"noread", 0777, 0000, false, "refused"},
                        {"readonly", 0777, 0444, false, "intact looked-up refused"},
                        {"closed", 0555, 0666, false, "refused"},
                        {"locked", 0700, 0666, false, "refused"},
                        {"shared", 0755, 0644, true, "intact looked-up refused"},
                        {"closed/new", 0, 0, false, "empty looked-up refused"}};
  int wrong = 0;
  std::string detail;
  for (const Case& c : cases) {
    const std::string folder = dir_.File(c.folder), path = folder + "/store.db";
    if (c.folderMode != 0) {
      std::filesystem::create_directories(folder);
      for (const char* suffix : {"", "-wal", "-shm"}) {
        if (*suffix != '\0' && !c.withLog) continue;
        std::filesystem::copy_file(good_ + suffix, path + suffix);
        chmod((path + suffix).c_str(), c.fileMode);
      }
      chmod(folder.c_str(), c.folderMode);
    }
    const std::string outcome = Probe(path, becomeUser);
    const bool right = outcome == c.outcome;
    wrong += !right;
    EXPECT_TRUE(right) << c.folder << ": " << outcome;
    detail += "; " + std::string(c.folder) + ": " + outcome;
  }
  for (const char* folder : {"closed", "locked"}) chmod(dir_.File(folder).c_str(), 0755);
  ReportFigures("damaged-permissions",
                "damaged-permissions: %zu cases as uid %d: wrong (crashes, hangs, unclear "
                "errors) %d%s",
                std::size(cases), static_cast<int>(nobody->pw_uid), wrong, detail.c_str());
}

}  // namespace karst_reliability
