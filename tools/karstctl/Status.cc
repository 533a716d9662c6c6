#include "Status.h"

#include <sqlite3.h>

#include "HistoryCommands.h"
#include "Io.h"
#include "Json.h"
#include "Output.h"
#include "TavoConfigStore/ConfigStore.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

namespace {

// The schema version in a SQLite store's header, read before the store is
// opened through the library (which brings an older file up to date), so
// that it is the version found; null when it cannot be read (a file that is
// no store then fails the listing with the store's own words).
Json SqliteFormat(const std::string& path) {
  sqlite3* db = nullptr;
  Json format = nullptr;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db, "PRAGMA user_version", -1, &statement, nullptr) == SQLITE_OK &&
        sqlite3_step(statement) == SQLITE_ROW) {
      format = sqlite3_column_int64(statement, 0);
    }
    sqlite3_finalize(statement);
  }
  sqlite3_close(db);
  return format;
}

std::string Text(const Json& status) {
  std::string out;
  for (const auto& [key, value] : status.items()) {
    std::string shown = value.is_string() ? value.get<std::string>() : value.dump();
    if (value.is_null()) shown = key == "history" ? "not kept" : "not recorded";
    if (key == "history" && value.is_object()) {
      const std::string kept = value["depth"] == 0 ? "none kept"
                               : value["depth"] == 1
                                   ? "the last version kept"
                                   : "the last " + value["depth"].dump() + " versions kept";
      shown = kept + ", newest " + value["newest"].dump();
    }
    std::string label = key;
    for (char& c : label) c = c == '_' ? ' ' : c;
    out += label + ": " + shown + "\n";
  }
  return out;
}

}  // namespace

void PrintStatus(const Invocation& invocation, StoreSession& store) {
  Json status = Json::object();
  status["store"] = TavoConfigStore::RedactLocator(store.Locator());
  status["chosen_by"] = store.ChosenBy();
  status["kind"] = store.IsEtcd() ? "etcd" : "sqlite";
  // An etcd store records no format version of its own.
  const Json format = store.IsEtcd() ? Json(nullptr) : SqliteFormat(store.Locator());
  store.Open();
  status["format"] = format;
  status["history"] = HistoryStatus();
  status["policies"] = TavoKarst::KarstLib::ListPolicyInfo().size();
  status["datastores"] = TavoKarst::KarstLib::ListDatastoreInfo().size();
  if (invocation.output) {
    PrintJson(status, *invocation.output);
  } else {
    WriteOutput(Text(status));
  }
}

}  // namespace karstctl
