#include "Arena.h"

#include <algorithm>
#include <cstddef>

namespace TavoConfigStore {
namespace objectmodel {
namespace {

// new[] of char is aligned for any type of at most that size.
std::shared_ptr<char> NewBlock(std::size_t size) {
  return std::shared_ptr<char>(new char[size], std::default_delete<char[]>());
}

}  // namespace

char* Arena::Allocate(std::size_t size, std::shared_ptr<const void>* owner) {
  constexpr std::size_t kAlign = alignof(std::max_align_t);
  size = std::max<std::size_t>((size + kAlign - 1) / kAlign * kAlign, kAlign);
  if (size > left_) {
    if (size > kBlockSize / 4) {
      std::shared_ptr<char> own = NewBlock(size);
      *owner = own;
      return own.get();
    }
    left_ = std::max(blockSize_, size);
    block_ = NewBlock(left_);
    next_ = block_.get();
    blockSize_ = std::min(2 * blockSize_, kBlockSize);
  }
  char* at = next_;
  next_ += size;
  left_ -= size;
  *owner = block_;
  return at;
}

}  // namespace objectmodel
}  // namespace TavoConfigStore
