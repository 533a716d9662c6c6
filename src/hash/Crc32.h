#ifndef KARST_HASH_CRC32_H_
#define KARST_HASH_CRC32_H_

#include <cstddef>
#include <cstdint>
#include <string>

namespace TavoKarst {

// The standard CRC-32 (IEEE 802.3, zlib): reflected polynomial 0xEDB88320,
// initial value and final XOR 0xFFFFFFFF. "crc" continues an earlier value.
std::uint32_t Crc32(const void* data, std::size_t size, std::uint32_t crc = 0);

// The paths Crc32 chooses between, exposed so each can be tested: one table
// look-up per byte; slicing-by-8 (portable); carry-less multiplication folding
// (x86-64 with PCLMULQDQ and SSE4.1), and the same 512 bits wide (VPCLMULQDQ
// with AVX-512) for long texts, each chosen at run time when the CPU has it.
// A path the CPU lacks falls back to the next narrower one.
std::uint32_t Crc32Bytewise(const void* data, std::size_t size, std::uint32_t crc = 0);
std::uint32_t Crc32Portable(const void* data, std::size_t size, std::uint32_t crc = 0);
std::uint32_t Crc32Clmul(const void* data, std::size_t size, std::uint32_t crc = 0);
std::uint32_t Crc32Avx512(const void* data, std::size_t size, std::uint32_t crc = 0);
bool CpuHasClmul();
bool CpuHasAvx512Clmul();

// The digest of a text: "" for the empty text, otherwise its CRC-32 in
// lower-case hex without leading zeros ("c" gives "6b9df6f").
std::string Crc32Hex(const std::string& text);
// The same hex form of a CRC-32 already computed (of a non-empty text).
std::string HexOfCrc32(std::uint32_t crc);

}  // namespace TavoKarst

#endif  // KARST_HASH_CRC32_H_
