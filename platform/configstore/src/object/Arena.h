// Memory for the bodies of objects read from the store, placed one after
// another in shared blocks as a listing reads them: a listing of thousands
// of objects then costs a few dozen allocations instead of one for each, and
// each object reads its values where they lie. A block lives while any body
// in it is in use, so a caller that lets go of a listing's objects as it goes
// gives the memory back as it goes.

#ifndef TAVOCONFIGSTORE_SRC_OBJECT_ARENA_H_
#define TAVOCONFIGSTORE_SRC_OBJECT_ARENA_H_

#include <cstddef>
#include <memory>

namespace TavoConfigStore {
namespace objectmodel {

class Arena {
 public:
  static constexpr std::size_t kBlockSize = std::size_t{64} * 1024;

  // "size" bytes aligned for any type; "*owner" keeps them. Blocks start
  // small, so that an object read alone keeps little, and grow to
  // kBlockSize. A request larger than a quarter of that gets a block of its
  // own, and the current block stays for the requests after it.
  char* Allocate(std::size_t size, std::shared_ptr<const void>* owner);

 private:
  std::shared_ptr<char> block_;
  char* next_ = nullptr;
  std::size_t left_ = 0;
  std::size_t blockSize_ = 1024;
};

}  // namespace objectmodel
}  // namespace TavoConfigStore

#endif  // TAVOCONFIGSTORE_SRC_OBJECT_ARENA_H_
