#include "Velk/VelkException.h"

#include <utility>

namespace Velk {
namespace Lib {

VelkException::VelkException(std::string message, std::shared_ptr<const void> detail)
    : message_(std::move(message)), detail_(std::move(detail)) {}

VelkException::~VelkException() = default;

const char* VelkException::what() const noexcept { return message_.c_str(); }

}  // namespace Lib
}  // namespace Velk
