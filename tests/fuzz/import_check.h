// The property the import fuzzer checks, shared with the replay test that
// runs every saved input in the ordinary build.

#ifndef KARST_TESTS_FUZZ_IMPORT_CHECK_H_
#define KARST_TESTS_FUZZ_IMPORT_CHECK_H_

#include <cstddef>
#include <cstdint>

namespace karst_fuzz {

enum class ImportResult {
  kAccepted,  // imported, and round-tripped through export
  kRefused,   // refused with InputError: exit status 2 and a position
};

// Imports "data" the way `karstctl import` reads its input. Input that is
// refused must be refused as above; any other exception escapes and is a
// finding. Input that is accepted must export, import again to the same
// records and export to the same text; a violation aborts.
ImportResult CheckImport(const std::uint8_t* data, std::size_t size);

}  // namespace karst_fuzz

#endif  // KARST_TESTS_FUZZ_IMPORT_CHECK_H_
