#include "hash/Crc32.h"

#include <array>
#include <cstring>

#if defined(__x86_64__)
#include <immintrin.h>
#endif

namespace TavoKarst {

namespace {

constexpr std::uint32_t kReflectedPolynomial = 0xEDB88320u;
constexpr int kSlices = 8;

using CrcTables = std::array<std::array<std::uint32_t, 256>, kSlices>;

// Table 0 is the classic byte table (entry 1 is 0x77073096); table k advances
// a byte k more positions, which lets the portable loop consume 8 bytes a step.
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

// Register-level loops: "r" is the inverted CRC.
std::uint32_t BytewiseRaw(const unsigned char* p, std::size_t size, std::uint32_t r) {
  for (std::size_t i = 0; i < size; ++i) r = (r >> 8) ^ kTables[0][(r ^ p[i]) & 0xFFu];
  return r;
}

std::uint32_t SlicingRaw(const unsigned char* p, std::size_t size, std::uint32_t r) {
  // Little-endian loads: x86-64 only, as is the library.
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
  return BytewiseRaw(p, size, r);
}

#if defined(__x86_64__)
// Folding with carry-less multiplication: four 128-bit lanes are folded
// 64 bytes at a time, merged into one, and reduced to 32 bits (Barrett).
// The constants are x^n mod P for the bit-reflected polynomial.
constexpr std::size_t kClmulMinimum = 64;

#define KARST_CLMUL_TARGET __attribute__((target("pclmul,sse4.1")))

KARST_CLMUL_TARGET inline __m128i Load(const unsigned char* q) {
  return _mm_loadu_si128(reinterpret_cast<const __m128i*>(q));
}

// Multiplies both halves of "x" by their constants in "k" and adds them.
KARST_CLMUL_TARGET inline __m128i Fold(__m128i x, __m128i k) {
  return _mm_xor_si128(_mm_clmulepi64_si128(x, k, 0x00), _mm_clmulepi64_si128(x, k, 0x11));
}

KARST_CLMUL_TARGET std::uint32_t ClmulRaw(const unsigned char* p, std::size_t size,
                                          std::uint32_t r) {
  const __m128i k1k2 = _mm_set_epi64x(0x1c6e41596, 0x154442bd4);
  const __m128i k3k4 = _mm_set_epi64x(0x0ccaa009e, 0x1751997d0);
  const __m128i k5 = _mm_set_epi64x(0, 0x163cd6124);
  const __m128i polyMu = _mm_set_epi64x(0x1F7011641, 0x1DB710641);
  const __m128i mask32 = _mm_set_epi32(0, 0, 0, -1);

  __m128i x1 = _mm_xor_si128(Load(p), _mm_cvtsi32_si128(static_cast<int>(r)));
  __m128i x2 = Load(p + 16);
  __m128i x3 = Load(p + 32);
  __m128i x4 = Load(p + 48);
  p += 64;
  size -= 64;
  while (size >= 64) {
    x1 = _mm_xor_si128(Fold(x1, k1k2), Load(p));
    x2 = _mm_xor_si128(Fold(x2, k1k2), Load(p + 16));
    x3 = _mm_xor_si128(Fold(x3, k1k2), Load(p + 32));
    x4 = _mm_xor_si128(Fold(x4, k1k2), Load(p + 48));
    p += 64;
    size -= 64;
  }
  x1 = _mm_xor_si128(Fold(x1, k3k4), x2);
  x1 = _mm_xor_si128(Fold(x1, k3k4), x3);
  x1 = _mm_xor_si128(Fold(x1, k3k4), x4);
  while (size >= 16) {
    x1 = _mm_xor_si128(Fold(x1, k3k4), Load(p));
    p += 16;
    size -= 16;
  }

  // 128 bits to 64.
  __m128i t = _mm_clmulepi64_si128(x1, k3k4, 0x10);
  x1 = _mm_xor_si128(_mm_srli_si128(x1, 8), t);
  // 64 bits to 32.
  t = _mm_clmulepi64_si128(_mm_and_si128(x1, mask32), k5, 0x00);
  x1 = _mm_xor_si128(_mm_srli_si128(x1, 4), t);
  // Barrett reduction.
  t = _mm_clmulepi64_si128(_mm_and_si128(x1, mask32), polyMu, 0x10);
  t = _mm_clmulepi64_si128(_mm_and_si128(t, mask32), polyMu, 0x00);
  r = static_cast<std::uint32_t>(_mm_extract_epi32(_mm_xor_si128(x1, t), 1));
  return SlicingRaw(p, size, r);
}
#endif

using RawCrc = std::uint32_t (*)(const unsigned char*, std::size_t, std::uint32_t);

std::uint32_t BestRaw(const unsigned char* p, std::size_t size, std::uint32_t r) {
#if defined(__x86_64__)
  static const bool clmul = CpuHasClmul();
  if (clmul && size >= kClmulMinimum) return ClmulRaw(p, size, r);
#endif
  return SlicingRaw(p, size, r);
}

std::uint32_t Run(RawCrc raw, const void* data, std::size_t size, std::uint32_t crc) {
  return ~raw(static_cast<const unsigned char*>(data), size, ~crc);
}

}  // namespace

bool CpuHasClmul() {
#if defined(__x86_64__)
  return __builtin_cpu_supports("pclmul") && __builtin_cpu_supports("sse4.1");
#else
  return false;
#endif
}

std::uint32_t Crc32Bytewise(const void* data, std::size_t size, std::uint32_t crc) {
  return Run(BytewiseRaw, data, size, crc);
}

std::uint32_t Crc32Portable(const void* data, std::size_t size, std::uint32_t crc) {
  return Run(SlicingRaw, data, size, crc);
}

std::uint32_t Crc32Clmul(const void* data, std::size_t size, std::uint32_t crc) {
#if defined(__x86_64__)
  if (CpuHasClmul() && size >= kClmulMinimum) return Run(ClmulRaw, data, size, crc);
#endif
  return Crc32Portable(data, size, crc);
}

std::uint32_t Crc32(const void* data, std::size_t size, std::uint32_t crc) {
  return Run(BestRaw, data, size, crc);
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
