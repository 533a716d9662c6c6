// How a store lies in etcd, under its root "/<prefix>/\0" (the prefix escaped
// as below, so that it holds no \0):
//
//   p/<collection>           the pointer: the collection's current generation
//                            and the token of the commit that wrote it.
//                            Rewritten by every commit that changes the
//                            collection, so its mod revision is the
//                            collection's version.
//   g/<gen>/                 the generation's head (value: the collection),
//                            made when the generation becomes current
//   g/<gen>/<instance>\0NNNN the object: part 0000 holds the header and the
//                            start of the body, 0001... the rest of a body
//                            larger than one etcd request may carry
//   r/<gen>                  every generation that has objects, current or not
//   w/<gen>                  a generation being written, on its writer's lease
//   h/head                   the history's head: the newest version's number
//                            and how many versions to keep (EtcdVersions.h)
//   h/v/<number>             one kept version: who made it, when, and each
//                            collection's generation then
//
// <collection> is key \0 group \0 component and <instance> the instance id,
// each escaped so that it holds no \0 (\0 -> \1\1, \1 -> \1\2): keys then
// sort part by part, and one object's keys are contiguous.
//
// Every root holds exactly one \0, its last byte, so no root starts with
// another: the keys and ranges of two stores never meet, whatever their
// prefixes (one inside the other, siblings, any bytes). The "/" before it
// keeps a store's keys under "/<prefix>/", where etcd roles are granted.
// Earlier versions used "/<prefix>/" itself as the root (Keys::Legacy): a
// store at "m" then read the keys of one at "m/r" as its own "r/" keys.
//
// The first part's header: u8 1, varint order kind, varint revision, varint
// index, varint part count. An object's place in write order is (revision,
// index); the revision is the one written (kind 0, an object carried into a
// new generation), the part's own mod revision (kind 1, written in place) or
// the create revision of its generation's head (kind 2, written into a new
// generation, which became current then).

#ifndef TAVOCONFIGSTORE_SRC_ETCD_ETCD_LAYOUT_H_
#define TAVOCONFIGSTORE_SRC_ETCD_ETCD_LAYOUT_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

#include "TavoConfigStore/ConfigStoreObjectId.h"

namespace TavoConfigStore {
namespace etcdlayout {

// An etcd request stays under the cluster's default limits (1.5 MiB, 128
// operations) with room to spare.
constexpr std::size_t kPartBytes = std::size_t{768} * 1024;
constexpr std::size_t kBatchBytes = std::size_t{1024} * 1024;
constexpr std::size_t kBatchOps = 100;

std::string Escape(std::string_view part);
// False when "text" is not an escaped part.
bool Unescape(std::string_view text, std::string* out);

std::string CollectionOf(const ConfigStoreObjectId& id);
// Fills key, group and component; false when "name" is not a collection.
bool ParseCollection(std::string_view name, ConfigStoreObjectId* id);

// A pointer's value: the generation, \0, then the token of the commit that
// wrote it, by which a writer recognises its own commit after an unclear
// reply. Earlier versions wrote the generation alone.
std::string PointerValue(const std::string& gen, const std::string& token);
std::pair<std::string, std::string> ParsePointer(std::string_view value);
// True for a generation's id: 16 lower-case hexadecimal digits.
bool IsGenerationId(std::string_view text);

enum class OrderKind : std::uint8_t { kWritten = 0, kOwnRevision = 1, kHeadRevision = 2 };

struct Header {
  OrderKind kind = OrderKind::kOwnRevision;
  std::int64_t revision = 0;
  std::uint64_t index = 0;
  std::uint64_t parts = 1;
};
// The first part's value: the header, then "body".
std::string FirstPart(const Header& header, std::string_view body);
// Reads the header at the start of "*value" and drops it from the view.
bool ReadHeader(std::string_view* value, Header* header);

// A key of a generation with the generation's prefix taken off ("rest"): an
// object's part is its "stem" (the escaped instance and \0) and then the
// part's number in four hexadecimal digits. False when "rest" is no object's
// key; "*part" is kNoPart when the digits are not such a number.
constexpr std::size_t kNoPart = ~std::size_t{0};
bool ParseObjectKey(std::string_view rest, std::string_view* stem, std::size_t* part);

class Keys {
 public:
  explicit Keys(std::string_view prefix) : root_("/" + Escape(prefix) + "/" + '\0') {}
  // The root of earlier versions, which a store still reads until its first
  // write moves the catalogue under its own root.
  static Keys Legacy(std::string_view prefix) { return Keys("/" + std::string(prefix) + "/", 0); }
  std::string Pointers() const { return root_ + "p/"; }
  std::string Pointer(const std::string& collection) const { return Pointers() + collection; }
  std::string Generation(const std::string& gen) const { return root_ + "g/" + gen + "/"; }
  // The stem of an instance's keys, before the part's number.
  std::string Object(const std::string& gen, const std::string& instance) const {
    return Generation(gen) + Escape(instance) + '\0';
  }
  static std::string PartSuffix(std::size_t part);
  std::string Registered() const { return root_ + "r/"; }
  std::string Writers() const { return root_ + "w/"; }
  std::string History() const { return root_ + "h/"; }
  std::string HistoryHead() const { return History() + "head"; }
  std::string Versions() const { return History() + "v/"; }
  // Sixteen hexadecimal digits, so that the keys sort as the numbers do.
  std::string Version(std::uint64_t number) const;
  // What a key of "area" (Pointers(), Registered(), Writers()) names.
  static std::string_view NameIn(const std::string& area, std::string_view key) {
    return key.substr(area.size());
  }

 private:
  Keys(std::string root, int /*raw*/) : root_(std::move(root)) {}
  std::string root_;
};

// The first key after every key that starts with "prefix" (etcd's range end).
std::string PrefixEnd(std::string prefix);

}  // namespace etcdlayout
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_ETCD_ETCD_LAYOUT_H_
