// The binary encoding of one stored object's values and sub-objects, as the
// SQLite backend keeps it in a single column. Internal to the library.
//
// Format 1 (varint = unsigned LEB128, at most 10 bytes):
//   body   := u8 format=1, varint count, value*, varint count, sub*
//   value  := bytes name, u8 kind (0 = byte string, 1 = integer), payload
//             payload: bytes for kind 0, zigzag varint for kind 1
//   sub    := bytes array, bytes key, varint count, value*
//   bytes  := varint length, that many raw bytes
// The identifier is not part of the body: the store keeps it in its own
// columns, where it can be indexed.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_

#include <cstddef>
#include <memory>
#include <string>

#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {
namespace codec {

// Appends the encoding of the object's values and sub-objects to "*out".
void EncodeObject(const ConfigStoreObject& object, std::string* out);

// A new object with identifier "id" and the contents encoded in
// data[0, size). Throws ConfigStoreException(kErrorCorruptObject) when the
// bytes are not a complete, well-formed encoding; never reads past "size".
std::shared_ptr<ConfigStoreObject> DecodeObject(const ConfigStoreObjectId& id,
                                                const unsigned char* data, std::size_t size);

}  // namespace codec
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_CODEC_H_
