// Listings of whole collections kept between reads, so that reading a
// collection nobody changed costs the cluster one small request instead of
// the collection: the reader asks whether the collection's pointer still has
// the mod revision and value it had, and only when it has not, for the
// objects (EtcdReader.h). A pointer's mod revision moves with every commit
// that changes its collection, and a change committed before a read begins
// has moved it by then, so a kept listing never shows a catalogue older
// than a new read would.
//
// One cache serves every store of the process that names the same members
// (in the same order), prefix, user, client certificate and size, on any
// thread; it goes with the last of them. It holds listings up to a size in
// all, dropping those read longest ago to make room; a collection larger
// than the whole size is not kept, and is read afresh each time.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_CACHE_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_CACHE_H_

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "EtcdListing.h"
#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {

class ListingCache {
 public:
  // The cache of the stores that share "options" as above; null when the
  // options ask for none (cacheMiB 0).
  static std::shared_ptr<ListingCache> For(const EtcdStoreOptions& options);

  explicit ListingCache(std::size_t limitBytes) : limit_(limitBytes) {}

  // Whether a listing of "bytes" (Listing::Bytes) may be kept.
  bool Fits(std::size_t bytes) const { return bytes <= limit_; }
  // The listing kept for "collection", or null.
  std::shared_ptr<const Listing> Find(const std::string& collection);
  // Keeps "listing" (filled, kept and its pointer set) for "collection" in
  // place of what was kept for it, if it fits; a listing that does not fit
  // only drops the one it replaces.
  void Keep(const std::string& collection, std::shared_ptr<const Listing> listing);
  // The collection is gone.
  void Drop(const std::string& collection);

 private:
  struct Kept {
    std::shared_ptr<const Listing> listing;
    std::size_t bytes = 0;
    std::uint64_t used = 0;  // when last found or kept, in calls
  };
  void DropLocked(std::map<std::string, Kept>::iterator it);

  const std::size_t limit_;
  std::mutex mu_;
  std::map<std::string, Kept> kept_;
  std::size_t bytes_ = 0;
  std::uint64_t clock_ = 0;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_CACHE_H_
