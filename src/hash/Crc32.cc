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

// From one 128-bit lane (16-byte folds, then 128 to 32 bits) to the end.
KARST_CLMUL_TARGET std::uint32_t FinishFolding(__m128i x1, const unsigned char* p,
                                               std::size_t size) {
  const __m128i k3k4 = _mm_set_epi64x(0x0ccaa009e, 0x1751997d0);
  const __m128i k5 = _mm_set_epi64x(0, 0x163cd6124);
  const __m128i polyMu = _mm_set_epi64x(0x1F7011641, 0x1DB710641);
  const __m128i mask32 = _mm_set_epi32(0, 0, 0, -1);
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
  const auto r = static_cast<std::uint32_t>(_mm_extract_epi32(_mm_xor_si128(x1, t), 1));
  return SlicingRaw(p, size, r);
}

KARST_CLMUL_TARGET std::uint32_t ClmulRaw(const unsigned char* p, std::size_t size,
                                          std::uint32_t r) {
  const __m128i k1k2 = _mm_set_epi64x(0x1c6e41596, 0x154442bd4);
  const __m128i k3k4 = _mm_set_epi64x(0x0ccaa009e, 0x1751997d0);

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
  return FinishFolding(x1, p, size);
}

// The same folding four 512-bit registers wide (VPCLMULQDQ with AVX-512):
// 256 bytes a step, each 128-bit lane folded as above. A constant pair
// (x^(d+32), x^(d-32)) moves a lane d bits on.
constexpr std::size_t kAvx512Minimum = 512;

#define KARST_AVX512_TARGET __attribute__((target("avx512f,avx512vl,vpclmulqdq,pclmul,sse4.1")))

KARST_AVX512_TARGET inline __m512i Load512(const unsigned char* q) { return _mm512_loadu_si512(q); }

// fold(x) ^ y in one go: 0x96 is the three-way exclusive or.
KARST_AVX512_TARGET inline __m512i Fold512(__m512i x, __m512i k, __m512i y) {
  return _mm512_ternarylogic_epi64(_mm512_clmulepi64_epi128(x, k, 0x00),
                                   _mm512_clmulepi64_epi128(x, k, 0x11), y, 0x96);
}

// One 128-bit lane. (The masked form: the plain one trips GCC 12's
// uninitialised-value warning inside its own header.)
template <int kLane>
KARST_AVX512_TARGET inline __m128i Lane(__m512i x) {
  return _mm512_mask_extracti32x4_epi32(_mm_setzero_si128(), 0xF, x, kLane);
}

KARST_AVX512_TARGET std::uint32_t Avx512Raw(const unsigned char* p, std::size_t size,
                                            std::uint32_t r) {
  const __m512i by2048 = _mm512_set_epi64(0x1322d1430, 0x11542778a, 0x1322d1430, 0x11542778a,
                                          0x1322d1430, 0x11542778a, 0x1322d1430, 0x11542778a);
  const __m512i by512 = _mm512_set_epi64(0x1c6e41596, 0x154442bd4, 0x1c6e41596, 0x154442bd4,
                                         0x1c6e41596, 0x154442bd4, 0x1c6e41596, 0x154442bd4);

  __m512i x0 =
      _mm512_xor_si512(Load512(p), _mm512_castsi128_si512(_mm_cvtsi32_si128(static_cast<int>(r))));
  __m512i x1 = Load512(p + 64);
  __m512i x2 = Load512(p + 128);
  __m512i x3 = Load512(p + 192);
  p += 256;
  size -= 256;
  while (size >= 256) {
    x0 = Fold512(x0, by2048, Load512(p));
    x1 = Fold512(x1, by2048, Load512(p + 64));
    x2 = Fold512(x2, by2048, Load512(p + 128));
    x3 = Fold512(x3, by2048, Load512(p + 192));
    p += 256;
    size -= 256;
  }
  x1 = Fold512(x0, by512, x1);
  x2 = Fold512(x1, by512, x2);
  x3 = Fold512(x2, by512, x3);
  while (size >= 64) {
    x3 = Fold512(x3, by512, Load512(p));
    p += 64;
    size -= 64;
  }

  // The four lanes to one: each moved on to the last lane and added there.
  const __m128i by384 = _mm_set_epi64x(0x174359406, 0x3db1ecdc);
  const __m128i by256 = _mm_set_epi64x(0x15a546366, 0xf1da05aa);
  const __m128i by128 = _mm_set_epi64x(0x0ccaa009e, 0x1751997d0);
  __m128i x = Lane<3>(x3);
  x = _mm_xor_si128(x, Fold(Lane<0>(x3), by384));
  x = _mm_xor_si128(x, Fold(Lane<1>(x3), by256));
  x = _mm_xor_si128(x, Fold(Lane<2>(x3), by128));
  return FinishFolding(x, p, size);
}
#endif

using RawCrc = std::uint32_t (*)(const unsigned char*, std::size_t, std::uint32_t);

std::uint32_t BestRaw(const unsigned char* p, std::size_t size, std::uint32_t r) {
#if defined(__x86_64__)
  static const bool avx512 = CpuHasAvx512Clmul();
  static const bool clmul = CpuHasClmul();
  if (avx512 && size >= kAvx512Minimum) return Avx512Raw(p, size, r);
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

bool CpuHasAvx512Clmul() {
#if defined(__x86_64__)
  // The checks include the system's support for the AVX-512 registers.
  return CpuHasClmul() && __builtin_cpu_supports("avx512f") && __builtin_cpu_supports("avx512vl") &&
         __builtin_cpu_supports("vpclmulqdq");
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

std::uint32_t Crc32Avx512(const void* data, std::size_t size, std::uint32_t crc) {
#if defined(__x86_64__)
  if (CpuHasAvx512Clmul() && size >= kAvx512Minimum) return Run(Avx512Raw, data, size, crc);
#endif
  return Crc32Clmul(data, size, crc);
}

std::uint32_t Crc32(const void* data, std::size_t size, std::uint32_t crc) {
  return Run(BestRaw, data, size, crc);
}

std::string Crc32Hex(const std::string& text) {
  if (text.empty()) return std::string();
  return HexOfCrc32(Crc32(text.data(), text.size()));
}

std::string HexOfCrc32(std::uint32_t value) {
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
