// Damaged and foreign store files. Each case runs in its own process with a
// deadline, which lists both catalogues, makes every kind of look-up and
// then a write: no case may crash or hang. Damage the store can detect must
// come back as a ConfigStoreException naming the file. Bytes changed inside
// a stored value, an identifier or the index cannot be detected (nothing
// carries a checksum); the figures count those cases.
//
// An empty (0-byte) file is a new, empty store: that is how SQLite reads it,
// and nothing the store does ever leaves one (the first commit writes the
// header), so such a file was made by something else, say a touch or a
// copy that failed before it started.

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "FileBytes.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/ConfigStoreException.h"
#include "TavoKarst/KarstLib.h"
#include "reliability_util.h"

namespace karst_reliability {
namespace {

using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstLib;

const Tag kGood{1, 5};
const Tag kNew{2, 9};
constexpr int kGoodPolicies = 200;  // about 70 pages

using testfiles::ReadFile;
using testfiles::WriteFile;

// What one process could do with the file at the store path.
struct Result {
  bool crashed = false, hung = false;
  std::string raw;
  // "list": "ok" or the error; then counts.
  std::string list, lookup, write;
  int policies = 0, policiesKept = 0, datastores = 0, datastoresKept = 0;
  bool intact = false;      // both lists exactly as written
  bool clearError = false;  // the first failure named the file
  bool failed = false;      // some step failed with a store error
};

// Runs in the child: one line per step.
void ProbeStore(int fd, const std::string& path) {
  UseStoreAt(path);
  const auto goodPolicies = PoliciesFor(kGood, kGoodPolicies);
  const auto goodDatastores = DatastoresFor(kGood);
  auto error = [&](const char* step, const ConfigStoreException& e) {
    std::string msg = e.Message();
    for (char& c : msg) {
      if (c == '\n') c = ' ';
    }
    WriteAll(fd, std::string(step) + " error " + std::to_string(e.Code()) + " " + msg + "\n");
  };
  try {
    const auto policies = KarstLib::ListPolicyInfo();
    const auto datastores = KarstLib::ListDatastoreInfo();
    int pk = 0, dk = 0;
    for (const auto& p : policies) {
      for (const auto& g : goodPolicies) pk += p == g ? 1 : 0;
    }
    for (const auto& d : datastores) {
      for (const auto& g : goodDatastores) dk += d == g ? 1 : 0;
    }
    const bool intact = policies == goodPolicies && datastores == goodDatastores;
    WriteAll(fd, "list ok " + std::to_string(policies.size()) + " " + std::to_string(pk) + " " +
                     std::to_string(datastores.size()) + " " + std::to_string(dk) + " " +
                     std::to_string(intact) + "\n");
  } catch (const ConfigStoreException& e) {
    error("list", e);
    return;
  }
  try {
    KarstLib::GetCorraPolicyBlobByName("policy-1");
    KarstLib::GetCorraPolicyBlobById("id-2");
    KarstLib::GetPolicyBlobById("id-1", goodDatastores[0].url);
    KarstLib::GetDefaultPolicyBlob(goodDatastores[0].url);
    KarstLib::GetDbHash();
    WriteAll(fd, "lookup ok\n");
  } catch (const ConfigStoreException& e) {
    error("lookup", e);
    return;
  }
  try {
    KarstLib::AddDatastoreInfo(DatastoresFor(kNew));
    const Observed o = Classify(KarstLib::ListDatastoreInfo());
    WriteAll(fd, std::string("write ok ") +
                     (o.kind == Observed::kWhole && o.tag == kNew ? "new" : "WRONG") + "\n");
  } catch (const ConfigStoreException& e) {
    error("write", e);
  }
}

Result Probe(const std::string& path, const std::function<void()>& asUser = nullptr) {
  const ChildResult r = RunChild(
      [&](int fd) {
        if (asUser) asUser();
        ProbeStore(fd, path);
      },
      Scaled(30, 90));
  Result res;
  res.raw = r.output;
  res.hung = r.timedOut;
  res.crashed = !r.timedOut && (!r.exited || r.code != 0);
  std::istringstream lines(r.output);
  for (std::string line; std::getline(lines, line);) {
    std::istringstream words(line);
    std::string step, status;
    words >> step >> status;
    if (status == "error") {
      res.failed = true;
      res.clearError = line.find(path) != std::string::npos;
    }
    if (step == "list") {
      res.list = status;
      if (status == "ok") {
        int intact = 0;
        words >> res.policies >> res.policiesKept >> res.datastores >> res.datastoresKept >> intact;
        res.intact = intact != 0;
      }
    } else if (step == "lookup") {
      res.lookup = status;
    } else if (step == "write") {
      res.write = line.substr(line.find(' ') + 1);
    }
  }
  return res;
}

class DamagedFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    good_ = dir_.File("good.db");
    UseStoreAt(good_);
    const ChildResult r = RunChild([this](int) {
      TavoConfigStore::SetGlobalStore(TavoConfigStore::NewSqliteStore(good_));
      KarstLib::AddPolicyInfo(PoliciesFor(kGood, kGoodPolicies));
      KarstLib::AddDatastoreInfo(DatastoresFor(kGood));
      TavoConfigStore::SetGlobalStore(nullptr);  // closes: one file, no log
    });
    ASSERT_EQ(r.code, 0) << r.Describe();
    bytes_ = ReadFile(good_);
    ASSERT_GT(bytes_.size(), 16u * 4096);
    ASSERT_TRUE(Probe(good_).intact);
  }

  // A copy of the good store with "bytes" as its content.
  std::string Damaged(const std::string& name, const std::string& bytes) {
    const std::string path = dir_.File(name);
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(path + suffix);
    WriteFile(path, bytes);
    return path;
  }

  ScratchDir dir_;
  std::string good_;
  std::string bytes_;
};

std::string Describe(const Result& r) {
  return (r.crashed ? "CRASH " : "") + std::string(r.hung ? "HANG " : "") + r.raw;
}

TEST_F(DamagedFileTest, TruncatedGarbledAndForeignFiles) {
  struct Case {
    std::string name;
    std::string path;
    bool mustFail;  // the damage is detectable: a clear error is required
  };
  std::vector<Case> cases;
  std::mt19937 rng(7);
  auto random = [&](std::size_t n) {
    std::string s(n, '\0');
    for (char& c : s) c = static_cast<char>(rng());
    return s;
  };
  cases.push_back({"truncated to 100 bytes", Damaged("t100.db", bytes_.substr(0, 100)), true});
  cases.push_back({"truncated to 4096 bytes", Damaged("t4096.db", bytes_.substr(0, 4096)), true});
  cases.push_back(
      {"truncated to half", Damaged("half.db", bytes_.substr(0, bytes_.size() / 2)), true});
  cases.push_back({"header replaced with random bytes",
                   Damaged("header.db", random(100) + bytes_.substr(100)), true});
  cases.push_back({"header fields garbled after the magic string",
                   Damaged("fields.db", bytes_.substr(0, 16) + random(84) + bytes_.substr(100)),
                   true});
  cases.push_back(
      {"random bytes of the same size", Damaged("noise.db", random(bytes_.size())), true});
  cases.push_back({"text file", Damaged("text.db", "policies: none\n"), true});
  {
    const std::string foreign = dir_.File("foreign.db");
    sqlite3* db = nullptr;
    sqlite3_open(foreign.c_str(), &db);
    sqlite3_exec(db, "CREATE TABLE t(x); INSERT INTO t VALUES('theirs');", nullptr, nullptr,
                 nullptr);
    sqlite3_close(db);
    cases.push_back({"a SQLite database of another program", foreign, true});
  }
  std::filesystem::create_directory(dir_.File("dir.db"));
  cases.push_back({"a directory where the file should be", dir_.File("dir.db"), true});
  cases.push_back({"a path under a regular file", good_ + "/store.db", true});

  int crashes = 0, hangs = 0, clear = 0, unclear = 0;
  std::string unclearCases;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string before = std::filesystem::is_regular_file(c.path) ? ReadFile(c.path) : "";
    const Result r = Probe(c.path);
    crashes += r.crashed;
    hangs += r.hung;
    EXPECT_FALSE(r.crashed || r.hung) << Describe(r);
    if (r.failed && r.clearError && r.list == "error") {
      ++clear;
    } else {
      ++unclear;
      unclearCases += " [" + c.name + ": " + r.raw + "]";
      if (c.mustFail) ADD_FAILURE() << "no clear error: " << Describe(r);
    }
    // A file the store refuses is left as it was.
    if (r.list == "error" && !before.empty()) {
      EXPECT_EQ(ReadFile(c.path), before);
    }
  }

  // Empty: a new store.
  const Result empty = Probe(Damaged("empty.db", ""));
  EXPECT_FALSE(empty.crashed || empty.hung) << Describe(empty);
  EXPECT_EQ(empty.list, "ok");
  EXPECT_EQ(empty.policies + empty.datastores, 0);
  EXPECT_EQ(empty.write, "ok new");

  ReportFigures("damaged-files", "damaged-files: " + std::to_string(cases.size()) +
                                     " truncated, garbled, foreign or misplaced files: crashes " +
                                     std::to_string(crashes) + ", hangs " + std::to_string(hangs) +
                                     ", clear error naming the file " + std::to_string(clear) +
                                     ", other " + std::to_string(unclear) + unclearCases +
                                     "; a 0-byte file opens as a new empty store (listing " +
                                     (empty.list == "ok" ? "empty" : "FAILED") + ", write " +
                                     empty.write + ")");
  EXPECT_EQ(crashes + hangs, 0);
}

TEST_F(DamagedFileTest, RandomBytesInEveryPage) {
  const std::size_t pageSize = 4096;
  const std::size_t pages = bytes_.size() / pageSize;
  const int stride = Scaled(1, 4);
  std::mt19937 rng(11);
  std::map<std::string, int> outcomes;
  int crashes = 0, hangs = 0, altered = 0, tried = 0;
  for (std::size_t page = 0; page < pages; page += stride) {
    for (int variant = 0; variant < 2; ++variant) {
      std::string bytes = bytes_;
      const std::size_t base = page * pageSize;
      if (variant == 0) {
        // A few bytes at random places in the page.
        for (int i = 0; i < 8; ++i) bytes[base + rng() % pageSize] = static_cast<char>(rng());
      } else {
        for (std::size_t i = 0; i < pageSize; ++i) bytes[base + i] = static_cast<char>(rng());
      }
      SCOPED_TRACE("page " + std::to_string(page + 1) + (variant ? " all random" : " 8 bytes"));
      const Result r = Probe(Damaged("page.db", bytes));
      ++tried;
      crashes += r.crashed;
      hangs += r.hung;
      EXPECT_FALSE(r.crashed || r.hung) << Describe(r);
      std::string outcome;
      if (r.crashed || r.hung) {
        outcome = "crash or hang";
      } else if (r.list == "error") {
        outcome = r.clearError ? "listing refused with a clear error" : "listing refused unclearly";
        EXPECT_TRUE(r.clearError) << Describe(r);
      } else if (r.intact) {
        outcome = r.failed ? "listed intact, a later step refused" : "listed intact, all worked";
      } else if (r.policiesKept == r.policies && r.datastoresKept == r.datastores) {
        // Damage to an identifier or to the index: the record no longer
        // matches its collection, which SQLite cannot tell from a deletion.
        outcome = "listed with records missing (undetectable)";
      } else {
        // Bytes changed inside a stored value: neither SQLite nor the store
        // keeps a checksum of values, so this damage cannot be seen.
        outcome = "listed with altered values (undetectable)";
        ++altered;
      }
      ++outcomes[outcome];
    }
  }
  std::string line = "damaged-pages: " + std::to_string(tried) + " damaged copies (" +
                     std::to_string((pages + stride - 1) / stride) +
                     " pages, 8 random bytes or the whole page): crashes " +
                     std::to_string(crashes) + ", hangs " + std::to_string(hangs);
  for (const auto& [what, n] : outcomes) line += "; " + what + " " + std::to_string(n);
  ReportFigures("damaged-pages", line);
  EXPECT_EQ(crashes + hangs, 0);
}

// A store whose last commit is still in the log when the process died, with
// the log damaged: SQLite's frame checksums keep each collection whole.
TEST_F(DamagedFileTest, DamagedLog) {
  const std::string path = dir_.File("wal.db");
  int tried = 0, whole = 0, crashes = 0;
  std::mt19937 rng(5);
  for (int round = 0; round < Scaled(40, 10); ++round) {
    std::filesystem::remove(path + "-wal");
    std::filesystem::remove(path + "-shm");
    std::filesystem::copy_file(good_, path, std::filesystem::copy_options::overwrite_existing);
    UseStoreAt(path);
    ASSERT_EQ(RunChild([](int) {
                KarstLib::AddPolicyInfo(PoliciesFor(kNew));
                KarstLib::AddDatastoreInfo(DatastoresFor(kNew));
                _exit(0);  // the commits stay in the log
              }).code,
              0);
    std::filesystem::remove(path + "-shm");
    std::string log = ReadFile(path + "-wal");
    ASSERT_GT(log.size(), 32u);
    for (int i = 0; i < 1 + round % 8; ++i) log[rng() % log.size()] = static_cast<char>(rng());
    WriteFile(path + "-wal", log);
    const ChildResult r = RunChild([](int fd) {
      const Observed p = Classify(KarstLib::ListPolicyInfo());
      const Observed d = Classify(KarstLib::ListDatastoreInfo());
      auto fine = [](const Observed& o) {
        return o.kind == Observed::kWhole && (o.tag == kNew || o.tag == kGood);
      };
      WriteAll(fd, fine(p) && fine(d) ? "whole" : p.Describe() + " " + d.Describe());
    });
    ++tried;
    crashes += r.timedOut || !r.exited;
    if (r.exited && r.code == 0 && r.output == "whole") {
      ++whole;
    } else {
      ADD_FAILURE() << r.Describe();
    }
  }
  UseStoreAt(good_);
  ReportFigures("damaged-log", "damaged-log: " + std::to_string(tried) +
                                   " logs with unchecked commits and random damage: each "
                                   "collection old or new " +
                                   std::to_string(whole) + ", crashes " + std::to_string(crashes));
  EXPECT_EQ(whole, tried);
}

// Permissions only bind a user that is not root: the cases run as "nobody".
TEST_F(DamagedFileTest, UnreadableAndReadOnlyPaths) {
  const passwd* nobody = getpwnam("nobody");
  if (getuid() == 0 && nobody == nullptr) {
    ReportFigures("damaged-permissions", "damaged-permissions: skipped (no user \"nobody\")");
    GTEST_SKIP() << "no user \"nobody\" to run the permission cases as";
  }
  const uid_t uid = getuid() == 0 ? nobody->pw_uid : getuid();
  const gid_t gid = getuid() == 0 ? nobody->pw_gid : getgid();
  auto becomeUser = [uid, gid] {
    if (getuid() == 0 && (setgroups(0, nullptr) != 0 || setgid(gid) != 0 || setuid(uid) != 0)) {
      _exit(5);
    }
  };
  // The scratch directory is private; open it up to the other user.
  chmod(dir_.Path().c_str(), 0755);
  const std::string shared = dir_.File("shared");
  std::filesystem::create_directory(shared);
  chmod(shared.c_str(), 0777);

  struct Case {
    std::string name;
    std::string path;
    bool readable;  // the listing may work
  };
  std::vector<Case> cases;
  auto copy = [&](const std::string& name, mode_t mode) {
    const std::string path = shared + "/" + name;
    std::filesystem::copy_file(good_, path);
    chmod(path.c_str(), mode);
    return path;
  };
  cases.push_back({"file without read permission", copy("noread.db", 0000), false});
  cases.push_back({"read-only file", copy("readonly.db", 0444), true});
  {
    const std::string closed = dir_.File("closed");
    std::filesystem::create_directory(closed);
    std::filesystem::copy_file(good_, closed + "/store.db");
    chmod((closed + "/store.db").c_str(), 0666);
    chmod(closed.c_str(), 0555);  // no room for the log next to the file
    cases.push_back({"store in a directory without write permission", closed + "/store.db", true});
    const std::string locked = dir_.File("locked");
    std::filesystem::create_directory(locked);
    std::filesystem::copy_file(good_, locked + "/store.db");
    chmod(locked.c_str(), 0700);
    cases.push_back({"store in a directory the user cannot enter", locked + "/store.db", false});
    cases.push_back({"store to be created in a directory without write permission",
                     closed + "/new/store.db", false});
  }

  int crashes = 0, hangs = 0, clear = 0, readWorked = 0, writeRefused = 0;
  std::string detail;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const Result r = Probe(c.path, becomeUser);
    crashes += r.crashed;
    hangs += r.hung;
    EXPECT_FALSE(r.crashed || r.hung) << Describe(r);
    // Either the store is refused with an error naming the file, or it lists
    // intact and only the write is refused, clearly.
    if (r.list == "ok") {
      EXPECT_TRUE(c.readable) << Describe(r);
      EXPECT_TRUE(r.intact) << Describe(r);
      ++readWorked;
      if (r.write.rfind("error", 0) == 0) ++writeRefused;
    }
    if (r.failed && r.clearError) {
      ++clear;
    } else {
      ADD_FAILURE() << "no clear error: " << Describe(r);
    }
    std::string first = r.raw.substr(0, r.raw.find('\n'));
    detail += "; " + c.name + ": " + (r.list == "ok" ? "listed, write " + r.write : first);
  }
  ReportFigures("damaged-permissions",
                "damaged-permissions: " + std::to_string(cases.size()) + " cases as uid " +
                    std::to_string(uid) + ": crashes " + std::to_string(crashes) + ", hangs " +
                    std::to_string(hangs) + ", clear error naming the file " +
                    std::to_string(clear) + " (listing still worked " + std::to_string(readWorked) +
                    ", write refused " + std::to_string(writeRefused) + ")" + detail);
  chmod(dir_.File("closed").c_str(), 0755);
  chmod(dir_.File("locked").c_str(), 0755);
  EXPECT_EQ(crashes + hangs, 0);
}

}  // namespace
}  // namespace karst_reliability
