// The commands: the table that names them, and what each one does.
#include <signal.h>

#include <chrono>
#include <csignal>
#include <string>
#include <thread>
#include <vector>

#include "Args.h"
#include "BlobLookups.h"
#include "Diff.h"
#include "Errors.h"
#include "HistoryCommands.h"
#include "Io.h"
#include "Json.h"
#include "Output.h"
#include "Status.h"
#include "StoreErrors.h"
#include "StoreSession.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "Warnings.h"

namespace karstctl {

using TavoKarst::KarstLib;

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitChanges = 1;  // diff: the file would change the store

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

OutputForm Form(const Invocation& invocation, OutputForm otherwise = OutputForm::kPretty) {
  return invocation.output.value_or(otherwise);
}

Json Digests() {
  auto hash = KarstLib::GetDbHash();
  Json out = Json::object();
  out["policies"] = hash.first;
  out["datastores"] = hash.second;
  return out;
}

Catalogue Stored() {
  Catalogue stored;
  stored.policies = KarstLib::ListPolicyInfo();
  stored.datastores = KarstLib::ListDatastoreInfo();
  return stored;
}

// Reads what a write would need of the store beside "catalogue" and reports
// the warnings; with --strict a warning ends the command here.
void WarnBeforeWriting(const Catalogue& catalogue, const Invocation& invocation) {
  std::vector<TavoKarst::KarstPolicyInfo> policies;
  std::vector<TavoKarst::KarstDatastoreInfo> datastores;
  StoredBeside stored;
  if (catalogue.datastores && !catalogue.policies) {
    policies = KarstLib::ListPolicyInfo();
    stored.policies = &policies;
  }
  if (catalogue.policies && !catalogue.datastores) {
    datastores = KarstLib::ListDatastoreInfo();
    stored.datastores = &datastores;
  }
  ReportWarnings(CatalogueWarnings(catalogue, stored), invocation);
}

// Each replace commits its own transaction; begun inside this one, it is a
// savepoint of it, so both catalogues become durable together or not at all.
void Write(const Catalogue& catalogue) {
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

int Reset(const Invocation&, StoreSession& store) {
  store.Open();
  KarstLib::Reset();
  return kExitSuccess;
}

int SetPolicies(const Invocation& invocation, StoreSession& store) {
  Catalogue catalogue;
  catalogue.policies = ReadRecords(
      invocation.operands[0], [](const Json& json) { return PoliciesFromJson(json, "policies"); });
  store.Open();
  WarnBeforeWriting(catalogue, invocation);
  KarstLib::AddPolicyInfo(*catalogue.policies);
  return kExitSuccess;
}

int SetDatastores(const Invocation& invocation, StoreSession& store) {
  Catalogue catalogue;
  catalogue.datastores = ReadRecords(invocation.operands[0], [](const Json& json) {
    return DatastoresFromJson(json, "datastores");
  });
  store.Open();
  WarnBeforeWriting(catalogue, invocation);
  KarstLib::AddDatastoreInfo(*catalogue.datastores);
  return kExitSuccess;
}

int Import(const Invocation& invocation, StoreSession& store) {
  const Catalogue catalogue = ReadRecords(invocation.operands[0], CatalogueFromJson);
  store.Open();
  WarnBeforeWriting(catalogue, invocation);
  Write(catalogue);
  return kExitSuccess;
}

int ListPolicies(const Invocation& invocation, StoreSession& store) {
  store.Open();
  PrintJson(PoliciesToJson(KarstLib::ListPolicyInfo()), Form(invocation));
  return kExitSuccess;
}

int ListDatastores(const Invocation& invocation, StoreSession& store) {
  store.Open();
  PrintJson(DatastoresToJson(KarstLib::ListDatastoreInfo()), Form(invocation));
  return kExitSuccess;
}

// The record stored under "key", printed as a listing prints it.
template <typename Record>
int GetRecord(const Invocation& invocation, const std::vector<Record>& records,
              std::string Record::*key, const char* what, const char* keyName,
              Json (*toJson)(const std::vector<Record>&)) {
  for (const Record& record : records) {
    if (record.*key == invocation.operands[0]) {
      PrintJson(toJson({record})[0], Form(invocation));
      return kExitSuccess;
    }
  }
  throw NotFoundError(std::string("no ") + what + " with " + keyName + " " +
                      EncodeBytes(invocation.operands[0]).dump());
}

int GetPolicy(const Invocation& invocation, StoreSession& store) {
  store.Open();
  return GetRecord(invocation, KarstLib::ListPolicyInfo(), &TavoKarst::KarstPolicyInfo::name,
                   "policy", "name", PoliciesToJson);
}

int GetDatastore(const Invocation& invocation, StoreSession& store) {
  store.Open();
  return GetRecord(invocation, KarstLib::ListDatastoreInfo(), &TavoKarst::KarstDatastoreInfo::url,
                   "datastore", "url", DatastoresToJson);
}

int Export(const Invocation& invocation, StoreSession& store) {
  store.Open();
  auto policies = KarstLib::ListPolicyInfo();
  auto datastores = KarstLib::ListDatastoreInfo();
  PrintJson(CatalogueToJson(policies, datastores), Form(invocation));
  return kExitSuccess;
}

int Check(const Invocation& invocation, StoreSession&) {
  const Catalogue catalogue = ReadRecords(invocation.operands[0], CatalogueFromAnyJson);
  ReportWarnings(CatalogueWarnings(catalogue, StoredBeside()), invocation);
  return kExitSuccess;
}

int Diff(const Invocation& invocation, StoreSession& store) {
  const std::string& file = invocation.operands[0];
  const Catalogue proposed = ReadRecords(file, [](const Json& json) {
    Catalogue catalogue = CatalogueFromAnyJson(json);
    if (json.is_array() && !catalogue.policies && !catalogue.datastores) {
      throw InputError(
          "an empty list is no catalogue to compare: write {\"policies\": []} "
          "or {\"datastores\": []}");
    }
    return catalogue;
  });
  store.Open();
  WarnBeforeWriting(proposed, invocation);
  // The comparison takes what is stored and what the file would make it,
  // so any catalogue kept elsewhere (an earlier version) compares alike.
  const CatalogueDiff diff = DiffCatalogues(Stored(), proposed);
  if (!invocation.output) {
    WriteOutput(DiffToText(diff));
  } else if (*invocation.output == OutputForm::kLines) {
    // One change a line, each naming its catalogue.
    const Json byCatalogue = DiffToJson(diff);
    Json changes = Json::array();
    for (const auto& [catalogue, list] : byCatalogue.items()) {
      for (Json change : list) {
        change["catalogue"] = catalogue;
        changes.push_back(std::move(change));
      }
    }
    PrintJson(changes, OutputForm::kLines);
  } else {
    PrintJson(DiffToJson(diff), *invocation.output);
  }
  return diff.Empty() ? kExitSuccess : kExitChanges;
}

// A blob is written raw; with --require, finding none (which the library
// cannot tell from an empty blob) is explained and exits 3.
int PrintBlob(const Invocation& invocation, BlobLookup lookup, const std::string& blob) {
  if (blob.empty() && invocation.require) {
    const std::string missing = WhyNoBlob(lookup, invocation.operands);
    if (!missing.empty()) throw NotFoundError(missing);
  }
  WriteOutput(blob);
  return kExitSuccess;
}

int BlobById(const Invocation& invocation, StoreSession& store) {
  store.Open();
  const auto& operands = invocation.operands;
  return PrintBlob(invocation, BlobLookup::kById,
                   KarstLib::GetPolicyBlobById(operands[0], operands[1]));
}

int BlobCorraById(const Invocation& invocation, StoreSession& store) {
  store.Open();
  return PrintBlob(invocation, BlobLookup::kCorraById,
                   KarstLib::GetCorraPolicyBlobById(invocation.operands[0]));
}

int BlobCorraByName(const Invocation& invocation, StoreSession& store) {
  store.Open();
  return PrintBlob(invocation, BlobLookup::kCorraByName,
                   KarstLib::GetCorraPolicyBlobByName(invocation.operands[0]));
}

int BlobDefault(const Invocation& invocation, StoreSession& store) {
  store.Open();
  return PrintBlob(invocation, BlobLookup::kDefault,
                   KarstLib::GetDefaultPolicyBlob(invocation.operands[0]));
}

int Hash(const Invocation& invocation, StoreSession& store) {
  store.Open();
  PrintJson(Digests(), Form(invocation));
  return kExitSuccess;
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
// later commit. The digests print as hash prints them for the same
// --output; without one, on one line each.
int Watch(const Invocation& invocation, StoreSession& session) {
  session.Open();
  struct sigaction stop {};
  stop.sa_handler = StopWatching;
  sigaction(SIGINT, &stop, nullptr);
  sigaction(SIGTERM, &stop, nullptr);
  const OutputForm form = Form(invocation, OutputForm::kLines);
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  std::string last = RenderJson(Digests(), form);
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
      std::string digests = RenderJson(Digests(), form);
      failed = false;
      if (digests != last) WriteOutput(last = std::move(digests));
    } catch (const TavoConfigStore::ConfigStoreException& e) {
      failed = true;
      WriteDiagnostic("warning: " + DescribeStoreError(e) + "; trying again");
    }
  }
  return kExitSuccess;
}

int Status(const Invocation& invocation, StoreSession& store) {
  PrintStatus(invocation, store);
  return kExitSuccess;
}

// The options of the commands that read a file to write or compare it, and
// of the blob look-ups; every command takes --output.
const std::vector<std::string> kWarns = {"--quiet", "--strict"};
const std::vector<std::string> kLooksUp = {"--require"};

}  // namespace

const std::vector<CommandEntry>& CommandTable() {
  static const std::vector<CommandEntry> table = {
      {{"reset"}, {}, "clear both catalogues", StoreUse::kWrite, {}, "karstctl reset", Reset},
      {{"policies", "set"},
       {"FILE|-"},
       "replace the policy catalogue with a JSON array of policies",
       StoreUse::kWrite,
       kWarns,
       "karstctl policies set --strict policies.json",
       SetPolicies},
      {{"policies", "list"},
       {},
       "print the policy catalogue as a JSON array",
       StoreUse::kRead,
       {},
       "karstctl policies list --output lines",
       ListPolicies},
      {{"policies", "get"},
       {"NAME"},
       "print the policy stored under NAME; exit 3 if there is none",
       StoreUse::kRead,
       {},
       "karstctl policies get gold",
       GetPolicy},
      {{"datastores", "set"},
       {"FILE|-"},
       "replace the datastore catalogue with a JSON array of datastores",
       StoreUse::kWrite,
       kWarns,
       "karstctl datastores set --quiet datastores.json",
       SetDatastores},
      {{"datastores", "list"},
       {},
       "print the datastore catalogue as a JSON array",
       StoreUse::kRead,
       {},
       "karstctl datastores list --output json",
       ListDatastores},
      {{"datastores", "get"},
       {"URL"},
       "print the datastore stored under URL; exit 3 if there is none",
       StoreUse::kRead,
       {},
       "karstctl datastores get ds://store-a",
       GetDatastore},
      {{"import"},
       {"FILE|-"},
       "replace each catalogue the file holds, as export prints them; all or none",
       StoreUse::kWrite,
       kWarns,
       "karstctl import --strict catalogue.json",
       Import},
      {{"export"},
       {},
       "print {\"policies\": [...], \"datastores\": [...]}; --version N: kept version N",
       StoreUse::kRead,
       {},
       "karstctl export > catalogue.json",
       Export},
      {{"check"},
       {"FILE|-"},
       "validate any form karstctl reads, as a write would; opens no store",
       StoreUse::kNone,
       kWarns,
       "karstctl policies list | karstctl check -",
       Check},
      {{"diff"},
       {"FILE|-"},
       "what writing the file would change, record by record; exit 1 if anything",
       StoreUse::kRead,
       kWarns,
       "karstctl diff catalogue.json",
       Diff,
       2},
      {{"blob", "by-id"},
       {"POLICY_ID", "URL"},
       "blob of the first policy POLICY_ID for datastore URL's namespace",
       StoreUse::kRead,
       kLooksUp,
       "karstctl blob by-id pol-0001 ds://store-a > blob.bin",
       BlobById},
      {{"blob", "corra-by-id"},
       {"POLICY_ID"},
       "CORRA blob of the first policy POLICY_ID",
       StoreUse::kRead,
       kLooksUp,
       "karstctl blob corra-by-id pol-0001 > corra.bin",
       BlobCorraById},
      {{"blob", "corra-by-name"},
       {"NAME"},
       "CORRA blob of the policy named NAME",
       StoreUse::kRead,
       kLooksUp,
       "karstctl blob corra-by-name --require gold > gold.bin",
       BlobCorraByName},
      {{"blob", "default"},
       {"URL"},
       "blob of datastore URL's default policy for its namespace",
       StoreUse::kRead,
       kLooksUp,
       "karstctl blob default ds://store-a > default.bin",
       BlobDefault},
      {{"hash"},
       {},
       "print {\"policies\": \"<crc32>\", \"datastores\": \"<crc32>\"}",
       StoreUse::kRead,
       {},
       "karstctl hash --output json",
       Hash},
      {{"history", "depth"},
       {"K"},
       "keep the last K versions from now on (default 10; 0 keeps none)",
       StoreUse::kWrite,
       {},
       "karstctl history depth 20",
       SetHistoryDepth},
      {{"history"},
       {},
       "list the kept versions, newest first, with their counts and hash digests",
       StoreUse::kRead,
       {},
       "karstctl history --output lines",
       ListHistory},
      {{"rollback"},
       {"N"},
       "make kept version N current again, in one transaction (a new version)",
       StoreUse::kWrite,
       {},
       "karstctl rollback 41",
       RollBack},
      {{"watch"},
       {},
       "hash's digests now and at each change, until interrupted",
       StoreUse::kWatch,
       {},
       "karstctl watch",
       Watch},
      {{"status"},
       {},
       "the store in use and why, its kind, format and record counts",
       StoreUse::kRead,
       {},
       "karstctl status",
       Status},
  };
  return table;
}

}  // namespace karstctl
