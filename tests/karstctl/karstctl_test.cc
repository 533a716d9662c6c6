// karstctl end to end: the built binary against a store file of its own.
#include <fcntl.h>
#include <poll.h>
#include <pwd.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include "Args.h"
#include "Child.h"
#include "Cli.h"
#include "EtcdCluster.h"
#include "FaultVfs.h"
#include "Files.h"
#include "Json.h"
#include "RawSqlite.h"
#include "Records.h"

#ifndef KARSTCTL_BINARY
#error "KARSTCTL_BINARY must name the built karstctl"
#endif

namespace karst_test {
namespace {

using karstctl::Json;
using TavoKarst::KarstLib;
using ::testing::HasSubstr;

struct ToolResult {
  int status;  // exit status; 128 + signal number when killed
  std::string out, err;
};

[[noreturn]] void ExecKarstctl(std::vector<std::string> args) {
  args.insert(args.begin(), KARSTCTL_BINARY);
  Exec(args);
}

// karstctl left running (watch), its standard output read line by line as
// it comes; its standard error is in Errors().
class Background {
 public:
  Background(const std::vector<std::string>& args, const ScratchDir& dir)
      : out_(dir.File("background.out")), err_(dir.File("background.err")) {
    WriteFile(out_, "");
    WriteFile(err_, "");
    pid_ = fork();
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);  // not outliving a test that fails first
      dup2(open(out_.c_str(), O_WRONLY), 1);
      dup2(open(err_.c_str(), O_WRONLY), 2);
      ExecKarstctl(args);
    }
  }
  ~Background() {
    if (pid_ > 0) Stop(SIGKILL);
  }
  Background(const Background&) = delete;
  Background& operator=(const Background&) = delete;

  // The next line, or "" when none is whole within "seconds".
  std::string NextLine(double seconds) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    for (;; usleep(10000)) {
      const std::string out = ReadFile(out_);
      const std::size_t end = out.find('\n', read_);
      if (end != std::string::npos) {
        const std::size_t start = std::exchange(read_, end + 1);
        return out.substr(start, read_ - start);
      }
      if (std::chrono::steady_clock::now() > deadline) return "";
    }
  }
  // Its standard error, once there is some or "seconds" have passed.
  std::string Errors(double seconds = 0) const {
    for (int waited = 0; waited < seconds * 1000 && ReadFile(err_).empty(); waited += 50) {
      usleep(50000);
    }
    return ReadFile(err_);
  }

  // Sends "signal"; the exit status (128 + signal when killed by one), or -1
  // when it is still running ten seconds later.
  int Stop(int signal) {
    kill(pid_, signal);
    const int status = WaitFor(pid_, 10);
    if (status == -1) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    pid_ = -1;
    if (status == -1) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

 private:
  const std::string out_, err_;
  pid_t pid_;
  std::size_t read_ = 0;
};

// Each test has an empty store in its own folder; the library in this process
// and any karstctl run without --store use it too.
class Karstctl : public ::testing::Test {
 protected:
  void SetUp() override { UseStoreAt(store_); }
  void TearDown() override { unsetenv("TAVO_CONFIGSTORE_PATH"); }

  // Runs karstctl with "args" and "input" on stdin; stdout comes back through
  // the child's result pipe unless "outPath" takes it, and the descriptors in
  // "closed" are closed. Killed after a minute.
  ToolResult RunTool(std::vector<std::string> args, const std::string& input = "",
                     const char* outPath = nullptr, const std::vector<int>& closed = {}) {
    WriteFile(dir_.File("stdin"), input);
    const ChildResult child = RunChild(
        [&](int resultFd) {
          dup2(open(dir_.File("stdin").c_str(), O_RDONLY), 0);
          dup2(outPath ? open(outPath, O_WRONLY) : resultFd, 1);
          dup2(open(dir_.File("stderr").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), 2);
          for (int fd : closed) close(fd);
          ExecKarstctl(args);
        },
        60);
    return {child.exited ? child.code : 128 + child.code, child.output,
            ReadFile(dir_.File("stderr"))};
  }
  ToolResult Run(std::vector<std::string> args, const std::string& input = "") {
    args.insert(args.begin(), {"--store", store_});
    return RunTool(args, input);
  }
  // A command that must succeed quietly; its stdout.
  std::string Ok(const std::vector<std::string>& args, const std::string& input = "") {
    const ToolResult result = Run(args, input);
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, "");
    return result.out;
  }

  // What hash prints for "store", on one line as watch prints it.
  std::string HashLine(const std::string& store) {
    std::string line;
    for (char c : RunTool({"--store", store, "hash"}).out) {
      if (c != ' ' && c != '\n') line += c;
    }
    return line + "\n";
  }

  ScratchDir dir_;
  std::string store_ = dir_.File("store.db");
};

// A failure is one line on stderr, "karstctl: ..." and nothing on stdout.
void ExpectFailure(const ToolResult& result, int status, const std::string& fragment) {
  EXPECT_EQ(result.status, status);
  EXPECT_THAT(result.err, ::testing::MatchesRegex("karstctl: [^\n]*\n"));
  EXPECT_THAT(result.err, HasSubstr(fragment));
  EXPECT_EQ(result.out, "");
}

// Exactly as export prints it: NUL, JSON escapes and UTF-8 as plain strings,
// bytes that are not UTF-8 (FF 00 FE 01, a surrogate) as base64, and the
// 64-bit number that has no positive twin. Which bytes are UTF-8 the encoding
// test decides.
const char kCatalogue[] = R"({
  "policies": [
    {
      "name": "gold\u0000nul",
      "policy_id": "p-gold",
      "description": "café \"q\" \\ \n\t\u0001",
      "generation_number": -9223372036854775808,
      "blobs": [
        {
          "datastore_namespace": "CORRA",
          "blob": {
            "base64": "/wD+AQ=="
          }
        },
        {
          "datastore_namespace": "NFS",
          "blob": "<nfs/>"
        }
      ]
    }
  ],
  "datastores": [
    {
      "url": {
        "base64": "7aCA"
      },
      "datastore_namespace": "NFS",
      "drp_policy_id": "p-gold"
    }
  ]
}
)";

TEST_F(Karstctl, ExportImportRoundTripIsByteExact) {
  WriteFile(dir_.File("in.json"), kCatalogue);
  Ok({"import", dir_.File("in.json")});
  EXPECT_EQ(KarstLib::ListPolicyInfo(),
            (std::vector<TavoKarst::KarstPolicyInfo>{
                Policy(std::string("gold\0nul", 8), "p-gold",
                       {{std::string("\xff\x00\xfe\x01", 4), "CORRA"}, {"<nfs/>", "NFS"}},
                       "caf\xc3\xa9 \"q\" \\ \n\t\x01", INT64_MIN)}));
  EXPECT_EQ(KarstLib::ListDatastoreInfo(),
            std::vector<TavoKarst::KarstDatastoreInfo>{Datastore("\xed\xa0\x80", "NFS", "p-gold")});
  EXPECT_EQ(Ok({"export"}), kCatalogue);
  const auto hash = KarstLib::GetDbHash();
  EXPECT_EQ(Ok({"hash"}), "{\n  \"policies\": \"" + hash.first + "\",\n  \"datastores\": \"" +
                              hash.second + "\"\n}\n");

  Ok({"reset"});
  EXPECT_EQ(Ok({"export"}), "{\n  \"policies\": [],\n  \"datastores\": []\n}\n");
}

TEST_F(Karstctl, SetReplacesOneCatalogueAndImportOnlyThoseItHolds) {
  // Missing fields take their defaults.
  Ok({"policies", "set", "-"}, R"([{"name": "b", "generation_number": 9223372036854775807}])");
  WriteFile(dir_.File("ds.json"), R"([{"url": "ds://z"}])");
  Ok({"datastores", "set", dir_.File("ds.json")});
  const std::string policies = Ok({"policies", "list"});
  EXPECT_EQ(policies,
            "[\n  {\n    \"name\": \"b\",\n    \"policy_id\": \"\",\n    \"description\": \"\",\n"
            "    \"generation_number\": 9223372036854775807,\n    \"blobs\": []\n  }\n]\n");
  EXPECT_EQ(Ok({"datastores", "list"}),
            "[\n  {\n    \"url\": \"ds://z\",\n    \"datastore_namespace\": \"\",\n"
            "    \"drp_policy_id\": \"\"\n  }\n]\n");

  Ok({"import", "-"}, R"({"datastores": [{"url": "ds://new"}]})");
  Ok({"import", "-"}, "{}");
  EXPECT_EQ(Ok({"policies", "list"}), policies);
  EXPECT_EQ(KarstLib::ListDatastoreInfo(),
            std::vector<TavoKarst::KarstDatastoreInfo>{Datastore("ds://new", "", "")});
  Ok({"policies", "set", "-"}, "[]");
  EXPECT_EQ(Ok({"policies", "list"}), "[]\n");
}

TEST_F(Karstctl, BlobCommandsWriteTheRawBytesOrNothing) {
  Ok({"import", "-"}, R"({
    "policies": [
      {"name": "gold", "policy_id": "p1",
       "blobs": [{"datastore_namespace": "CORRA", "blob": {"base64": "AAr/Cg=="}},
                 {"datastore_namespace": "NFS", "blob": "nfs-gold"}]},
      {"name": "--store", "policy_id": "p2",
       "blobs": [{"datastore_namespace": "CORRA", "blob": "dashes"}]}
    ],
    "datastores": [{"url": "ds://nfs", "datastore_namespace": "NFS", "drp_policy_id": "p1"}]})");
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"blob", "corra-by-id", "p1"}, std::string("\x00\n\xff\n", 4)},
      {{"blob", "corra-by-name", "gold"}, std::string("\x00\n\xff\n", 4)},
      {{"blob", "corra-by-name", "--", "--store"}, "dashes"},  // -- ends the options
      {{"blob", "by-id", "p1", "ds://nfs"}, "nfs-gold"},
      {{"blob", "default", "ds://nfs"}, "nfs-gold"},
      {{"blob", "by-id", "p2", "ds://nfs"}, ""},  // finding nothing is no error
  };
  for (const auto& [args, bytes] : cases) EXPECT_EQ(Ok(args), bytes) << args[1];
}

// Every rejected command line or input exits 2 naming what is wrong, and
// leaves the store file as it was, byte for byte.
TEST_F(Karstctl, BadCommandLinesAndInputsExitTwoAndLeaveTheStoreAlone) {
  Ok({"import", "-"}, R"({"policies": [{"name": "kept"}], "datastores": [{"url": "kept"}]})");
  const std::string before = ReadFile(store_);
  const std::string file = dir_.File("bad.json");
  WriteFile(file, "{\n  \"policies\": [\n    {\"name\": \"x\",}\n  ]\n}\n");
  const std::vector<std::string> imp = {"import", "-"}, pset = {"policies", "set", "-"};
  struct Case {
    std::vector<std::string> args;  // after --store
    std::string input;
    std::string fragment;
  };
  const Case cases[] = {
      {{}, "", "missing command"},
      {{"--store"}, "", "--store needs a PATH"},
      {{"--store=", "hash"}, "", "--store needs a non-empty PATH"},
      {{"hash", "--colour"}, "", "unknown option '--colour'"},
      {{"--wait", "-1", "hash"}, "", "--wait needs a non-negative number of SECONDS, not '-1'"},
      {{"hash", "--wait=1e3"}, "", "not '1e3'"},
      {{"hash", "--wait"}, "", "--wait needs SECONDS"},
      {{"blob"},
       "",
       "karstctl: missing subcommand: blob needs one of by-id, corra-by-id, "
       "corra-by-name, default\n"},
      {{"policies", "drop"}, "", "unknown command 'policies drop'"},
      {{"frob", "--help"}, "", "unknown command 'frob'"},
      {{"blob", "by-id", "p1"}, "", "'blob by-id' needs POLICY_ID URL"},
      {{"hash", "now"}, "", "too many arguments for 'hash'"},
      {{"import", dir_.File("none")}, "", "cannot open " + dir_.File("none") + ": No such file"},
      {{"import", dir_.Path()}, "", "cannot read " + dir_.Path()},
      // Control bytes and bytes that are not UTF-8 keep the message on one line.
      {{"import", "no\nsuch\xff"}, "", "cannot open no?such?: "},
      // Text that is not JSON: the source, line and column.
      {{"import", file}, "", "karstctl: " + file + ":3:18: syntax error while parsing object key"},
      {pset, "[{\"name\": \"a\"}", "karstctl: <stdin>:1:15: "},
      {{"check", "-"}, "{\"policies\": 1}", "<stdin>: policies: expected array, got number"},
      {{"datastores", "set", "-"}, "", "<stdin>:1:1: "},
      {imp, "{\"policies\": [{\"name\": \"\xc0\x80\"}]}", "<stdin>:1:25: "},
      {imp, "{} {}", "<stdin>:1:4: "},
      {pset, "[\n  {\"generation_number\": 1e999}]", "<stdin>:2:29: number overflow"},
      {imp, R"({"policies": [{"name": "a", "blobs": [], "name": "b"}]})",
       "<stdin>:1:42: duplicate key \"name\""},
      {imp, "{\"policies\": [],\n \"policies\": []}", "<stdin>:2:2: duplicate key \"policies\""},
      // Records that are not valid: the source, the record and the field.
      {imp, R"({"policies": [{}, {"generation_number": 9223372036854775808}]})",
       "karstctl: <stdin>: policies[1].generation_number: out of the signed 64-bit range"},
      {pset, R"([{"generation_number": -9223372036854775809}])", "out of the signed 64-bit range"},
      {pset, R"([{"generation_number": 18446744073709551616}])", "out of the signed 64-bit range"},
      {pset, R"([{"generation_number": 1e30}])", "out of the signed 64-bit range"},
      {pset, R"([{"generation_number": 1.5}])",
       "policies[0].generation_number: expected an integer"},
      {pset, R"([{"generation_number": "5"}])", "expected an integer, got string"},
      {imp, "[]", "<stdin>: top level: expected object, got array"},
      {imp, R"({"policies": [], "pollicies": []})", "top level: unknown key \"pollicies\""},
      {imp, R"({"datastores": null})", "datastores: expected array, got null"},
      {pset, R"({"policies": []})", "policies: expected array, got object"},
      {pset, R"([{}, 7])", "policies[1]: expected object, got number"},
      {pset, R"([{"name": "a", "colour": "red"}])", "policies[0]: unknown key \"colour\""},
      {pset, R"([{"blobs": {}}])", "policies[0].blobs: expected array, got object"},
      {pset, R"([{"blobs": [{}, {"blob": "a", "ns": "b"}]}])",
       "policies[0].blobs[1]: unknown key \"ns\""},
      {pset, R"([{"name": 5}])",
       "policies[0].name: expected a string or {\"base64\": \"...\"}, got number"},
      {pset, R"([{"name": {}}])", "policies[0].name: missing \"base64\""},
      {pset, R"([{"name": {"base64": "AA==", "hex": "00"}}])",
       "policies[0].name: unknown key \"hex\""},
      {pset, R"([{"name": {"base64": 5}}])", "policies[0].name.base64: expected a string"},
      {pset, R"([{"blobs": [{"blob": {"base64": "AB=="}}]}])",
       "policies[0].blobs[0].blob.base64: invalid base64"},
      {{"datastores", "set", "-"},
       R"([{"url": "u"}, {"drp_policy_id": ["p"]}])",
       "datastores[1].drp_policy_id: expected a string"},
      // Good policies stay out when the datastores beside them are bad.
      {imp, R"({"policies": [], "datastores": [{"url": "u", "policy": "p"}]})",
       "datastores[0]: unknown key \"policy\""},
      {{"rollback", "x"}, "", "rollback needs a version number"},
      {{"rollback", "-1"},
       "",
       "rollback needs a version number (1 or more, as history lists them), not '-1'"},
      {{"export", "--version", "0"}, "", "--version needs a version number"},
      {{"export", "--version", "-2"}, "", "--version needs a version number"},
      {{"import", "--version", "1", "-"}, "{}", "'import' does not read the catalogue"},
      {{"history", "depth", "-1"}, "", "history depth needs a number of versions"},
      {{"history", "depth", "many"}, "", "history depth needs a number of versions"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.fragment);
    ExpectFailure(Run(c.args, c.input), 2, c.fragment);
    ASSERT_EQ(ReadFile(store_), before);
  }
}

// history lists what each kept version held as hash and export print it,
// export --version N prints it, and rollback N brings it back whole as a new
// version; a version not kept is a store error that changes nothing.
TEST_F(Karstctl, HistoryExportAtAVersionAndRollback) {
  Ok({"import", "-"}, kCatalogue);
  const std::string hash = Ok({"hash"});
  EXPECT_EQ(Run({"policies", "set", "-"}, "[]").status, 0);  // warns of a dangling datastore
  Ok({"import", "-"}, R"({"policies": [{"name": "a"}, {"name": "b"}], "datastores": []})");

  const Json history = Json::parse(Ok({"history"}));
  ASSERT_EQ(history.size(), 3u);
  const Json& first = history[2];
  EXPECT_EQ(first["version"], 1);
  EXPECT_EQ(first["policies"], 1);
  EXPECT_EQ(first["datastores"], 1);
  EXPECT_EQ(first["hash"], Json::parse(hash));
  EXPECT_EQ(history[0]["version"], 3);
  EXPECT_EQ(history[0]["policies"], 2);
  EXPECT_TRUE(first["time"].is_string());
  char host[256] = {};
  gethostname(host, sizeof(host) - 1);
  EXPECT_EQ(first["host"], host);
  EXPECT_EQ(first["user"], getpwuid(geteuid())->pw_name);

  EXPECT_EQ(Ok({"export", "--version", "1"}), kCatalogue);
  Ok({"rollback", "1"});
  EXPECT_EQ(Ok({"hash"}), hash);
  EXPECT_EQ(Ok({"export"}), kCatalogue);
  EXPECT_EQ(Json::parse(Ok({"history"}))[0]["version"], 4);

  const std::string before = ReadFile(store_);
  ExpectFailure(Run({"rollback", "99"}), 1, "version 99 is not kept (version not kept, 1020)");
  ExpectFailure(Run({"export", "--version", "99"}), 1, "version 99 is not kept");
  EXPECT_EQ(ReadFile(store_), before);
}

// On etcd as on a file: history, export and diff at a kept version, a
// rollback that brings back its digests, and status naming the newest.
TEST_F(Karstctl, HistoryDiffRollbackAndStatusOnEtcd) {
  store_ = karst_test::SharedEtcdCluster().Locator("karstctl-history");
  Ok({"import", "-"}, kCatalogue);
  const std::string hash = Ok({"hash"});
  Ok({"import", "-"}, R"({"policies": [{"name": "a"}, {"name": "b"}], "datastores": []})");

  const Json history = Json::parse(Ok({"history"}));
  ASSERT_EQ(history.size(), 2u);
  EXPECT_EQ(history[1]["hash"], Json::parse(hash));
  EXPECT_EQ(history[0]["policies"], 2);
  EXPECT_EQ(Ok({"export", "--version", "1"}), kCatalogue);
  EXPECT_EQ(Run({"diff", "--version", "1", "-"}, kCatalogue).status, 0);
  EXPECT_EQ(Run({"diff", "-"}, kCatalogue).status, 1);

  Ok({"rollback", "1"});
  EXPECT_EQ(Ok({"hash"}), hash);
  EXPECT_EQ(Ok({"export"}), kCatalogue);
  EXPECT_THAT(Ok({"status"}), HasSubstr("history: the last 10 versions kept, newest 3\n"));
  ExpectFailure(Run({"rollback", "99"}), 1, "version 99 is not kept (version not kept, 1020)");
  EXPECT_EQ(Json::parse(Ok({"history"})).size(), 3u);
}

// Store failures exit 1 in the store's words with the code's name; a read
// where there is no store says just that and creates nothing.
TEST_F(Karstctl, StoreErrorsExitOneInWordsAndBadInputIsFoundFirst) {
  const std::string garbage = dir_.File("garbage.db"), none = dir_.File("none.db");
  WriteFile(garbage, std::string(8192, 'G'));
  Ok({"reset"});
  RawDb locker(store_);
  ASSERT_EQ(locker.Exec("BEGIN IMMEDIATE"), SQLITE_OK);
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"--store", none, "export"}, "karstctl: no store at " + none + "\n"},
      {{"blob", "default", "u", "--store", none}, "karstctl: no store at " + none + "\n"},
      {{"--store", garbage + "/x.db", "hash"}, "karstctl: no store at " + garbage + "/x.db\n"},
      {{"--store", dir_.Path(), "export"}, "(SQLITE_CANTOPEN, 14)\n"},
      {{"--store", garbage, "reset"}, "(SQLITE_NOTADB, 26)\n"},
      {{"--store", store_, "--wait", "0.2", "reset"},
       "karstctl: configuration store " + store_ +
           ": starting a transaction: database is locked (SQLITE_BUSY, 5)\n"},
      {{"--store", garbage, "watch"}, "(SQLITE_NOTADB, 26)\n"},
      // A good etcd locator is no file.
      {{"--store", "etcd://127.0.0.1:9/p", "--wait", "1", "export"}, " (etcd "},
      // A path may look like a locator; its password is not shown.
      {{"--store", "./etcd:/u:cret@h:1/p", "hash"}, "karstctl: no store at ./etcd:***@h:1/p\n"},
  };
  for (const auto& [args, err] : cases) {
    const auto start = std::chrono::steady_clock::now();
    ExpectFailure(RunTool(args), 1, err);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));  // not 10 s
  }
  EXPECT_NE(access(none.c_str(), F_OK), 0);
  ExpectFailure(RunTool({"--store", garbage, "import", "-"}, "["), 2, "<stdin>:1:2: ");
  EXPECT_EQ(ReadFile(garbage), std::string(8192, 'G'));

  // Without a store path nor anything to derive one from, nothing is guessed.
  std::vector<std::pair<std::string, std::string>> saved;
  for (const char* name : {"TAVO_CONFIGSTORE_PATH", "XDG_STATE_HOME", "HOME"}) {
    if (const char* value = getenv(name)) saved.emplace_back(name, value);
    unsetenv(name);
  }
  ExpectFailure(RunTool({"export"}), 1, "(no store path, 1008)\n");
  for (const auto& [name, value] : saved) setenv(name.c_str(), value.c_str(), 1);
}

// A locator that cannot be used, from --store or the environment, is a usage
// error found before the input is read, and nothing is created for it.
TEST_F(Karstctl, BadLocatorsExitTwoBeforeAnythingIsCreated) {
  const std::string cwd = std::filesystem::current_path(), here = dir_.File("here");
  std::filesystem::create_directory(here);
  std::filesystem::current_path(here);
  // The whole messages are the locator parser's own tests.
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"--store", "ETCD://u:cret@h:1/p", "import", "-"}, "store locator \"ETCD://u:***@h:1/p\""},
      {{"--store", "etcd://u:cret/cret@h:1/p", "watch"}, "etcd locator: '@' after the endpoints"},
      {{"policies", "set", "-"}, "etcd locator: a client certificate needs its key"},
  };
  setenv("TAVO_CONFIGSTORE_PATH", "etcds://u:cret@h:1/p?cert=c", 1);
  for (const auto& [args, err] : cases) {
    const ToolResult result = RunTool(args, "[");
    ExpectFailure(result, 2, "karstctl: " + err);
    EXPECT_THAT(result.err, ::testing::EndsWith(" (bad locator, 1010)\n"));
    EXPECT_THAT(result.err, ::testing::Not(HasSubstr("cret")));
  }
  std::filesystem::current_path(cwd);
  EXPECT_TRUE(std::filesystem::is_empty(here));
}

// watch prints hash's digests on one line, then a line at each change, soon
// after it; a write that leaves them equal prints nothing, and SIGINT ends it
// with status 0.
TEST_F(Karstctl, WatchPrintsTheDigestsAgainAtEachChange) {
  Ok({"import", "-"}, R"({"policies": [{"name": "a"}]})");
  Background watch({"--store", store_, "watch"}, dir_);
  EXPECT_EQ(watch.NextLine(10), HashLine(store_));
  // Each write follows the last line at once, so a watch that slept for
  // seconds between looks would answer late every time.
  auto fastest = std::chrono::steady_clock::duration::max();
  for (const char* catalogue : {R"({"policies": [{"name": "b"}]})",
                                R"({"datastores": [{"url": "u"}]})", R"({"policies": []})"}) {
    Ok({"import", "-"}, catalogue);
    const auto written = std::chrono::steady_clock::now();
    const std::string line = watch.NextLine(10);
    fastest = std::min(fastest, std::chrono::steady_clock::now() - written);
    EXPECT_EQ(line, HashLine(store_)) << catalogue;
    Ok({"import", "-"}, catalogue);  // the same digests: the next line is the next change's
  }
  EXPECT_LT(std::chrono::duration_cast<std::chrono::milliseconds>(fastest).count(), 1000);
  EXPECT_EQ(watch.NextLine(0.5), "");
  EXPECT_EQ(watch.Stop(SIGINT), 0);
  EXPECT_EQ(watch.Errors(), "");
}

// Watching a store that does not exist yet creates nothing, and prints when
// another process creates it. A store that cannot be read meanwhile (a file
// that is no store, left there for a while) is reported and tried again.
// SIGTERM ends the watch with status 0 too.
TEST_F(Karstctl, WatchWaitsForTheStoreAndOutlastsFailedReads) {
  Ok({"reset"});
  const std::string later = dir_.File("later/store.db");
  Background watch({"--store", later, "watch"}, dir_);
  EXPECT_EQ(watch.NextLine(10), HashLine(store_));
  EXPECT_EQ(watch.NextLine(0.5), "");
  EXPECT_FALSE(std::filesystem::exists(dir_.File("later")));

  std::filesystem::create_directory(dir_.File("later"));
  WriteFile(later, std::string(8192, 'G'));
  EXPECT_THAT(watch.Errors(5),
              ::testing::MatchesRegex("(karstctl: warning: [^\n]*\\(SQLITE_NOTADB, "
                                      "26\\); trying again\n)+"));
  EXPECT_EQ(ReadFile(later), std::string(8192, 'G'));
  std::filesystem::remove(later);
  ASSERT_EQ(RunTool({"--store", later, "import", "-"}, R"({"policies": [{"name": "a"}]})").status,
            0);
  EXPECT_EQ(watch.NextLine(10), HashLine(later));
  EXPECT_EQ(watch.Stop(SIGTERM), 0);
}

// A watcher on etcd whose role loses its permission still hears of the
// commit it may no longer read: it reads again every second, and prints the
// new digests once it may, without waiting for another commit.
TEST_F(Karstctl, WatchReadsAgainUntilAReadSucceeds) {
  EtcdCluster etcd({1, false, true});
  const std::string store = etcd.Locator("limited/karst");
  ASSERT_EQ(RunTool({"--store", store, "import", "-"}, R"({"policies": [{"name": "a"}]})").status,
            0);
  Background watch({"--store", etcd.Locator("limited/karst", {"limited"}), "watch"}, dir_);
  EXPECT_EQ(watch.NextLine(10), HashLine(store));

  etcd.Etcdctl(
      {"role", "revoke-permission", "limited", "--prefix=true", EtcdCluster::kLimitedPrefix});
  ASSERT_EQ(RunTool({"--store", store, "import", "-"}, R"({"policies": [{"name": "b"}]})").status,
            0);
  EXPECT_THAT(watch.Errors(10), HasSubstr("(etcd PERMISSION_DENIED, 1107); trying again\n"));
  etcd.Etcdctl({"role", "grant-permission", "limited", "--prefix=true", "readwrite",
                EtcdCluster::kLimitedPrefix});
  EXPECT_EQ(watch.NextLine(10), HashLine(store));
  EXPECT_EQ(watch.Stop(SIGINT), 0);
}

// Output that cannot be written exits 1. Started with standard input or
// output closed, karstctl reads and writes nothing there, never a descriptor
// some library opened in its place.
TEST_F(Karstctl, UnwritableOrClosedStandardDescriptors) {
  Ok({"import", "-"},
     R"({"policies": [{"name": "kept", "policy_id": "p", "blobs": [{"datastore_namespace": "CORRA", "blob": "b"}]}]})");
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"--store", store_, "export"},
        {"--store", store_, "blob", "corra-by-id", "p"},
        {"--help"}}) {
    ExpectFailure(RunTool(args, "", "/dev/full"), 1, "cannot write standard output");
  }
  const std::string before = ReadFile(store_);
  const struct {
    std::vector<int> closed;
    std::vector<std::string> args;
    int status;
    std::string err;  // "" with standard error closed
  } cases[] = {
      {{0},
       {"--store", store_, "import", "-"},
       2,
       "karstctl: <stdin>:1:1: syntax error while parsing value"},
      {{1}, {"--store", store_, "hash"}, 0, ""},
      {{0, 1, 2}, {"--store", store_, "import", "-"}, 2, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.args[2]);
    const ToolResult result = RunTool(c.args, "", nullptr, c.closed);
    EXPECT_EQ(result.status, c.status);
    EXPECT_EQ(result.out, "");
    EXPECT_THAT(result.err, ::testing::StartsWith(c.err));
    EXPECT_EQ(ReadFile(store_), before);
  }
}

TEST_F(Karstctl, HelpAndVersionNeedNoStore) {
  const ToolResult help = RunTool({"--store", dir_.Path(), "--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_THAT(help.out, HasSubstr("\n  blob corra-by-name "));
  // Every command's summary starts in one column.
  std::set<std::size_t> columns;
  std::istringstream lines(help.out.substr(help.out.find("Commands:\n")));
  std::string line;
  for (std::getline(lines, line); std::getline(lines, line) && !line.empty();) {
    columns.insert(line.find_first_not_of(' ', line.find("  ", 2)));
  }
  EXPECT_EQ(columns.size(), 1u) << help.out;
  EXPECT_EQ(columns.count(std::string::npos), 0u) << help.out;
  EXPECT_EQ(RunTool({"--store", dir_.Path(), "--version"}).out, "karstctl 1.1.0\n");

  // The help, the manual page and the completion know every command and option.
  std::string man = ReadFile(KARSTCTL_SOURCE_DIR "/karstctl.1");
  for (std::size_t at; (at = man.find("\\-")) != std::string::npos;) man.erase(at, 1);
  const std::string completion = ReadFile(KARSTCTL_SOURCE_DIR "/karstctl.bash-completion");
  std::vector<std::string> names = {"--store",  "--wait",    "--output", "--quiet",
                                    "--strict", "--require", "--help",   "--version"};
  for (const auto& entry : karstctl::CommandTable()) {
    names.push_back(entry.words[0] + (entry.words.size() > 1 ? " " + entry.words[1] : ""));
    EXPECT_THAT(completion, HasSubstr(entry.words.back()));
  }
  for (const auto& name : names) {
    EXPECT_THAT(help.out, HasSubstr("  " + name + " "));
    // An entry of its own: ".TP", then ".B name", ".BI \"name ...", ".BR name ...".
    EXPECT_TRUE(std::regex_search(man, std::regex("\\.TP\n\\.B[IR]? \"?" + name + "[ \"\n]")))
        << name;
    if (name[0] == '-') {
      EXPECT_THAT(completion, HasSubstr(name + " "));
    }
  }
}

// Valid records the store would collapse, drop or leave dangling are
// written anyway, each with one warning; check finds the same without a store.
TEST_F(Karstctl, WritesWarnAboutRecordsTheStoreCollapses) {
  const std::string file = R"({"policies": [
      {"name": "gold", "policy_id": "p1", "blobs": [{"datastore_namespace": "NFS"},
          {"datastore_namespace": ""}, {"datastore_namespace": "NFS", "blob": "b"}]},
      {"policy_id": "p1"}, {"name": "gold", "policy_id": "p2"}],
    "datastores": [{"url": "u", "drp_policy_id": "p1"}, {"url": "u", "drp_policy_id": "p3"},
                   {"drp_policy_id": ""}]})";
  const std::string w = "karstctl: warning: ";
  const std::string warnings =
      w + "policies[0].blobs[1].datastore_namespace is empty; the store drops this blob\n" + w +
      "policies[0].blobs[2].datastore_namespace \"NFS\" repeats policies[0].blobs[0]; the store "
      "keeps only the last\n" +
      w + "policies[1].name is empty; look-ups by name cannot find it\n" + w +
      "policies[1].policy_id \"p1\" repeats policies[0]; look-ups by id find only one of them\n" +
      w + "policies[2].name \"gold\" repeats policies[0]; the store keeps only the last\n" + w +
      "datastores[1].url \"u\" repeats datastores[0]; the store keeps only the last\n" + w +
      "datastores[1].drp_policy_id \"p3\" names no policy in the file\n" + w +
      "datastores[2].url is empty; look-ups by url cannot find it\n";
  const std::string none = dir_.File("none.db");
  for (const auto& args : {std::vector<std::string>{"check", "-"}, {"import", "-"}}) {
    EXPECT_NE(access(none.c_str(), F_OK), 0) << "check opened the store";
    const ToolResult result = RunTool({"--store", none, args[0], args[1]}, file);
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, warnings);
  }

  // Without policies beside them, datastores are checked against the stored
  // ones, and by check (which opens no store) not at all.
  Ok({"policies", "set", "-"}, R"([{"name": "s", "policy_id": "p1"}])");
  const std::string datastores = R"([{"url": "a", "drp_policy_id": "p1"},
                                     {"url": "b", "drp_policy_id": "p9"}])";
  const std::string dangling =
      w + "datastores[1].drp_policy_id \"p9\" names no policy in the store\n";
  EXPECT_EQ(Run({"datastores", "set", "-"}, datastores).err, dangling);
  EXPECT_EQ(Run({"import", "-"}, "{\"datastores\": " + datastores + "}").err, dangling);
  EXPECT_EQ(Run({"check", "-"}, "{\"datastores\": " + datastores + "}").err, "");
  EXPECT_EQ(KarstLib::ListDatastoreInfo().size(), 2u);
}

// Options go anywhere on the line, --store wins over the environment, and
// each command has its help.
TEST_F(Karstctl, OptionsGoAnywhereAndEachCommandHasItsHelp) {
  EXPECT_EQ(RunTool({"blob", "corra-by-name", "--help"}).out,
            "Usage: karstctl [OPTIONS] blob corra-by-name NAME\n"
            "  CORRA blob of the policy named NAME\n"
            "Options:\n"
            "  --store PATH      the store file or etcd locator; by default "
            "$TAVO_CONFIGSTORE_PATH\n"
            "  --wait SECONDS    how long to wait for another writer's lock or an etcd request\n"
            "  --output FORM     pretty, json (one line) or lines (a record a line); json: errors "
            "too\n"
            "  --require         exit 3 when the look-up finds no blob\n"
            "Example:\n"
            "  karstctl blob corra-by-name --require gold > gold.bin\n");
  // Each command's help names only the options it takes, and an example.
  for (const auto& entry : karstctl::CommandTable()) {
    std::vector<std::string> args = entry.words;
    args.push_back("--help");
    const std::string help = RunTool(args).out;
    EXPECT_THAT(help, HasSubstr("Example:\n  karstctl ")) << help;
    for (const char* option : {"--quiet", "--strict", "--require"}) {
      const bool takes = std::count(entry.options.begin(), entry.options.end(), option) > 0;
      EXPECT_EQ(help.find(std::string("  ") + option) != std::string::npos, takes) << help;
    }
  }
  Ok({"policies", "set", "-"}, R"([{"name": "-n", "policy_id": "p"}])");
  const std::string other = dir_.File("other.db");
  UseStoreAt(other);
  EXPECT_EQ(RunTool({"import", "-"}, R"({"policies": [{"name": "env"}]})").status, 0);
  EXPECT_THAT(RunTool({"--store=" + other, "policies", "list"}).out, HasSubstr("env"));
  EXPECT_THAT(RunTool({"policies", "list", "--store", store_}).out, HasSubstr("\"-n\""));
  EXPECT_EQ(RunTool({"export", "--store=" + store_, "--wait", "2.5"}).status, 0);
}

const char kStored[] = R"({
    "policies": [
      {"name": "gold", "policy_id": "p1", "description": "fast",
       "blobs": [{"datastore_namespace": "CORRA", "blob": "c1"}, {"datastore_namespace": "NFS", "blob": "n1"}]},
      {"name": "empty", "policy_id": "p2", "blobs": [{"datastore_namespace": "CORRA", "blob": ""}]},
      {"name": "old", "policy_id": "p3"}],
    "datastores": [{"url": "ds://a", "datastore_namespace": "NFS", "drp_policy_id": "p1"},
                   {"url": "ds://b", "datastore_namespace": "NFS", "drp_policy_id": "p9"}]})";

// get prints one record as a listing does and --require tells a missing
// blob from an empty one; a missing one exits 3 with one line, and an option
// a command does not take is refused.
TEST_F(Karstctl, GetAndRequireExitThreeForWhatIsNotThere) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  const struct {
    std::vector<std::string> args;
    int status;
    std::string out, err;
  } cases[] = {
      {{"datastores", "get", "ds://a", "--output", "json"},
       0,
       "{\"url\":\"ds://a\",\"datastore_namespace\":\"NFS\",\"drp_policy_id\":\"p1\"}\n",
       ""},
      {{"policies", "get", "zzz"}, 3, "", "karstctl: no policy with name \"zzz\"\n"},
      {{"datastores", "get", "ds://z"}, 3, "", "karstctl: no datastore with url \"ds://z\"\n"},
      {{"blob", "corra-by-name", "zzz"}, 0, "", ""},
      {{"blob", "corra-by-name", "zzz", "--require"}, 3, "", "karstctl: no policy named \"zzz\"\n"},
      {{"blob", "corra-by-name", "empty", "--require"}, 0, "", ""},
      {{"blob", "corra-by-id", "p3", "--require"},
       3,
       "",
       "karstctl: the policy with id \"p3\" has no blob for namespace \"CORRA\"\n"},
      {{"blob", "by-id", "p1", "ds://a", "--require"}, 0, "n1", ""},
      {{"blob", "by-id", "p1", "ds://z", "--require"},
       3,
       "",
       "karstctl: no datastore with url \"ds://z\"\n"},
      {{"blob", "default", "ds://b", "--require"}, 3, "", "karstctl: no policy with id \"p9\"\n"},
      {{"hash", "--require"}, 2, "", "karstctl: 'hash' takes no --require (see karstctl --help)\n"},
  };
  for (const auto& c : cases) {
    const ToolResult result = Run(c.args);
    EXPECT_EQ(result.status, c.status) << c.args[0] << " " << c.args[2];
    EXPECT_EQ(result.out, c.out) << c.args[2];
    EXPECT_EQ(result.err, c.err) << c.args[2];
  }
  EXPECT_EQ(Ok({"policies", "get", "old"}),
            "{\n  \"name\": \"old\",\n  \"policy_id\": \"p3\",\n  \"description\": \"\",\n"
            "  \"generation_number\": 0,\n  \"blobs\": []\n}\n");
}

// diff compares in the store's terms (the last record of each key, blobs by
// namespace, none without one), exits as cmp does and only reads the store.
TEST_F(Karstctl, DiffShowsWhatAWriteWouldChangeAndWritesNothing) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  const std::string before = ReadFile(store_);
  const std::string file = R"({"policies": [
      {"name": "gold", "policy_id": "p1", "description": "slow",
       "blobs": [{"datastore_namespace": "CORRA", "blob": "c1"}, {"datastore_namespace": "", "blob": "x"},
                 {"datastore_namespace": "NFS", "blob": "n1"}, {"datastore_namespace": "NFS", "blob": "n22"},
                 {"datastore_namespace": "S3", "blob": "s"}]},
      {"name": "old", "policy_id": "changed"}, {"name": "old", "policy_id": "p3"},
      {"name": "new", "policy_id": "p4"}]})";
  const ToolResult text = Run({"diff", "-"}, file);
  EXPECT_EQ(text.status, 1) << text.err;
  EXPECT_EQ(text.out,
            "policy \"empty\": removed\n"
            "policy \"gold\": description \"fast\" -> \"slow\"\n"
            "policy \"gold\": blob \"NFS\" changed (2 bytes -> 3 bytes)\n"
            "policy \"gold\": blob \"S3\" added (none -> 1 byte)\n"
            "policy \"new\": added\n"
            "policies: 1 added, 1 removed, 1 changed; datastores: 0 added, 0 removed, 0 changed\n");
  const ToolResult json =
      Run({"diff", "--output", "json", "-"}, R"([{"url": "ds://a", "datastore_namespace": "S3"}])");
  EXPECT_EQ(json.status, 1) << json.err;
  EXPECT_EQ(json.out,
            R"({"policies":[],"datastores":[{"change":"changed","url":"ds://a","fields":[)"
            R"({"field":"datastore_namespace","old":"NFS","new":"S3"},)"
            R"({"field":"drp_policy_id","old":"p1","new":""}]},)"
            R"({"change":"removed","url":"ds://b","record":{"url":"ds://b",)"
            R"("datastore_namespace":"NFS","drp_policy_id":"p9"}}]})"
            "\n");

  const struct {
    std::vector<std::string> args;
    std::string input;
    int status;
    std::string out;
  } cases[] = {
      {{"diff", "-"}, kStored, 0, "no changes\n"},
      {{"diff", "--output", "lines", "-"},
       R"([{"name": "gold", "policy_id": "p1", "description": "fast"}])",
       1,
       R"({"change":"removed","name":"empty","record":{"name":"empty","policy_id":"p2",)"
       R"("description":"","generation_number":0,"blobs":[{"datastore_namespace":"CORRA",)"
       R"("blob":""}]},"catalogue":"policies"})"
       "\n"
       R"({"change":"changed","name":"gold","fields":[{"field":"blob",)"
       R"("datastore_namespace":"CORRA","old":"c1","new":null},{"field":"blob",)"
       R"("datastore_namespace":"NFS","old":"n1","new":null}],"catalogue":"policies"})"
       "\n"
       R"({"change":"removed","name":"old","record":{"name":"old","policy_id":"p3",)"
       R"("description":"","generation_number":0,"blobs":[]},"catalogue":"policies"})"
       "\n"},
      {{"diff", "-"}, R"({"datastores": []})", 1, ""},
      {{"diff", "-"}, "[]", 2, ""},
      {{"diff", "-"}, "{", 2, ""},
      {{"diff", "-", "--strict"}, R"({"policies": [{"name": "a"}, {"name": "a"}]})", 2, ""},
      {{"diff", "--store", dir_.File("none.db"), "-"}, "{}", 2, ""},
  };
  for (const auto& c : cases) {
    const ToolResult result = Run(c.args, c.input);
    EXPECT_EQ(result.status, c.status) << c.input << result.err;
    if (!c.out.empty()) {
      EXPECT_EQ(result.out, c.out) << c.input;
    }
  }
  EXPECT_EQ(ReadFile(store_), before);
}

// --output means the same for every command that prints records or digests,
// hash and watch alike; with json an error is one JSON object.
TEST_F(Karstctl, OutputFormsAndJsonErrors) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  const std::string hash = HashLine(store_);
  const std::pair<std::vector<std::string>, std::string> forms[] = {
      {{"--output", "lines"}, hash},
      {{"--output=json"}, hash},
      {{"--output", "pretty"}, Ok({"hash"})},
  };
  for (const auto& [option, printed] : forms) {
    std::vector<std::string> args = {"--store", store_, "watch"};
    args.insert(args.end(), option.begin(), option.end());
    Background watch(args, dir_);
    std::string first;
    for (std::string line; (line = watch.NextLine(10)) != "" && (first += line) != printed;) {
    }
    EXPECT_EQ(first, printed) << option[0];
    EXPECT_EQ(watch.Stop(SIGINT), 0);
    std::vector<std::string> hashArgs = {"hash"};
    hashArgs.insert(hashArgs.end(), option.begin(), option.end());
    EXPECT_EQ(Ok(hashArgs), printed);
  }
  const std::string lines = Ok({"datastores", "list", "--output", "lines"});
  EXPECT_EQ(lines,
            "{\"url\":\"ds://a\",\"datastore_namespace\":\"NFS\",\"drp_policy_id\":\"p1\"}\n"
            "{\"url\":\"ds://b\",\"datastore_namespace\":\"NFS\",\"drp_policy_id\":\"p9\"}\n");

  const std::string garbage = dir_.File("garbage.db");
  WriteFile(garbage, std::string(8192, 'G'));
  const std::pair<std::vector<std::string>, std::string> errors[] = {
      {{"--store", store_, "policies", "get", "zzz"},
       R"({"code":"not found","number":null,"exit":3,"message":"no policy with name \"zzz\""})"},
      {{"--store", garbage, "export"}, R"({"code":"SQLITE_NOTADB","number":26,"exit":1,)"},
      {{"--colour"}, R"({"code":"usage","number":null,"exit":2,"message":"unknown option)"},
      {{"--store", store_, "import", "-"},
       R"({"code":"input","number":null,"exit":2,"message":"<stdin>:1:1: )"},
  };
  for (const auto& [args, start] : errors) {
    std::vector<std::string> withJson = args;
    withJson.insert(withJson.begin(), {"--output", "json"});
    const ToolResult result = RunTool(withJson);
    EXPECT_THAT(result.err, ::testing::StartsWith(start));
    EXPECT_THAT(result.err, ::testing::MatchesRegex("\\{[^\n]*\\}\n"));
    EXPECT_EQ(result.status, Json::parse(result.err)["exit"].get<int>());
  }
}

// --quiet sums warnings up per kind; --strict refuses any write that warns
// and leaves the store as it was.
TEST_F(Karstctl, QuietSumsWarningsUpAndStrictWritesNothing) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  const std::string before = ReadFile(store_);
  std::string dangling = "[";
  for (int i = 0; i < 300; ++i) {
    dangling += (i ? ", " : "") + std::string("{\"url\": \"u") + std::to_string(i % 299) +
                "\", \"drp_policy_id\": \"none\"}";
  }
  dangling += "]";
  const std::string summary =
      "karstctl: warning: 301 warnings: 300 drp_policy_id naming no policy, 1 repeated url\n";
  const ToolResult quiet =
      Run({"check", "--quiet", "-"}, "{\"policies\": [], \"datastores\": " + dangling + "}");
  EXPECT_EQ(quiet.status, 0);
  EXPECT_EQ(quiet.err, summary);
  const ToolResult json = Run({"check", "--quiet", "--output", "json", "-"}, dangling);
  EXPECT_EQ(json.err, "{\"warnings\":1,\"kinds\":{\"repeated url\":1}}\n");

  const std::pair<std::vector<std::string>, std::string> writes[] = {
      {{"datastores", "set", "-"}, dangling},
      {{"policies", "set", "-"}, "[]"},  // leaves the stored datastores dangling
      {{"import", "-"}, R"({"policies": [{"name": "a"}, {"name": "a"}]})"},
  };
  for (const auto& [args, input] : writes) {
    std::vector<std::string> strict = args;
    strict.push_back("--strict");
    const ToolResult result = Run(strict, input);
    EXPECT_EQ(result.status, 2) << args[0];
    EXPECT_THAT(result.err, HasSubstr(" and --strict: the store is left as it was\n"));
    EXPECT_EQ(ReadFile(store_), before) << args[0];
  }
}

// check reads every form karstctl reads, and names the record a repeated key
// drops and the stored datastores a policy write leaves without a policy.
TEST_F(Karstctl, CheckReadsEveryFormAndWarningsNameTheCause) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  const std::string w = "karstctl: warning: ";
  const std::pair<std::string, std::string> cases[] = {
      {Ok({"policies", "list"}), ""},
      {Ok({"datastores", "list"}), ""},
      {Ok({"export"}), w + "datastores[1].drp_policy_id \"p9\" names no policy in the file\n"},
      {R"({"policies": [{"name": "gold", "policy_id": "p1"}, {"name": "gold", "policy_id": "p2"}],
          "datastores": [{"url": "u", "drp_policy_id": "p1"}]})",
       w + "policies[1].name \"gold\" repeats policies[0]; the store keeps only the last\n" + w +
           "datastores[0].drp_policy_id \"p1\" names only policies[0] of the file, which the store "
           "drops for its repeated name\n"},
  };
  for (const auto& [file, err] : cases) {
    const ToolResult result = Run({"check", "-"}, file);
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_EQ(result.err, err) << file;
  }
  const ToolResult write =
      Run({"policies", "set", "-"}, R"([{"name": "gold", "policy_id": "p1"}])");
  EXPECT_EQ(write.err, w + "stored datastore \"ds://b\": drp_policy_id \"p9\" names no policy in "
                           "the file\n");
}

// status names the store and what chose it, its kind, format and counts; a
// store it cannot read fails it.
TEST_F(Karstctl, StatusNamesTheStoreAndWhyItIsInUse) {
  ASSERT_EQ(Run({"import", "-"}, kStored).status, 0);
  EXPECT_EQ(Ok({"status"}), "store: " + store_ +
                                "\nchosen by: --store\nkind: sqlite\nformat: 3\n"
                                "history: the last 10 versions kept, newest 1\npolicies: 3\n"
                                "datastores: 2\n");
  const ToolResult env = RunTool({"status", "--output", "json"});
  EXPECT_EQ(env.status, 0) << env.err;
  EXPECT_EQ(Json::parse(env.out)["chosen_by"], "TAVO_CONFIGSTORE_PATH");
  unsetenv("TAVO_CONFIGSTORE_PATH");
  const char* state = getenv("XDG_STATE_HOME");
  const std::string saved = state ? state : "";
  setenv("XDG_STATE_HOME", dir_.Path().c_str(), 1);
  ExpectFailure(RunTool({"status"}), 1,
                "karstctl: no store at " + dir_.File("tavo/configstore.db") + "\n");
  if (state) {
    setenv("XDG_STATE_HOME", saved.c_str(), 1);
  } else {
    unsetenv("XDG_STATE_HOME");
  }
}

// However the disk fails while an import commits, the store holds both old
// catalogues or both new ones, never new policies beside old datastores.
TEST_F(Karstctl, ImportReplacesBothCataloguesOrNeitherAtEveryFailedSync) {
  Ok({"import", "-"}, R"({"policies": [{"name": "old"}], "datastores": [{"url": "old"}]})");
  const auto oldPolicies = KarstLib::ListPolicyInfo();
  const auto oldDatastores = KarstLib::ListDatastoreInfo();
  const std::string file = dir_.File("new.json");
  WriteFile(file, R"({"policies": [{"name": "new"}], "datastores": [{"url": "new"}]})");
  FaultVfs::Install();
  int failures = 0;
  for (int nth = 1;; ++nth) {
    ASSERT_LT(nth, 100) << "the import never succeeded";
    FaultVfs::Arm({IoFault::kFail, io::kSync, nth});
    ::testing::internal::CaptureStderr();
    const int status = karstctl::RunKarstctl({"--store", store_, "import", file});
    const std::string err = ::testing::internal::GetCapturedStderr();
    const bool fired = FaultVfs::Failed() > 0;
    FaultVfs::Disarm();
    if (status == 0) {
      EXPECT_EQ(KarstLib::ListPolicyInfo(), std::vector{Policy("new", "", {}, "", 0)});
      EXPECT_EQ(KarstLib::ListDatastoreInfo(), std::vector{Datastore("new", "", "")});
      if (!fired) break;
      Ok({"import", "-"}, R"({"policies": [{"name": "old"}], "datastores": [{"url": "old"}]})");
      continue;
    }
    ++failures;
    EXPECT_EQ(status, 1) << err;
    EXPECT_THAT(err, HasSubstr("(SQLITE_IOERR"));
    EXPECT_EQ(KarstLib::ListPolicyInfo(), oldPolicies) << "sync " << nth;
    EXPECT_EQ(KarstLib::ListDatastoreInfo(), oldDatastores) << "sync " << nth;
  }
  EXPECT_GT(failures, 0);
}

}  // namespace
}  // namespace karst_test
