#ifndef VELK_VELK_EXCEPTION_H_
#define VELK_VELK_EXCEPTION_H_

#include <exception>
#include <memory>
#include <string>

#include "Velk/Export.h"

namespace Velk {
namespace Lib {

// Base of every exception the host platform raises. A copy shares the
// detail pointer with the original, so copying an exception to rethrow it
// never loses what the raiser attached.
class VELK_EXPORT VelkException : public std::exception {
 public:
  explicit VelkException(std::string message, std::shared_ptr<const void> detail = nullptr);
  VelkException(const VelkException&) = default;
  VelkException& operator=(const VelkException&) = default;
  ~VelkException() override;

  const char* what() const noexcept override;

  const std::string& Message() const noexcept { return message_; }
  const std::shared_ptr<const void>& Detail() const noexcept { return detail_; }

 private:
  std::string message_;
  std::shared_ptr<const void> detail_;
};

}  // namespace Lib
}  // namespace Velk

#endif  // VELK_VELK_EXCEPTION_H_
