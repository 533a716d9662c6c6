// What a read of one collection found: its objects, their bytes still in the
// replies that brought them (EtcdWire.h).

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_H_

#include <algorithm>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "EtcdWire.h"
#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {

// An object's place in write order.
struct Order {
  std::int64_t revision = 0;
  std::uint64_t index = 0;
  bool operator<(const Order& other) const {
    return revision != other.revision ? revision < other.revision : index < other.index;
  }
};

// An object read from one of several collections, with its place in write
// order.
struct Listed {
  Order order;
  std::shared_ptr<ConfigStoreObject> object;
};

// The objects of "listed" in write order, across their collections.
inline std::vector<std::shared_ptr<ConfigStoreObject>> InWriteOrder(std::vector<Listed> listed) {
  std::stable_sort(listed.begin(), listed.end(),
                   [](const Listed& a, const Listed& b) { return a.order < b.order; });
  std::vector<std::shared_ptr<ConfigStoreObject>> out;
  out.reserve(listed.size());
  for (Listed& l : listed) out.push_back(std::move(l.object));
  return out;
}

// One stored object of a generation, its bytes still in the reply.
struct Entry {
  std::string instance;
  Order order;
  std::string_view body;
  std::string joined;  // a body stored in several parts, put together
  std::string damage;  // why the object cannot be read, if it cannot
};

// The replies a read of one collection keeps; entries point into them.
struct Replies {
  etcdwire::Reply first;
  etcdwire::Reply second;  // the second half of a split listing, or a second read
};

// The objects of one collection (or of one of its objects) at one revision,
// and the replies they lie in. Neither copied nor moved once filled: the
// entries point into the replies.
struct Listing {
  Listing() = default;
  Listing(const Listing&) = delete;
  Listing& operator=(const Listing&) = delete;

  Replies replies;
  std::vector<Entry> entries;

  // Set for a whole collection's listing that the store keeps for later
  // reads (EtcdListingCache.h): the pointer it was read under, its value
  // (generation and commit token) and its mod revision. Every commit that
  // changes the collection rewrites the pointer, so while both are the same
  // the listing is what a new read would find.
  bool kept = false;
  std::string gen;
  std::string pointer;
  std::int64_t version = 0;

  // The memory the listing holds, about.
  std::size_t Bytes() const {
    std::size_t bytes = replies.first.bytes.size() + replies.second.bytes.size() +
                        entries.capacity() * sizeof(Entry);
    for (const Entry& entry : entries) bytes += entry.joined.size() + entry.instance.capacity();
    for (const etcdwire::Reply* reply : {&replies.first, &replies.second}) {
      for (const etcdwire::Range& range : reply->ranges) {
        bytes += range.kvs.capacity() * sizeof(etcdwire::KeyValue);
      }
    }
    return bytes;
  }
};

}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_LISTING_H_
