#include "Run.h"

#include <signal.h>

#include <chrono>
#include <csignal>
#include <string>
#include <thread>
#include <vector>

#include "Errors.h"
#include "Io.h"
#include "JsonCodec.h"
#include "JsonText.h"
#include "StoreErrors.h"
#include "StoreSession.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"
#include "Warnings.h"

namespace karstctl {

using TavoKarst::KarstLib;

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

// Each replace commits its own transaction; begun inside this one, it is a
// savepoint of it, so both catalogues become durable together or not at all.
void ReplaceBoth(const Catalogue& catalogue) {
  auto store = TavoConfigStore::ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
  store->BeginTransaction();
  try {
    if (catalogue.policies) KarstLib::AddPolicyInfo(*catalogue.policies);
    if (catalogue.datastores) KarstLib::AddDatastoreInfo(*catalogue.datastores);
    store->CommitTransaction();
  } catch (...) {
    try {
      store->AbortTransaction();
    } catch (...) {
      // The first failure is the one to report.
    }
    throw;
  }
}

Json Digests() {
  auto hash = KarstLib::GetDbHash();
  Json out = Json::object();
  out["policies"] = hash.first;
  out["datastores"] = hash.second;
  return out;
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

// The first read fails the command like any other; later failures are
// reported, and the read is tried again every second until one succeeds.
// Only then does the watch wait for the next change: the change that a
// failed read missed has been announced already (on etcd, a watcher whose
// role is revoked still hears of commits it may not read), and waiting for
// another would keep the old digests until some later commit.
void Watch(StoreSession& session) {
  session.Open(StoreUse::kWatch);
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

void RunRead(const Invocation& invocation, StoreSession& session) {
  const std::vector<std::string>& operands = invocation.operands;
  session.Open(StoreUse::kRead);
  switch (invocation.command) {
    case Command::kPoliciesList:
      PrintJson(PoliciesToJson(KarstLib::ListPolicyInfo()));
      break;
    case Command::kDatastoresList:
      PrintJson(DatastoresToJson(KarstLib::ListDatastoreInfo()));
      break;
    case Command::kExport: {
      auto policies = KarstLib::ListPolicyInfo();
      auto datastores = KarstLib::ListDatastoreInfo();
      PrintJson(CatalogueToJson(policies, datastores));
      break;
    }
    case Command::kBlobById:
      WriteOutput(KarstLib::GetPolicyBlobById(operands[0], operands[1]));
      break;
    case Command::kBlobCorraById:
      WriteOutput(KarstLib::GetCorraPolicyBlobById(operands[0]));
      break;
    case Command::kBlobCorraByName:
      WriteOutput(KarstLib::GetCorraPolicyBlobByName(operands[0]));
      break;
    case Command::kBlobDefault:
      WriteOutput(KarstLib::GetDefaultPolicyBlob(operands[0]));
      break;
    case Command::kHash:
      PrintJson(Digests());
      break;
    default:
      break;
  }
}

}  // namespace

void RunCommand(const Invocation& invocation) {
  const std::vector<std::string>& operands = invocation.operands;
  switch (invocation.command) {
    case Command::kCheck:
      Warn(CatalogueWarnings(ReadRecords(operands[0], CatalogueFromJson), nullptr));
      return;
    case Command::kHelp:
    case Command::kVersion:
      return;  // answered before the store is chosen
    default:
      break;
  }
  StoreSession session(invocation);  // a bad locator fails here, before any input
  switch (invocation.command) {
    case Command::kReset:
      session.Open(StoreUse::kWrite);
      KarstLib::Reset();
      break;
    case Command::kPoliciesSet: {
      auto policies = ReadRecords(
          operands[0], [](const Json& json) { return PoliciesFromJson(json, "policies"); });
      Warn(PolicyWarnings(policies));
      session.Open(StoreUse::kWrite);
      KarstLib::AddPolicyInfo(policies);
      break;
    }
    case Command::kDatastoresSet: {
      auto datastores = ReadRecords(
          operands[0], [](const Json& json) { return DatastoresFromJson(json, "datastores"); });
      session.Open(StoreUse::kWrite);
      const auto stored = KarstLib::ListPolicyInfo();
      Warn(DatastoreWarnings(datastores, &stored, "the store"));
      KarstLib::AddDatastoreInfo(datastores);
      break;
    }
    case Command::kImport: {
      Catalogue catalogue = ReadRecords(operands[0], CatalogueFromJson);
      session.Open(StoreUse::kWrite);
      std::vector<TavoKarst::KarstPolicyInfo> stored;
      if (catalogue.datastores && !catalogue.policies) stored = KarstLib::ListPolicyInfo();
      Warn(CatalogueWarnings(catalogue, &stored));
      ReplaceBoth(catalogue);
      break;
    }
    case Command::kWatch:
      Watch(session);
      break;
    default:
      RunRead(invocation, session);
  }
}

}  // namespace karstctl
