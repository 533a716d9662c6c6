#ifndef KARST_HASH_CRC32_H_
#define KARST_HASH_CRC32_H_

#include <cstddef>
#include <cstdint>
#include <string>

namespace TavoKarst {

// The standard CRC-32 (IEEE 802.3, zlib): reflected polynomial 0xEDB88320,
// initial value and final XOR 0xFFFFFFFF. "crc" continues an earlier value.
std::uint32_t Crc32(const void* data, std::size_t size, std::uint32_t crc = 0);

// The table-driven reference path, one byte at a time; kept for tests.
std::uint32_t Crc32Bytewise(const void* data, std::size_t size, std::uint32_t crc = 0);

// The digest of a text: "" for the empty text, otherwise its CRC-32 in
// lower-case hex without leading zeros ("c" gives "6b9df6f").
std::string Crc32Hex(const std::string& text);

}  // namespace TavoKarst

#endif  // KARST_HASH_CRC32_H_
