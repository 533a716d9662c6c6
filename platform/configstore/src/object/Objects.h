// What the backends need of the object model: an object's body to store, and
// objects made from stored bodies.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_OBJECTS_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_OBJECTS_H_

#include <memory>
#include <string>
#include <string_view>

#include "Arena.h"
#include "TavoConfigStore/StoreObject.h"

namespace TavoConfigStore {
namespace objectmodel {

// Appends the body of "object" (Format.h) to "*out".
void EncodeObject(const ConfigStoreObject& object, std::string* out);

// A new object with identifier "id" and the contents of "body", which is
// copied into "arena" (null: memory of its own). Throws ConfigStoreException(kErrorCorruptObject)
// naming the damage when "body" is not one well-formed body.
std::shared_ptr<ConfigStoreObject> DecodeObject(ConfigStoreObjectId id, std::string_view body,
                                                Arena* arena);

// The same, except that a damaged body gives an object that is listed like
// any other and whose reads throw the damage, its message after "where": a
// caller going through a collection loses that one record, not the rest.
std::shared_ptr<ConfigStoreObject> DecodeOrDamaged(ConfigStoreObjectId id, std::string_view body,
                                                   Arena* arena, const std::string& where);

// As DecodeOrDamaged, except that "body" is not copied: the object reads it
// where it lies, and keeps "owner", which must keep the body there unchanged
// (a listing the store keeps for later reads, handed to many callers).
std::shared_ptr<ConfigStoreObject> ViewOrDamaged(ConfigStoreObjectId id, std::string_view body,
                                                 std::shared_ptr<const void> owner,
                                                 const std::string& where);

}  // namespace objectmodel
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_OBJECTS_H_
