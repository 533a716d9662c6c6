// Whole files as byte strings, for tests that damage, compare or feed files.

#ifndef KARST_TESTS_FILE_BYTES_H_
#define KARST_TESTS_FILE_BYTES_H_

#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>

namespace testfiles {

inline std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) throw std::runtime_error("cannot read " + path);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

inline void WriteFile(const std::string& path, const std::string& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  if (!out.flush()) throw std::runtime_error("cannot write " + path);
}

}  // namespace testfiles

#endif  // KARST_TESTS_FILE_BYTES_H_
