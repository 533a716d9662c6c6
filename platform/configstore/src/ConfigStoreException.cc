#include "TavoConfigStore/ConfigStoreException.h"

#include <utility>

namespace TavoConfigStore {

ConfigStoreException::ConfigStoreException(std::string message, std::int32_t code,
                                           std::shared_ptr<const void> detail)
    : VelkException(std::move(message), std::move(detail)), code_(code) {}

ConfigStoreException::~ConfigStoreException() = default;

}  // namespace TavoConfigStore
