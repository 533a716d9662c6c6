#include "EtcdListingCache.h"

#include <utility>
#include <vector>

namespace TavoConfigStore {
namespace {

// The caches in use, by what their stores share. Never destroyed: a store
// released by another static's destructor may still look here.
struct Registry {
  std::mutex mu;
  std::map<std::string, std::weak_ptr<ListingCache>> caches;
};

Registry& Caches() {
  static Registry* registry = new Registry;
  return *registry;
}

// What the stores of one cache share, as one string: each part's length
// before it keeps any two lists of parts apart. The password is left out:
// every read asks the cluster, which refuses a wrong one.
std::string CacheName(const EtcdStoreOptions& options) {
  std::string name;
  auto add = [&name](const std::string& part) { name += std::to_string(part.size()) + ':' + part; };
  add(options.tls ? "tls" : "plain");
  add(options.user);
  add(options.certFile);
  add(options.prefix);
  add(std::to_string(options.cacheMiB));
  for (const std::string& endpoint : options.endpoints) add(endpoint);
  return name;
}

}  // namespace

std::shared_ptr<ListingCache> ListingCache::For(const EtcdStoreOptions& options) {
  if (options.cacheMiB <= 0) return nullptr;
  Registry& registry = Caches();
  std::lock_guard<std::mutex> lock(registry.mu);
  for (auto it = registry.caches.begin(); it != registry.caches.end();) {
    it = it->second.expired() ? registry.caches.erase(it) : std::next(it);
  }
  std::weak_ptr<ListingCache>& slot = registry.caches[CacheName(options)];
  std::shared_ptr<ListingCache> cache = slot.lock();
  if (!cache) {
    cache = std::make_shared<ListingCache>(static_cast<std::size_t>(options.cacheMiB) << 20);
    slot = cache;
  }
  return cache;
}

std::shared_ptr<const Listing> ListingCache::Find(const std::string& collection) {
  std::lock_guard<std::mutex> lock(mu_);
  auto it = kept_.find(collection);
  if (it == kept_.end()) return nullptr;
  it->second.used = ++clock_;
  return it->second.listing;
}

void ListingCache::Keep(const std::string& collection, std::shared_ptr<const Listing> listing) {
  const std::size_t bytes = listing->Bytes();
  // Released after the lock: freeing a large listing takes a while.
  std::vector<std::shared_ptr<const Listing>> dropped;
  std::lock_guard<std::mutex> lock(mu_);
  auto it = kept_.find(collection);
  if (it != kept_.end()) {
    // A slower reader of an older version must not replace a newer one.
    if (it->second.listing->version > listing->version) return;
    dropped.push_back(it->second.listing);
    DropLocked(it);
  }
  if (bytes > limit_) return;
  while (bytes_ + bytes > limit_) {
    auto oldest = kept_.begin();
    for (auto k = kept_.begin(); k != kept_.end(); ++k) {
      if (k->second.used < oldest->second.used) oldest = k;
    }
    dropped.push_back(oldest->second.listing);
    DropLocked(oldest);
  }
  kept_[collection] = Kept{std::move(listing), bytes, ++clock_};
  bytes_ += bytes;
}

void ListingCache::Drop(const std::string& collection) {
  std::lock_guard<std::mutex> lock(mu_);
  auto it = kept_.find(collection);
  if (it != kept_.end()) DropLocked(it);
}

void ListingCache::DropLocked(std::map<std::string, Kept>::iterator it) {
  bytes_ -= it->second.bytes;
  kept_.erase(it);
}

}  // namespace TavoConfigStore
