// Reading a store's collections: their pointers, and the objects of the
// generations they point at, at one revision, so that one read is one
// snapshot even when a commit switches generations in between.
//
// A whole collection listed before and kept (EtcdListingCache.h) costs one
// small request while nobody changes it: a Range of its pointer, which
// proves the kept listing current when the pointer has the mod revision and
// value it had; a changed pointer costs a second request, for its
// generation at the revision of the first reply. Any other read of one
// collection asks for its pointer and for the generation it named last time
// in one request, and needs a second only when a commit has moved the
// collection to another generation. A whole generation listed before and
// not kept is asked for in two halves at once, split at an object's key
// remembered from then: etcd reads and sends the two side by side. Replies
// are read where they arrived (EtcdWire.h): an object's body is a view into
// its reply.
//
// Until the store's first write, the catalogue may still lie where an
// earlier version wrote it (EtcdLayout.h); readers read it there.

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_READER_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_READER_H_

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "../object/Arena.h"
#include "EtcdClient.h"
#include "EtcdLayout.h"
#include "EtcdListing.h"
#include "EtcdListingCache.h"
#include "EtcdVersions.h"
#include "EtcdWire.h"

namespace TavoConfigStore {

// A collection as the cluster has it at one revision.
struct Current {
  std::string gen;
  std::int64_t version = 0;  // the pointer's mod revision; 0: no such collection
  std::string token;         // of the commit that wrote the pointer
  std::string value;         // the pointer's value, all of it
};

struct Pointers {
  std::int64_t revision = 0;
  std::map<std::string, Current> byCollection;
  // The layout they were read in: the store's own, or that of an earlier
  // version whose catalogue the store's first write has not moved yet.
  const etcdlayout::Keys* keys = nullptr;
  // When asked for: generations under the store's own root whose writer
  // died before making them current (registered, no live writer, no
  // pointer, no kept version naming them). Nothing can make such a
  // generation current any more.
  std::vector<std::string> orphans;
  // With the orphans: the history, from the same read.
  HistoryState history;

  const Current* Find(const std::string& collection) const {
    auto it = byCollection.find(collection);
    return it == byCollection.end() ? nullptr : &it->second;
  }
};

// The object "entry" holds, with identifier "id": a damaged one when its
// parts are (the message after "where"); otherwise read in place, kept by
// "owner", or with "owner" null copied into "arena" (null: memory of its
// own).
std::shared_ptr<ConfigStoreObject> ObjectOf(ConfigStoreObjectId id, const Entry& entry,
                                            const std::shared_ptr<const void>& owner,
                                            objectmodel::Arena* arena, const std::string& where);

class EtcdReader {
 public:
  // "cache" (may be null) keeps whole collections' listings between reads.
  EtcdReader(EtcdClient& client, std::string_view prefix, std::shared_ptr<ListingCache> cache);

  // The layout of the store's own root.
  const etcdlayout::Keys& OwnKeys() const { return keys_; }

  // The pointer of "collection", or of every collection when it is "", as
  // readers see them; with "orphans", also the history and the generations
  // a dead writer left under the store's own root.
  Pointers ReadPointers(const std::string& collection, bool orphans = false);
  // The pointer of one collection and, when it has one, the objects of its
  // generation (or its one object "instance"), at one revision, in
  // "*listing": for a whole collection, possibly one kept from an earlier
  // read, and shared with other readers.
  Pointers ReadCollection(const std::string& collection, const std::string* instance,
                          std::shared_ptr<const Listing>* listing);
  // The objects of "collection" (or its one object "instance") as
  // "pointers" has it, at their revision; a whole collection from the cache
  // when it kept the listing that pointer names.
  std::shared_ptr<const Listing> ReadListing(const Pointers& pointers,
                                             const std::string& collection,
                                             const std::string* instance);
  // The objects of a generation (or its one object "instance") at
  // "revision", in the order the cluster keeps the keys. Their bytes stay
  // in "*reply".
  void ReadGeneration(const etcdlayout::Keys& keys, const std::string& gen,
                      const std::string* instance, std::int64_t revision, etcdwire::Reply* reply,
                      std::vector<Entry>* entries);
  // A commit has moved the catalogue under the store's own root.
  void Moved() { layout_ = Layout::kCurrent; }

  // Runs "read" again when etcd compacted away the revision it was reading
  // at between its requests, up to three times in all.
  template <typename Read>
  static auto Snapshot(const Read& read) -> decltype(read()) {
    for (int attempt = 1;; ++attempt) {
      try {
        return read();
      } catch (const ConfigStoreException& e) {
        if (e.Code() != EtcdCode(grpc::StatusCode::OUT_OF_RANGE) || attempt == 3) throw;
      }
    }
  }

 private:
  // Where to ask for a generation read before: its id, and the key at which
  // a listing of it is split in two (empty: not split).
  struct LastRead {
    std::string gen;
    std::string split;
  };
  void Remember(const std::string& collection, const std::string& gen,
                const std::vector<Entry>* listed);
  // ReadCollection of a collection whose listing "kept" was kept.
  Pointers ReadKept(const std::string& collection, std::shared_ptr<const Listing> kept,
                    std::shared_ptr<const Listing>* listing);
  // Keeps a whole collection's listing, read under "current", for later reads.
  void Keep(const std::string& collection, const Current& current,
            const std::shared_ptr<Listing>& listing);

  EtcdClient& client_;
  const std::shared_ptr<ListingCache> cache_;
  const etcdlayout::Keys keys_;
  const etcdlayout::Keys legacyKeys_;
  // Whether the old root may still hold this store's catalogue: asked once
  // a store while it does not; while it does, at every read, as any write
  // moves it.
  enum class Layout { kUnknown, kLegacy, kCurrent } layout_ = Layout::kUnknown;
  std::map<std::string, LastRead> lastRead_;
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_READER_H_
