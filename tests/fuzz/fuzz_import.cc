// libFuzzer entry point: karstctl's JSON import, see import_check.h.

#include <cstddef>
#include <cstdint>

#include "import_check.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  karst_fuzz::CheckImport(data, size);
  return 0;
}
