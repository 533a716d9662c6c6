// karstctl end to end: the built binary against a store file of its own.
#include <fcntl.h>
#include <poll.h>
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
  std::vector<char*> argv = {const_cast<char*>(KARSTCTL_BINARY)};
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  execv(argv[0], argv.data());
  _exit(126);
}

// karstctl left running (watch), its output read line by line as it comes.
class Background {
 public:
  Background(const std::vector<std::string>& args, const std::string& errPath) {
    int fds[2];
    if (pipe(fds) != 0) throw std::runtime_error("pipe failed");
    pid_ = fork();
    if (pid_ == 0) {
      prctl(PR_SET_PDEATHSIG, SIGKILL);  // not outliving a test that fails first
      dup2(fds[1], 1);
      dup2(open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), 2);
      ExecKarstctl(args);
    }
    close(fds[1]);
    fd_ = fds[0];
  }
  ~Background() {
    if (pid_ > 0) Stop(SIGKILL);
    close(fd_);
  }
  Background(const Background&) = delete;
  Background& operator=(const Background&) = delete;

  // The next line, or "" when none is whole within "seconds".
  std::string NextLine(double seconds) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    std::size_t end;
    while ((end = pending_.find('\n')) == std::string::npos) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd p{fd_, POLLIN, 0};
      char buffer[4096];
      ssize_t got = 0;
      if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0 ||
          (got = read(fd_, buffer, sizeof buffer)) <= 0) {
        return "";
      }
      pending_.append(buffer, static_cast<std::size_t>(got));
    }
    std::string line = pending_.substr(0, end + 1);
    pending_.erase(0, end + 1);
    return line;
  }

  // Sends "signal"; the exit status (128 + signal when killed by one), or -1
  // when it is still running ten seconds later.
  int Stop(int signal) {
    kill(pid_, signal);
    int status = 0;
    bool hung = false;
    for (int waited = 0; waitpid(pid_, &status, WNOHANG) == 0; waited += 10) {
      if (waited == 10000) hung = kill(pid_, SIGKILL) == 0;
      usleep(10000);
    }
    pid_ = -1;
    if (hung) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

 private:
  pid_t pid_;
  int fd_;
  std::string pending_;
};

// Each test has an empty store in its own folder; the library in this process
// and any karstctl run without --store use it too.
class Karstctl : public ::testing::Test {
 protected:
  void SetUp() override { UseStoreAt(store_); }
  void TearDown() override { unsetenv("TAVO_CONFIGSTORE_PATH"); }

  // Runs karstctl with "args" and "input" on stdin; stdout comes back through
  // the child's result pipe unless "outPath" takes it. Killed after a minute.
  ToolResult RunTool(std::vector<std::string> args, const std::string& input = "",
                     const char* outPath = nullptr) {
    WriteFile(dir_.File("stdin"), input);
    const ChildResult child = RunChild(
        [&](int resultFd) {
          dup2(open(dir_.File("stdin").c_str(), O_RDONLY), 0);
          dup2(outPath ? open(outPath, O_WRONLY) : resultFd, 1);
          dup2(open(dir_.File("stderr").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), 2);
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

TEST_F(Karstctl, StoreIsTheOptionElseTheEnvironment) {
  Ok({"reset"});
  const std::string other = dir_.File("other.db");
  UseStoreAt(other);
  EXPECT_EQ(RunTool({"import", "-"}, R"({"policies": [{"name": "env"}]})").status, 0);
  EXPECT_THAT(RunTool({"--store=" + other, "policies", "list"}).out, HasSubstr("env"));
  EXPECT_EQ(RunTool({"--store", store_, "policies", "list"}).out, "[]\n");
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
      {{"export", "--version", "0"}, "", "--version needs a version number"},
      {{"import", "--version", "1", "-"}, "{}", "'import' does not read the catalogue"},
      {{"history", "depth", "-1"}, "", "unknown option '-1'"},
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
  Ok({"policies", "set", "-"}, "[]");
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
  for (const char* field : {"time", "host", "user"}) EXPECT_TRUE(first[field].is_string());

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
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"--store", "ETCD://u:cret@h:1/p", "import", "-"},
       "karstctl: store locator \"ETCD://u:***@h:1/p\" looks like a URL but is no etcd:// or "
       "etcds:// locator; put ./ in front to make it a file path (bad locator, 1010)\n"},
      {{"--store", "etcd://u:cret/cret@h:1/p", "watch"},
       "karstctl: etcd locator: '@' after the endpoints: write it as %40, and a '/' in a user "
       "name or password as %2F (bad locator, 1010)\n"},
      {{"policies", "set", "-"},
       "karstctl: etcd locator: a client certificate needs its key and a key its "
       "certificate (cert and key) (bad locator, 1010)\n"},
  };
  setenv("TAVO_CONFIGSTORE_PATH", "etcds://u:cret@h:1/p?cert=c", 1);
  for (const auto& [args, err] : cases) ExpectFailure(RunTool(args, "["), 2, err);
  std::filesystem::current_path(cwd);
  EXPECT_TRUE(std::filesystem::is_empty(here));
}

// watch prints hash's digests on one line, then a line at each change, soon
// after it; a write that leaves them equal prints nothing, and SIGINT ends it
// with status 0.
TEST_F(Karstctl, WatchPrintsTheDigestsAgainAtEachChange) {
  Ok({"import", "-"}, R"({"policies": [{"name": "a"}]})");
  Background watch({"--store", store_, "watch"}, dir_.File("watch.err"));
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
  EXPECT_EQ(ReadFile(dir_.File("watch.err")), "");
}

// Watching a store that does not exist yet creates nothing, and prints when
// another process creates it. A store that cannot be read meanwhile (a file
// that is no store, left there for a while) is reported and tried again.
// SIGTERM ends the watch with status 0 too.
TEST_F(Karstctl, WatchWaitsForTheStoreAndOutlastsFailedReads) {
  Ok({"reset"});
  const std::string later = dir_.File("later/store.db"), err = dir_.File("watch.err");
  Background watch({"--store", later, "watch"}, err);
  EXPECT_EQ(watch.NextLine(10), HashLine(store_));
  EXPECT_EQ(watch.NextLine(0.5), "");
  EXPECT_FALSE(std::filesystem::exists(dir_.File("later")));

  std::filesystem::create_directory(dir_.File("later"));
  WriteFile(later, std::string(8192, 'G'));
  for (int i = 0; i < 100 && ReadFile(err).empty(); ++i) usleep(50000);
  EXPECT_THAT(ReadFile(err), ::testing::MatchesRegex("(karstctl: warning: [^\n]*\\(SQLITE_NOTADB, "
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
  const std::string err = dir_.File("watch.err");
  Background watch({"--store", etcd.Locator("limited/karst", {"limited"}), "watch"}, err);
  EXPECT_EQ(watch.NextLine(10), HashLine(store));

  etcd.Etcdctl(
      {"role", "revoke-permission", "limited", "--prefix=true", EtcdCluster::kLimitedPrefix});
  ASSERT_EQ(RunTool({"--store", store, "import", "-"}, R"({"policies": [{"name": "b"}]})").status,
            0);
  for (int i = 0; i < 200 && ReadFile(err).empty(); ++i) usleep(50000);
  EXPECT_THAT(ReadFile(err), HasSubstr("(etcd PERMISSION_DENIED, 1107); trying again\n"));
  etcd.Etcdctl({"role", "grant-permission", "limited", "--prefix=true", "readwrite",
                EtcdCluster::kLimitedPrefix});
  EXPECT_EQ(watch.NextLine(10), HashLine(store));
  EXPECT_EQ(watch.Stop(SIGINT), 0);
}

TEST_F(Karstctl, UnwritableOutputExitsOne) {
  Ok({"import", "-"},
     R"({"policies": [{"name": "n", "policy_id": "p", "blobs": [{"datastore_namespace": "CORRA", "blob": "b"}]}]})");
  const std::vector<std::string> commands[] = {
      {"--store", store_, "export"}, {"--store", store_, "blob", "corra-by-id", "p"}, {"--help"}};
  for (const auto& args : commands) {
    ExpectFailure(RunTool(args, "", "/dev/full"), 1, "cannot write standard output");
  }
}

// Started with standard input or output closed, karstctl reads and writes
// nothing there, never a descriptor some library opened in its place.
TEST_F(Karstctl, ClosedStandardDescriptorsAreNobodyElses) {
  Ok({"import", "-"}, R"({"policies": [{"name": "kept"}]})");
  const std::string before = ReadFile(store_);
  const struct {
    std::vector<int> closed;
    std::vector<std::string> args;
    int status;
    std::string err;  // "" with standard error closed
  } cases[] = {
      {{0}, {"import", "-"}, 2, "karstctl: <stdin>:1:1: syntax error while parsing value"},
      {{1}, {"hash"}, 0, ""},
      {{0, 1, 2}, {"import", "-"}, 2, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.args[0]);
    const std::string err = dir_.File("stderr");
    WriteFile(err, "");
    const ChildResult child = RunChild(
        [&](int resultFd) {
          dup2(resultFd, 1);
          dup2(open(err.c_str(), O_WRONLY), 2);
          for (int fd : c.closed) close(fd);
          std::vector<std::string> args = {"--store", store_};
          args.insert(args.end(), c.args.begin(), c.args.end());
          ExecKarstctl(args);
        },
        60);
    EXPECT_TRUE(child.exited) << child.Describe();
    EXPECT_EQ(child.code, c.status);
    EXPECT_EQ(child.output, "");
    EXPECT_THAT(ReadFile(err), ::testing::StartsWith(c.err));
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
  std::vector<std::string> names = {"--store", "--wait", "--help", "--version"};
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

TEST_F(Karstctl, OptionsGoAnywhereAndEachCommandHasItsHelp) {
  EXPECT_EQ(RunTool({"blob", "corra-by-name", "--help"}).out,
            "Usage: karstctl [OPTIONS] blob corra-by-name NAME\n"
            "  CORRA blob of the policy named NAME\n");
  const ToolResult group = RunTool({"--store", dir_.File("none.db"), "blob", "--help"});
  EXPECT_EQ(group.status, 0);
  EXPECT_EQ(std::count(group.out.begin(), group.out.end(), '\n'), 4 * 3 - 1) << group.out;
  Ok({"policies", "set", "-"}, R"([{"name": "-n", "policy_id": "p"}])");
  EXPECT_THAT(RunTool({"policies", "list", "--store", store_}).out, HasSubstr("\"-n\""));
  EXPECT_EQ(RunTool({"export", "--store=" + store_, "--wait", "2.5"}).status, 0);
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
