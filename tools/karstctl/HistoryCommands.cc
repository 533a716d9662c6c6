// history, history depth and rollback: the store's own history functions,
// with the library's listings and digests run on each kept version.

#include "HistoryCommands.h"

#include <climits>
#include <ctime>

#include "Args.h"
#include "Errors.h"
#include "Io.h"
#include "Json.h"
#include "Output.h"
#include "StoreSession.h"
#include "TavoConfigStore/StoreHistory.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

using TavoConfigStore::ConfigStore;
using TavoKarst::KarstLib;

namespace {

std::shared_ptr<ConfigStore> SessionStore() {
  return ConfigStore::GetStore(TavoConfigStore::sGlobalNamespace);
}

// UTC, to the millisecond: "2026-11-26T02:40:07.123Z".
std::string IsoTime(std::int64_t unixTimeMs) {
  const std::time_t seconds = static_cast<std::time_t>(unixTimeMs / 1000);
  std::tm utc{};
  gmtime_r(&seconds, &utc);
  char text[40];
  const std::size_t n = std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%S", &utc);
  std::snprintf(text + n, sizeof(text) - n, ".%03dZ", static_cast<int>(unixTimeMs % 1000));
  return text;
}

// The library reads the store installed for the process, so each version is
// installed in turn; the store does not know the library's records or its
// digests, and reading them through the library is what hash does.
Json Describe(const std::shared_ptr<ConfigStore>& store, const TavoConfigStore::StoreVersion& v) {
  TavoConfigStore::SetGlobalStore(TavoConfigStore::OpenVersion(store, v.number));
  Json out = Json::object();
  out["version"] = v.number;
  out["time"] = IsoTime(v.unixTimeMs);
  out["host"] = EncodeBytes(v.host);
  out["user"] = EncodeBytes(v.user);
  out["policies"] = KarstLib::ListPolicyInfo().size();
  out["datastores"] = KarstLib::ListDatastoreInfo().size();
  const auto hash = KarstLib::GetDbHash();
  out["hash"] = Json::object({{"policies", hash.first}, {"datastores", hash.second}});
  TavoConfigStore::SetGlobalStore(store);
  return out;
}

}  // namespace

Json HistoryStatus() {
  const auto store = SessionStore();
  try {
    return Json::object({{"depth", TavoConfigStore::HistoryDepth(*store)},
                         {"newest", TavoConfigStore::NewestVersion(*store)}});
  } catch (const TavoConfigStore::ConfigStoreException& e) {
    if (e.Code() != TavoConfigStore::kErrorNoHistory) throw;
    return nullptr;
  }
}

std::uint64_t ParseVersionNumber(const std::string& text, const std::string& what) {
  const bool digits = !text.empty() && text.size() <= 18 &&
                      text.find_first_not_of("0123456789") == std::string::npos;
  const std::uint64_t number = digits ? std::stoull(text) : 0;
  if (number == 0) {
    throw UsageError(what + " needs a version number (1 or more, as history lists them), not '" +
                     text + "'");
  }
  return number;
}

int ListHistory(const Invocation& invocation, StoreSession& session) {
  if (session.ReadsVersion()) throw UsageError("history lists every kept version: no --version");
  session.Open();
  const auto store = SessionStore();
  Json out = Json::array();
  for (const auto& version : TavoConfigStore::ListVersions(*store)) {
    out.push_back(Describe(store, version));
  }
  PrintJson(out, invocation.output.value_or(OutputForm::kPretty));
  return 0;
}

int SetHistoryDepth(const Invocation& invocation, StoreSession& session) {
  const std::string& text = invocation.operands[0];
  if (text.empty() || text.size() > 9 ||
      text.find_first_not_of("0123456789") != std::string::npos) {
    throw UsageError("history depth needs a number of versions to keep (0 keeps none), not '" +
                     text + "'");
  }
  session.Open();
  TavoConfigStore::SetHistoryDepth(*SessionStore(), static_cast<unsigned>(std::stoul(text)));
  return 0;
}

int RollBack(const Invocation& invocation, StoreSession& session) {
  const std::uint64_t number = ParseVersionNumber(invocation.operands[0], "rollback");
  session.Open();
  TavoConfigStore::Rollback(*SessionStore(), number);
  return 0;
}

}  // namespace karstctl
