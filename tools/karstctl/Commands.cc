// The commands: the table that names them, and what each one does.
#include <signal.h>

#include <chrono>
#include <csignal>
#include <string>
#include <thread>
#include <vector>

#include "Args.h"
#include "Errors.h"
#include "HistoryCommands.h"
#include "Io.h"
#include "Json.h"
#include "StoreErrors.h"
#include "StoreSession.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "Warnings.h"

namespace karstctl {

using TavoKarst::KarstLib;
using Operands = std::vector<std::string>;

namespace {

// Parses the input and decodes it with "decode", naming the source in any
// error so the message points at the file as well as the field.
template <typename Decode>
auto ReadRecords(const std::string& fileOrDash, Decode decode) {
  const std::string source = SourceName(fileOrDash);
  Json document = ParseJsonText(ReadInput(fileOrDash), source);
  try {
    return decode(document);
  } catch (const InputError& e) {
    throw InputError(source + ": " + e.what());
  }
}

void PrintJson(const Json& value) { WriteOutput(DumpJsonText(value)); }

void Warn(const std::vector<std::string>& warnings) {
  for (const auto& warning : warnings) WriteDiagnostic("warning: " + warning);
}

Json Digests() {
  auto hash = KarstLib::GetDbHash();
  Json out = Json::object();
  out["policies"] = hash.first;
  out["datastores"] = hash.second;
  return out;
}

void Reset(const Operands&, StoreSession& store) {
  store.Open();
  KarstLib::Reset();
}

void SetPolicies(const Operands& operands, StoreSession& store) {
  auto policies =
      ReadRecords(operands[0], [](const Json& json) { return PoliciesFromJson(json, "policies"); });
  Warn(PolicyWarnings(policies));
  store.Open();
  KarstLib::AddPolicyInfo(policies);
}

void ListPolicies(const Operands&, StoreSession& store) {
  store.Open();
  PrintJson(PoliciesToJson(KarstLib::ListPolicyInfo()));
}

void SetDatastores(const Operands& operands, StoreSession& store) {
  auto datastores = ReadRecords(
      operands[0], [](const Json& json) { return DatastoresFromJson(json, "datastores"); });
  store.Open();
  const auto stored = KarstLib::ListPolicyInfo();
  Warn(DatastoreWarnings(datastores, &stored, "the store"));
  KarstLib::AddDatastoreInfo(datastores);
}

void ListDatastores(const Operands&, StoreSession& store) {
  store.Open();
  PrintJson(DatastoresToJson(KarstLib::ListDatastoreInfo()));
}

// Each replace commits its own transaction; begun inside this one, it is a
// savepoint of it, so both catalogues become durable together or not at all.
void Import(const Operands& operands, StoreSession& store) {
  const Catalogue catalogue = ReadRecords(operands[0], CatalogueFromJson);
  store.Open();
  std::vector<TavoKarst::KarstPolicyInfo> stored;
  if (catalogue.datastores && !catalogue.policies) stored = KarstLib::ListPolicyInfo();
  Warn(CatalogueWarnings(catalogue, &stored));
  auto transaction = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  transaction->BeginTransaction();
  try {
    if (catalogue.policies) KarstLib::AddPolicyInfo(*catalogue.policies);
    if (catalogue.datastores) KarstLib::AddDatastoreInfo(*catalogue.datastores);
    transaction->CommitTransaction();
  } catch (...) {
    try {
      transaction->AbortTransaction();
    } catch (...) {
      // The first failure is the one to report.
    }
    throw;
  }
}

void Export(const Operands&, StoreSession& store) {
  store.Open();
  auto policies = KarstLib::ListPolicyInfo();
  auto datastores = KarstLib::ListDatastoreInfo();
  PrintJson(CatalogueToJson(policies, datastores));
}

void Check(const Operands& operands, StoreSession&) {
  Warn(CatalogueWarnings(ReadRecords(operands[0], CatalogueFromJson), nullptr));
}

void BlobById(const Operands& operands, StoreSession& store) {
  store.Open();
  WriteOutput(KarstLib::GetPolicyBlobById(operands[0], operands[1]));
}

void BlobCorraById(const Operands& operands, StoreSession& store) {
  store.Open();
  WriteOutput(KarstLib::GetCorraPolicyBlobById(operands[0]));
}

void BlobCorraByName(const Operands& operands, StoreSession& store) {
  store.Open();
  WriteOutput(KarstLib::GetCorraPolicyBlobByName(operands[0]));
}

void BlobDefault(const Operands& operands, StoreSession& store) {
  store.Open();
  WriteOutput(KarstLib::GetDefaultPolicyBlob(operands[0]));
}

void Hash(const Operands&, StoreSession& store) {
  store.Open();
  PrintJson(Digests());
}

volatile std::sig_atomic_t gStopWatching = 0;

void StopWatching(int /*signal*/) { gStopWatching = 1; }

// A wait for a change lasts at most this long, so that a signal ends the
// watch within about as long.
constexpr std::chrono::milliseconds kWatchWait(200);
// After a failed read (a lock held through a crash recovery, say), before
// the next try.
constexpr std::chrono::seconds kWatchRetryPause(1);

// Sleeps kWatchRetryPause, or less when a signal ends the watch.
void PauseBeforeRetry() {
  const auto end = std::chrono::steady_clock::now() + kWatchRetryPause;
  while (gStopWatching == 0 && std::chrono::steady_clock::now() < end) {
    std::this_thread::sleep_for(kWatchWait);
  }
}

// Returns at SIGINT or SIGTERM. The first read fails the command like any
// other; later failures are reported, and the read is tried again every
// second until one succeeds. Only then does the watch wait for the next
// change: the change that a failed read missed has been announced already
// (on etcd, a watcher whose role is revoked still hears of commits it may
// not read), and waiting for another would keep the old digests until some
// later commit.
void Watch(const Operands&, StoreSession& session) {
  session.Open();
  struct sigaction stop {};
  stop.sa_handler = StopWatching;
  sigaction(SIGINT, &stop, nullptr);
  sigaction(SIGTERM, &stop, nullptr);
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  std::string last = Digests().dump() + "\n";
  WriteOutput(last);
  bool failed = false;
  while (gStopWatching == 0) {
    try {
      if (failed) {
        PauseBeforeRetry();
        if (gStopWatching != 0) break;
      } else if (!store->WaitForChange(static_cast<int>(kWatchWait.count()))) {
        continue;
      }
      std::string line = Digests().dump() + "\n";
      failed = false;
      if (line != last) WriteOutput(last = std::move(line));
    } catch (const TavoConfigStore::ConfigStoreException& e) {
      failed = true;
      WriteDiagnostic("warning: " + DescribeStoreError(e) + "; trying again");
    }
  }
}

}  // namespace

const std::vector<CommandEntry>& CommandTable() {
  static const std::vector<CommandEntry> table = {
      {{"reset"}, {}, "clear both catalogues", StoreUse::kWrite, Reset},
      {{"policies", "set"},
       {"FILE|-"},
       "replace the policy catalogue with a JSON array of policies",
       StoreUse::kWrite,
       SetPolicies},
      {{"policies", "list"},
       {},
       "print the policy catalogue as a JSON array",
       StoreUse::kRead,
       ListPolicies},
      {{"datastores", "set"},
       {"FILE|-"},
       "replace the datastore catalogue with a JSON array of datastores",
       StoreUse::kWrite,
       SetDatastores},
      {{"datastores", "list"},
       {},
       "print the datastore catalogue as a JSON array",
       StoreUse::kRead,
       ListDatastores},
      {{"import"},
       {"FILE|-"},
       "replace each catalogue the file holds, as export prints them; all or none",
       StoreUse::kWrite,
       Import},
      {{"export"},
       {},
       "print {\"policies\": [...], \"datastores\": [...]}; --version N: kept version N",
       StoreUse::kRead,
       Export},
      {{"check"},
       {"FILE|-"},
       "validate a file as import would, without opening the store",
       StoreUse::kNone,
       Check},
      {{"blob", "by-id"},
       {"POLICY_ID", "URL"},
       "blob of the first policy POLICY_ID for datastore URL's namespace",
       StoreUse::kRead,
       BlobById},
      {{"blob", "corra-by-id"},
       {"POLICY_ID"},
       "CORRA blob of the first policy POLICY_ID",
       StoreUse::kRead,
       BlobCorraById},
      {{"blob", "corra-by-name"},
       {"NAME"},
       "CORRA blob of the policy named NAME",
       StoreUse::kRead,
       BlobCorraByName},
      {{"blob", "default"},
       {"URL"},
       "blob of datastore URL's default policy for its namespace",
       StoreUse::kRead,
       BlobDefault},
      {{"hash"},
       {},
       "print {\"policies\": \"<crc32>\", \"datastores\": \"<crc32>\"}",
       StoreUse::kRead,
       Hash},
      {{"history", "depth"},
       {"K"},
       "keep the last K versions from now on (default 10; 0 keeps none)",
       StoreUse::kWrite,
       SetHistoryDepth},
      {{"history"},
       {},
       "list the kept versions, newest first, with their counts and hash digests",
       StoreUse::kRead,
       ListHistory},
      {{"rollback"},
       {"N"},
       "make kept version N current again, in one transaction (a new version)",
       StoreUse::kWrite,
       RollBack},
      {{"watch"},
       {},
       "one line of hash's digests now and at each change, until interrupted",
       StoreUse::kWatch,
       Watch},
  };
  return table;
}

}  // namespace karstctl
