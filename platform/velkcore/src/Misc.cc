#include "Velk/Misc.h"

#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstring>

#include "Velk/VelkException.h"

namespace Velk {
namespace Misc {

namespace {
// Formats made only of text, "%s", "%d", "%ld", "%lld" and "%%" (the digest
// texts are) are written directly: vsnprintf's general machinery costs more
// than the formatting itself on short texts. Anything else goes to
// vsnprintf.
enum class Piece { kString, kInt, kLong, kLongLong, kPercent, kOther };

// The conversion starting at format[0] == '%', and its length.
Piece ConversionAt(const char* format, std::size_t* length) {
  if (format[1] == 's') return *length = 2, Piece::kString;
  if (format[1] == 'd') return *length = 2, Piece::kInt;
  if (format[1] == '%') return *length = 2, Piece::kPercent;
  if (format[1] == 'l' && format[2] == 'd') return *length = 3, Piece::kLong;
  if (format[1] == 'l' && format[2] == 'l' && format[3] == 'd') {
    return *length = 4, Piece::kLongLong;
  }
  return *length = 0, Piece::kOther;
}

bool IsSimple(const char* format) {
  for (const char* p = std::strchr(format, '%'); p != nullptr; p = std::strchr(p, '%')) {
    std::size_t length;
    if (ConversionAt(p, &length) == Piece::kOther) return false;
    p += length;
  }
  return true;
}

// Decimal digits of "value" written backwards ending at "end"; returns the
// first character. Works on the magnitude as unsigned, so the most negative
// value needs no special case.
char* Decimal(long long value, char* end) {
  std::uint64_t magnitude =
      value < 0 ? 0 - static_cast<std::uint64_t>(value) : static_cast<std::uint64_t>(value);
  do {
    *--end = static_cast<char>('0' + magnitude % 10);
    magnitude /= 10;
  } while (magnitude != 0);
  if (value < 0) *--end = '-';
  return end;
}

// The next argument of an integer conversion, read as the type it was passed
// as.
long long IntegerArg(Piece piece, va_list* ap) {
  if (piece == Piece::kInt) return va_arg(*ap, int);
  if (piece == Piece::kLong) return va_arg(*ap, long);
  return va_arg(*ap, long long);
}

bool IsInteger(Piece piece) {
  return piece == Piece::kInt || piece == Piece::kLong || piece == Piece::kLongLong;
}

// Walks a simple format, handing each piece of the result to "emit" as
// (pointer, length).
template <typename Emit>
void WalkSimple(const char* format, va_list* ap, Emit emit) {
  char digits[24];
  char* const end = digits + sizeof digits;
  for (const char* p = format; *p != '\0';) {
    if (*p != '%') {
      const char* next = std::strchr(p, '%');
      const std::size_t n = next == nullptr ? std::strlen(p) : static_cast<std::size_t>(next - p);
      emit(p, n);
      p += n;
      continue;
    }
    std::size_t length;
    const Piece piece = ConversionAt(p, &length);
    if (piece == Piece::kString) {
      const char* text = va_arg(*ap, const char*);
      emit(text, std::strlen(text));
    } else if (IsInteger(piece)) {
      const char* first = Decimal(IntegerArg(piece, ap), end);
      emit(first, static_cast<std::size_t>(end - first));
    } else {
      emit("%", 1);
    }
    p += length;
  }
}

std::string FormatSimple(const char* format, va_list args) {
  // Pass one measures, pass two writes: the result is allocated once.
  std::size_t size = 0;
  va_list measure;
  va_copy(measure, args);
  WalkSimple(format, &measure, [&size](const char*, std::size_t n) { size += n; });
  va_end(measure);

  std::string out;
  out.reserve(size);
  va_list write;
  va_copy(write, args);
  WalkSimple(format, &write, [&out](const char* piece, std::size_t n) { out.append(piece, n); });
  va_end(write);
  return out;
}

std::string FormatGeneral(const char* format, va_list args) {
  // Most texts are short: try a stack buffer first, then size exactly.
  char small[256];
  va_list again;
  va_copy(again, args);
  const int needed = std::vsnprintf(small, sizeof small, format, args);
  if (needed < 0) {
    va_end(again);
    throw Lib::VelkException(std::string("StrPrintf: cannot format \"") + format + "\"");
  }
  std::string out;
  if (static_cast<std::size_t>(needed) < sizeof small) {
    out.assign(small, static_cast<std::size_t>(needed));
  } else {
    out.resize(static_cast<std::size_t>(needed));
    std::vsnprintf(out.data(), out.size() + 1, format, again);
  }
  va_end(again);
  return out;
}
}  // namespace

std::string StrPrintf(const char* format, ...) {
  va_list args;
  va_start(args, format);
  try {
    std::string out = IsSimple(format) ? FormatSimple(format, args) : FormatGeneral(format, args);
    va_end(args);
    return out;
  } catch (...) {
    va_end(args);
    throw;
  }
}

std::string StrCat(const char* a, std::size_t aLen, const char* b, std::size_t bLen, const char* c,
                   std::size_t cLen) {
  std::string out;
  out.reserve(aLen + bLen + cLen);
  out.append(a, aLen).append(b, bLen).append(c, cLen);
  return out;
}

}  // namespace Misc
}  // namespace Velk
