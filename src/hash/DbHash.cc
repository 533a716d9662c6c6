#include "hash/DbHash.h"

#include <algorithm>
#include <charconv>
#include <climits>
#include <cstdint>
#include <cstring>
#include <vector>

#include "Velk/Misc.h"
#include "datastore/DatastoreStore.h"
#include "hash/Crc32.h"
#include "policy/PolicyStore.h"

namespace TavoKarst {

// Each record has a text; the digest is the CRC-32 (hex) of the records'
// text digests (hex) concatenated in the order of their sort keys. Sort keys
// compare as std::string does: unsigned bytes, shorter first on a common
// prefix. Records tied on their key are ordered by their whole text, so the
// digest does not depend on the store's order even then.
//
// The texts are not built: each record's CRC runs over the pieces of its
// text in place, and a text is only put together for records whose keys tie.
namespace {

struct KeyedText {
  std::string key;
  std::string text;
  bool operator<(const KeyedText& other) const {
    const int byKey = key.compare(other.key);
    return byKey != 0 ? byKey < 0 : text < other.text;
  }
};

// One record: its key, its text's digest, and where to rebuild the text.
struct Record {
  // 8 bytes of the key, big-endian, from where the keys start to differ:
  // most compares end here.
  std::uint64_t prefix;
  const std::string* key;
  std::uint32_t crc;
  bool empty;  // the text is "", whose digest is ""
  std::uint32_t index;
};

std::uint64_t Prefix(const std::string& key, std::size_t from) {
  unsigned char bytes[8] = {};
  if (from < key.size())
    std::memcpy(bytes, key.data() + from, std::min<std::size_t>(key.size() - from, 8));
  std::uint64_t v = 0;
  for (unsigned char b : bytes) v = (v << 8) | b;
  return v;
}

bool KeyLess(const Record& a, const Record& b) {
  if (a.prefix != b.prefix) return a.prefix < b.prefix;
  return a.key->compare(*b.key) < 0;
}

void AppendHex(std::uint32_t value, std::string* out) {
  static constexpr char kDigits[] = "0123456789abcdef";
  char buffer[8];
  int pos = 8;
  do {
    buffer[--pos] = kDigits[value & 0xFu];
    value >>= 4;
  } while (value != 0);
  out->append(buffer + pos, buffer + 8);
}

// Sorts by key, orders each run of tied keys by the texts "textOf" builds,
// and digests the digests.
template <typename TextOf>
std::string DigestOfDigests(std::vector<Record>& records, TextOf textOf) {
  // Keys often share a long start ("ds://host-"): the bytes all keys share
  // decide nothing, so the prefixes are taken after them.
  std::size_t common = records.empty() ? 0 : records[0].key->size();
  for (const Record& r : records) {
    const std::string& first = *records[0].key;
    const std::string& key = *r.key;
    common = std::min(common, key.size());
    common = static_cast<std::size_t>(
        std::mismatch(first.begin(), first.begin() + static_cast<std::ptrdiff_t>(common),
                      key.begin())
            .first -
        first.begin());
  }
  for (Record& r : records) r.prefix = Prefix(*r.key, common);
  std::sort(records.begin(), records.end(), KeyLess);
  for (std::size_t begin = 0; begin < records.size();) {
    std::size_t end = begin + 1;
    while (end < records.size() && *records[end].key == *records[begin].key) ++end;
    if (end - begin > 1) {
      std::vector<std::pair<std::string, Record>> tied;
      for (std::size_t i = begin; i < end; ++i) tied.emplace_back(textOf(records[i]), records[i]);
      std::sort(tied.begin(), tied.end(),
                [](const auto& x, const auto& y) { return x.first < y.first; });
      for (std::size_t i = begin; i < end; ++i) records[i] = tied[i - begin].second;
    }
    begin = end;
  }
  std::string accumulator;
  accumulator.reserve(records.size() * 8);
  for (const Record& record : records) {
    if (!record.empty) AppendHex(record.crc, &accumulator);
  }
  return Crc32Hex(accumulator);
}

// name, policy_id and description up to their first NUL (they are printed
// with "%s"), the generation number in decimal, then namespace and blob of
// each blob in (namespace, blob) order.
std::string PolicyText(const KarstPolicyInfo& policy) {
  std::string text =
      Velk::Misc::StrPrintf("%s%s%s%ld", policy.name.c_str(), policy.policy_id.c_str(),
                            policy.description.c_str(), policy.generation_number);
  std::vector<KeyedText> blobs;
  blobs.reserve(policy.blobs.size());
  for (const KarstPolicyBlob& blob : policy.blobs) {
    blobs.push_back({blob.datastore_namespace, blob.blob});
  }
  std::sort(blobs.begin(), blobs.end());
  for (const KeyedText& blob : blobs) {
    text += blob.key;
    text += blob.text;
  }
  return text;
}

std::size_t UpToNul(const std::string& s) {
  const void* nul = std::memchr(s.data(), '\0', s.size());
  return nul == nullptr ? s.size()
                        : static_cast<std::size_t>(static_cast<const char*>(nul) - s.data());
}

std::uint32_t PolicyCrc(const KarstPolicyInfo& policy) {
  std::uint32_t crc = Crc32(policy.name.data(), UpToNul(policy.name));
  crc = Crc32(policy.policy_id.data(), UpToNul(policy.policy_id), crc);
  crc = Crc32(policy.description.data(), UpToNul(policy.description), crc);
  char number[24];
  const auto printed =
      std::to_chars(number, number + sizeof number, static_cast<long>(policy.generation_number));
  crc = Crc32(number, static_cast<std::size_t>(printed.ptr - number), crc);

  // Pointers on the stack for the usual handful of blobs.
  const KarstPolicyBlob* few[8];
  std::vector<const KarstPolicyBlob*> many;
  const KarstPolicyBlob** blobs = few;
  if (policy.blobs.size() > 8) {
    many.resize(policy.blobs.size());
    blobs = many.data();
  }
  const std::size_t count = policy.blobs.size();
  for (std::size_t i = 0; i < count; ++i) blobs[i] = &policy.blobs[i];
  std::sort(blobs, blobs + count, [](const KarstPolicyBlob* a, const KarstPolicyBlob* b) {
    const int byKey = a->datastore_namespace.compare(b->datastore_namespace);
    return byKey != 0 ? byKey < 0 : a->blob < b->blob;
  });
  for (std::size_t i = 0; i < count; ++i) {
    crc = Crc32(blobs[i]->datastore_namespace.data(), blobs[i]->datastore_namespace.size(), crc);
    crc = Crc32(blobs[i]->blob.data(), blobs[i]->blob.size(), crc);
  }
  return crc;
}

std::string DatastoreText(const KarstDatastoreInfo& d) {
  return Velk::Misc::StrCat(d.url.data(), d.url.size(), d.datastore_namespace.data(),
                            d.datastore_namespace.size(), d.drp_policy_id.data(),
                            d.drp_policy_id.size());
}

}  // namespace

std::string GetPolicyDbHash() {
  const std::vector<KarstPolicyInfo> policies = ListPolicies();
  std::vector<Record> records;
  records.reserve(policies.size());
  for (std::size_t i = 0; i < policies.size(); ++i) {
    const KarstPolicyInfo& policy = policies[i];
    // The printed prefix of the text must fit an int, or formatting fails
    // as StrPrintf reports it; that rare case takes the formatting path.
    const std::size_t printed =
        UpToNul(policy.name) + UpToNul(policy.policy_id) + UpToNul(policy.description) + 20;
    std::uint32_t crc;
    if (printed < INT_MAX) {
      crc = PolicyCrc(policy);
    } else {
      const std::string text = PolicyText(policy);
      crc = Crc32(text.data(), text.size());
    }
    records.push_back({0, &policy.policy_id, crc, false, static_cast<std::uint32_t>(i)});
  }
  return DigestOfDigests(records, [&](const Record& r) { return PolicyText(policies[r.index]); });
}

std::string GetDatastoreDbHash() {
  const std::vector<KarstDatastoreInfo> datastores = ListDatastores();
  std::vector<Record> records;
  records.reserve(datastores.size());
  for (std::size_t i = 0; i < datastores.size(); ++i) {
    const KarstDatastoreInfo& d = datastores[i];
    std::uint32_t crc = Crc32(d.url.data(), d.url.size());
    crc = Crc32(d.datastore_namespace.data(), d.datastore_namespace.size(), crc);
    crc = Crc32(d.drp_policy_id.data(), d.drp_policy_id.size(), crc);
    const bool empty = d.url.empty() && d.datastore_namespace.empty() && d.drp_policy_id.empty();
    records.push_back({0, &d.url, crc, empty, static_cast<std::uint32_t>(i)});
  }
  return DigestOfDigests(records,
                         [&](const Record& r) { return DatastoreText(datastores[r.index]); });
}

std::pair<std::string, std::string> ComputeDbHash() {
  std::pair<std::string, std::string> result;
  result.first = GetPolicyDbHash();
  result.second = GetDatastoreDbHash();
  return result;
}

}  // namespace TavoKarst
