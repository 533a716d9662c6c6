// Runs every file of the given corpus directories (or single files) through
// the import fuzzer's check, without libFuzzer, so the ordinary test build
// keeps replaying the seeds and every input a fuzzing run ever found.

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "import_check.h"

int main(int argc, char** argv) {
  std::vector<std::filesystem::path> files;
  for (int i = 1; i < argc; ++i) {
    if (std::filesystem::is_directory(argv[i])) {
      for (const auto& entry : std::filesystem::directory_iterator(argv[i])) {
        if (entry.is_regular_file()) files.push_back(entry.path());
      }
    } else {
      files.emplace_back(argv[i]);
    }
  }
  std::sort(files.begin(), files.end());
  if (files.empty()) {
    std::fprintf(stderr, "no inputs\n");
    return 1;
  }
  int counts[3] = {0, 0, 0};
  for (const auto& file : files) {
    std::ifstream in(file, std::ios::binary);
    if (!in) {
      std::fprintf(stderr, "cannot read %s\n", file.c_str());
      return 1;
    }
    const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const karst_fuzz::ImportResult r =
        karst_fuzz::CheckImport(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
    ++counts[static_cast<int>(r)];
  }
  std::printf(
      "fuzz-replay: %zu inputs, %d accepted and round-tripped, %d refused with an input error, "
      "%d refused as a number out of range\n",
      files.size(), counts[0], counts[1], counts[2]);
  return 0;
}
