#include "hash/DbHash.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <vector>

#include "Velk/Misc.h"
#include "datastore/DatastoreStore.h"
#include "hash/Crc32.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

// Sort keys compare as std::string does: unsigned bytes, shorter first on a
// common prefix. Records tied on their key are ordered by their whole text,
// so the digest does not depend on the store's order even then.
namespace {

// 8 bytes of a key from "from" on, big-endian and zero-padded: comparing two
// of these orders keys as their bytes from "from" on do, except that a tie
// leaves it open (equal bytes, or a shorter key padded with zeros).
std::uint64_t KeyPrefix(const std::string& key, std::size_t from) {
  std::uint64_t v = 0;
  for (std::size_t i = from; i < from + 8; ++i) {
    v = (v << 8) | (i < key.size() ? static_cast<unsigned char>(key[i]) : 0u);
  }
  return v;
}

// Orders "count" records by key, then (for tied keys) by text, and digests
// their texts' digests in that order. "keyOf(i)" is record i's key;
// "textOf(i)" builds its text, once per record.
//
// The order is found through a compact index: sorting the records in place
// compares keys scattered over the heap, a cache miss or two per comparison
// once there are many. The bytes every key shares decide nothing, so each
// entry carries the 8 that follow them. A text is kept only while its key is
// tied with another's; the others are digested as soon as they are built.
template <typename KeyOf, typename TextOf>
std::string DigestOfDigests(std::size_t count, KeyOf keyOf, TextOf textOf) {
  std::size_t common = count == 0 ? 0 : keyOf(0).size();
  for (std::size_t i = 1; i < count; ++i) {
    const std::string& first = keyOf(0);
    const std::string& key = keyOf(i);
    common = std::min(common, key.size());
    common = static_cast<std::size_t>(
        std::mismatch(first.begin(), first.begin() + static_cast<std::ptrdiff_t>(common),
                      key.begin())
            .first -
        first.begin());
  }
  struct Entry {
    std::uint64_t prefix;
    std::size_t index;
  };
  std::vector<Entry> order;
  order.reserve(count);
  for (std::size_t i = 0; i < count; ++i) order.push_back({KeyPrefix(keyOf(i), common), i});
  std::sort(order.begin(), order.end(), [&keyOf](const Entry& a, const Entry& b) {
    if (a.prefix != b.prefix) return a.prefix < b.prefix;
    return keyOf(a.index) < keyOf(b.index);
  });

  std::vector<bool> tied(count, false);
  // Keys whose prefixes differ differ; only equal prefixes need the keys,
  // which lie all over the heap.
  for (std::size_t i = 1; i < count; ++i) {
    if (order[i].prefix == order[i - 1].prefix &&
        keyOf(order[i].index) == keyOf(order[i - 1].index)) {
      tied[order[i].index] = tied[order[i - 1].index] = true;
    }
  }
  std::vector<std::string> digests(count);
  std::vector<std::string> texts;  // sized only when some keys tie
  for (std::size_t i = 0; i < count; ++i) {
    const std::string& text = textOf(i);
    digests[i] = Crc32Hex(text);
    if (tied[i]) {
      if (texts.empty()) texts.resize(count);
      texts[i] = text;
    }
  }
  for (std::size_t begin = 0; begin < count;) {
    std::size_t end = begin + 1;
    if (!tied[order[begin].index]) {
      begin = end;
      continue;
    }
    while (end < count && order[end].prefix == order[begin].prefix &&
           keyOf(order[end].index) == keyOf(order[begin].index)) {
      ++end;
    }
    std::sort(order.begin() + static_cast<std::ptrdiff_t>(begin),
              order.begin() + static_cast<std::ptrdiff_t>(end),
              [&texts](const Entry& a, const Entry& b) { return texts[a.index] < texts[b.index]; });
    begin = end;
  }

  std::string accumulator;
  accumulator.reserve(count * 8);
  for (const Entry& e : order) accumulator += digests[e.index];
  return Crc32Hex(accumulator);
}

// Builds a policy's text into "*text", whose capacity is reused from one
// policy to the next.
void PolicyText(const KarstPolicyInfo& policy, std::string* text) {
  // "%s" stops at a NUL: name, policy_id and description count only up to it.
  text->assign(Velk::Misc::StrPrintf("%s%s%s%ld", policy.name.c_str(), policy.policy_id.c_str(),
                                     policy.description.c_str(), policy.generation_number));
  // Blob entries in ascending order of namespace; tied namespaces by blob. The
  // usual handful of indices is sorted on the stack.
  constexpr std::size_t kFew = 8;
  std::uint32_t few[kFew];
  std::vector<std::uint32_t> many;
  const std::size_t count = policy.blobs.size();
  if (count > kFew) many.resize(count);
  std::uint32_t* order = count > kFew ? many.data() : few;
  for (std::size_t i = 0; i < count; ++i) order[i] = static_cast<std::uint32_t>(i);
  const std::vector<KarstPolicyBlob>& blobs = policy.blobs;
  std::sort(order, order + count, [&blobs](std::uint32_t a, std::uint32_t b) {
    const int byKey = blobs[a].datastore_namespace.compare(blobs[b].datastore_namespace);
    return byKey != 0 ? byKey < 0 : blobs[a].blob < blobs[b].blob;
  });
  for (std::size_t i = 0; i < count; ++i) {
    *text += blobs[order[i]].datastore_namespace;
    *text += blobs[order[i]].blob;
  }
}
// A large catalogue is far bigger than the caches, and each policy's strings
// sit behind two or three pointers: fetched one after another, every one
// costs a trip to memory. Asking for the next policies' memory ahead lets
// those trips overlap.
void PrefetchBlobList(const KarstPolicyInfo& policy) {
  __builtin_prefetch(policy.blobs.data());
  __builtin_prefetch(policy.name.data());
  __builtin_prefetch(policy.policy_id.data());
  __builtin_prefetch(policy.description.data());
}

void PrefetchBlobs(const KarstPolicyInfo& policy) {
  for (const KarstPolicyBlob& blob : policy.blobs) {
    __builtin_prefetch(blob.datastore_namespace.data());
    const char* bytes = blob.blob.data();
    for (std::size_t at = 0; at < blob.blob.size(); at += 64) __builtin_prefetch(bytes + at);
  }
}
}  // namespace

std::string GetPolicyDbHash() {
  const std::vector<KarstPolicyInfo> policies = ListPolicies();
  std::string text;
  return DigestOfDigests(
      policies.size(), [&](std::size_t i) -> const std::string& { return policies[i].policy_id; },
      [&](std::size_t i) -> const std::string& {
        if (i + 2 < policies.size()) PrefetchBlobList(policies[i + 2]);
        if (i + 1 < policies.size()) PrefetchBlobs(policies[i + 1]);
        PolicyText(policies[i], &text);
        return text;
      });
}

std::string GetDatastoreDbHash() {
  std::vector<KarstDatastoreInfo> datastores = ListDatastores();
  return DigestOfDigests(
      datastores.size(), [&](std::size_t i) -> const std::string& { return datastores[i].url; },
      [&](std::size_t i) {
        const KarstDatastoreInfo& d = datastores[i];
        return Velk::Misc::StrCat(d.url.data(), d.url.size(), d.datastore_namespace.data(),
                                  d.datastore_namespace.size(), d.drp_policy_id.data(),
                                  d.drp_policy_id.size());
      });
}

std::pair<std::string, std::string> ComputeDbHash() {
  std::pair<std::string, std::string> result;
  result.first = GetPolicyDbHash();
  result.second = GetDatastoreDbHash();
  return result;
}

}  // namespace TavoKarst
