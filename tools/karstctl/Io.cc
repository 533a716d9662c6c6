#include "Io.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <stdexcept>

#include "Errors.h"
#include "Json.h"

namespace karstctl {

namespace {

constexpr char kStdin[] = "-";

std::string ReadAll(std::FILE* file, const std::string& source) {
  std::string bytes;
  char buffer[1 << 16];
  std::size_t got;
  while ((got = std::fread(buffer, 1, sizeof buffer, file)) > 0) bytes.append(buffer, got);
  if (std::ferror(file)) {
    throw InputError("cannot read " + source + ": " + std::strerror(errno));
  }
  return bytes;
}

}  // namespace

std::string SourceName(const std::string& fileOrDash) {
  return fileOrDash == kStdin ? "<stdin>" : fileOrDash;
}

std::string ReadInput(const std::string& fileOrDash) {
  if (fileOrDash == kStdin) return ReadAll(stdin, SourceName(fileOrDash));
  std::FILE* file = std::fopen(fileOrDash.c_str(), "rb");
  if (file == nullptr) {
    throw InputError("cannot open " + fileOrDash + ": " + std::strerror(errno));
  }
  try {
    std::string bytes = ReadAll(file, fileOrDash);
    std::fclose(file);
    return bytes;
  } catch (...) {
    std::fclose(file);
    throw;
  }
}

void WriteOutput(const std::string& bytes) {
  if (std::fwrite(bytes.data(), 1, bytes.size(), stdout) != bytes.size() ||
      std::fflush(stdout) != 0) {
    throw std::runtime_error(std::string("cannot write standard output: ") + std::strerror(errno));
  }
}

void WriteDiagnostic(const std::string& message) {
  const bool utf8 = IsValidUtf8(message);
  std::string line = "karstctl: ";
  for (char c : message) {
    auto byte = static_cast<unsigned char>(c);
    line += (byte < 0x20 || byte == 0x7F || (!utf8 && byte >= 0x80)) ? '?' : c;
  }
  line += '\n';
  std::fwrite(line.data(), 1, line.size(), stderr);
}

}  // namespace karstctl
