// What a backend that keeps a history of its versions offers the functions
// of StoreHistory.h. A backend takes it on as a second base class; the
// public functions find it with a dynamic_cast, so the public ConfigStore
// class keeps its layout and its virtual table.

#ifndef TAVOCONFIGSTORE_SRC_HISTORY_SOURCE_H_
#define TAVOCONFIGSTORE_SRC_HISTORY_SOURCE_H_

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "TavoConfigStore/StoreHistory.h"

namespace TavoConfigStore {

class HistorySource {
 public:
  virtual ~HistorySource() = default;

  // For messages, as Backend::Where.
  virtual std::string HistoryWhere() const = 0;
  // Newest first.
  virtual std::vector<StoreVersion> Versions() = 0;
  virtual unsigned Depth() = 0;
  virtual void SetDepth(unsigned depth) = 0;
  // The number of the newest version, 0 before the first write.
  virtual std::uint64_t Newest() = 0;
  // The objects of version "number" that "filter" matches, in write order,
  // from one snapshot (inside the caller's transaction when one is open).
  // Throws kErrorNoSuchVersion for a version not kept.
  virtual std::vector<std::shared_ptr<ConfigStoreObject>> ListVersion(
      std::uint64_t number, const FilterSpecObject& filter) = 0;
};

// A new version numbered "number", made now by this host (its name) and the
// effective user (the name, or the number when it has none).
StoreVersion NewVersionBy(std::uint64_t number);

// The message of kErrorNoSuchVersion.
std::string NotKeptMessage(const std::string& where, std::uint64_t number);

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_HISTORY_SOURCE_H_
