#include "hash/Crc32.h"

#include <array>
#include <cstring>

namespace TavoKarst {

namespace {

constexpr std::uint32_t kReflectedPolynomial = 0xEDB88320u;
constexpr int kSlices = 8;

using CrcTables = std::array<std::array<std::uint32_t, 256>, kSlices>;

// Table 0 is the classic byte table (entry 1 is 0x77073096); table k advances
// a byte k more positions, which lets the loop below consume 8 bytes per step.
// Computed at compile time, so no thread ever sees it half filled.
constexpr CrcTables MakeTables() {
  CrcTables t{};
  for (std::uint32_t i = 0; i < 256; ++i) {
    std::uint32_t r = i;
    for (int bit = 0; bit < 8; ++bit) r = (r >> 1) ^ ((r & 1u) ? kReflectedPolynomial : 0u);
    t[0][i] = r;
  }
  for (std::uint32_t i = 0; i < 256; ++i) {
    for (int k = 1; k < kSlices; ++k) t[k][i] = (t[k - 1][i] >> 8) ^ t[0][t[k - 1][i] & 0xFFu];
  }
  return t;
}

constexpr CrcTables kTables = MakeTables();
static_assert(kTables[0][1] == 0x77073096u, "CRC-32 table");

}  // namespace

std::uint32_t Crc32Bytewise(const void* data, std::size_t size, std::uint32_t crc) {
  const auto* p = static_cast<const unsigned char*>(data);
  std::uint32_t r = ~crc;
  for (std::size_t i = 0; i < size; ++i) r = (r >> 8) ^ kTables[0][(r ^ p[i]) & 0xFFu];
  return ~r;
}

std::uint32_t Crc32(const void* data, std::size_t size, std::uint32_t crc) {
  const auto* p = static_cast<const unsigned char*>(data);
  std::uint32_t r = ~crc;
  // Slicing-by-8 (little-endian x86-64): same values as the bytewise loop.
  while (size >= 8) {
    std::uint32_t lo;
    std::uint32_t hi;
    std::memcpy(&lo, p, 4);
    std::memcpy(&hi, p + 4, 4);
    lo ^= r;
    r = kTables[7][lo & 0xFFu] ^ kTables[6][(lo >> 8) & 0xFFu] ^ kTables[5][(lo >> 16) & 0xFFu] ^
        kTables[4][lo >> 24] ^ kTables[3][hi & 0xFFu] ^ kTables[2][(hi >> 8) & 0xFFu] ^
        kTables[1][(hi >> 16) & 0xFFu] ^ kTables[0][hi >> 24];
    p += 8;
    size -= 8;
  }
  while (size-- > 0) r = (r >> 8) ^ kTables[0][(r ^ *p++) & 0xFFu];
  return ~r;
}

std::string Crc32Hex(const std::string& text) {
  if (text.empty()) return std::string();
  std::uint32_t value = Crc32(text.data(), text.size());
  static constexpr char kDigits[] = "0123456789abcdef";
  char buffer[8];
  int pos = 8;
  do {
    buffer[--pos] = kDigits[value & 0xFu];
    value >>= 4;
  } while (value != 0);
  return std::string(buffer + pos, buffer + 8);
}

}  // namespace TavoKarst
