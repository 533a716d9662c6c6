// Scratch folders and whole files as byte strings.

#ifndef KARST_TESTS_SUPPORT_FILES_H_
#define KARST_TESTS_SUPPORT_FILES_H_

#include <string>

namespace karst_test {

// A fresh folder under the test temp dir, removed with its content.
class ScratchDir {
 public:
  ScratchDir();
  ~ScratchDir();
  ScratchDir(const ScratchDir&) = delete;
  ScratchDir& operator=(const ScratchDir&) = delete;
  const std::string& Path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Throw std::runtime_error when the file cannot be read or written.
std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& bytes);

// Points the default SQLite store at "path" for this process and every child
// forked afterwards.
void UseStoreAt(const std::string& path);

}  // namespace karst_test

#endif  // KARST_TESTS_SUPPORT_FILES_H_
