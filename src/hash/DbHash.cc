#include "hash/DbHash.h"

#include <algorithm>
#include <charconv>
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
// "digestOf(i)" is Crc32Hex of its text, asked once per record; "textOf(i)"
// builds the text itself, asked only for records whose keys tie.
//
// The order is found through a compact index: sorting the records in place
// compares keys scattered over the heap, a cache miss or two per comparison
// once there are many. The bytes every key shares decide nothing, so each
// entry carries the 8 that follow them. A text is kept only while its key is
// tied with another's; the others are digested as soon as they are built.
template <typename KeyOf, typename DigestOf, typename TextOf>
std::string DigestOfDigests(std::size_t count, KeyOf keyOf, DigestOf digestOf, TextOf textOf) {
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
    digests[i] = digestOf(i);
    if (tied[i]) {
      if (texts.empty()) texts.resize(count);
      texts[i] = textOf(i);
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

// Hands each piece of a policy's text to "append", in order: name,
// policy_id and description, each up to its first NUL (as "%s" would take
// them), the generation number in decimal, then each blob's namespace and
// bytes in ascending order of namespace, tied namespaces by blob.
template <typename Append>
void ForEachPolicyPiece(const KarstPolicyInfo& policy, Append append) {
  for (const std::string* field : {&policy.name, &policy.policy_id, &policy.description}) {
    append(field->data(), std::strlen(field->c_str()));
  }
  char number[24];
  const auto printed = std::to_chars(number, number + sizeof number, policy.generation_number);
  append(number, static_cast<std::size_t>(printed.ptr - number));
  // The usual handful of indices is sorted on the stack.
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
    const KarstPolicyBlob& blob = blobs[order[i]];
    append(blob.datastore_namespace.data(), blob.datastore_namespace.size());
    append(blob.blob.data(), blob.blob.size());
  }
}

std::string PolicyText(const KarstPolicyInfo& policy) {
  std::string text;
  ForEachPolicyPiece(policy,
                     [&text](const char* data, std::size_t size) { text.append(data, size); });
  return text;
}

// Crc32Hex of the text "forEachPiece" hands out piece by piece, without
// building it: the CRC runs on across the pieces where they lie.
template <typename ForEachPiece>
std::string DigestOfPieces(ForEachPiece forEachPiece) {
  std::uint32_t crc = 0;
  std::size_t length = 0;
  forEachPiece([&](const char* data, std::size_t size) {
    crc = Crc32(data, size, crc);
    length += size;
  });
  return length == 0 ? std::string() : HexOfCrc32(crc);
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
  return DigestOfDigests(
      policies.size(), [&](std::size_t i) -> const std::string& { return policies[i].policy_id; },
      [&](std::size_t i) {
        if (i + 2 < policies.size()) PrefetchBlobList(policies[i + 2]);
        if (i + 1 < policies.size()) PrefetchBlobs(policies[i + 1]);
        return DigestOfPieces([&](auto append) { ForEachPolicyPiece(policies[i], append); });
      },
      [&](std::size_t i) { return PolicyText(policies[i]); });
}

std::string GetDatastoreDbHash() {
  std::vector<KarstDatastoreInfo> datastores = ListDatastores();
  auto textOf = [&](std::size_t i) {
    const KarstDatastoreInfo& d = datastores[i];
    return Velk::Misc::StrCat(d.url.data(), d.url.size(), d.datastore_namespace.data(),
                              d.datastore_namespace.size(), d.drp_policy_id.data(),
                              d.drp_policy_id.size());
  };
  // The digest of the text textOf builds, from its three pieces in place.
  auto digestOf = [&](std::size_t i) {
    const KarstDatastoreInfo& d = datastores[i];
    return DigestOfPieces([&d](auto append) {
      for (const std::string* piece : {&d.url, &d.datastore_namespace, &d.drp_policy_id}) {
        append(piece->data(), piece->size());
      }
    });
  };
  return DigestOfDigests(
      datastores.size(), [&](std::size_t i) -> const std::string& { return datastores[i].url; },
      digestOf, textOf);
}

std::pair<std::string, std::string> ComputeDbHash() {
  std::pair<std::string, std::string> result;
  result.first = GetPolicyDbHash();
  result.second = GetDatastoreDbHash();
  return result;
}

}  // namespace TavoKarst
