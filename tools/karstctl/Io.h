#ifndef KARSTCTL_IO_H_
#define KARSTCTL_IO_H_

#include <string>

namespace karstctl {

// How error messages name an input: the path, or "<stdin>" for "-".
std::string SourceName(const std::string& fileOrDash);

// The whole content of the file, or of standard input for "-", as bytes.
// Throws InputError when it cannot be read.
std::string ReadInput(const std::string& fileOrDash);

// Writes the bytes to standard output exactly and flushes. Throws
// std::runtime_error when the write fails, so a full disk is not a success.
void WriteOutput(const std::string& bytes);

}  // namespace karstctl

#endif  // KARSTCTL_IO_H_
