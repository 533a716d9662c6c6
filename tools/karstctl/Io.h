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

// Writes "karstctl: <message>" to standard error as exactly one line: control
// bytes (a newline in a store message, say) become '?', and so does every
// byte of a message that is not UTF-8.
void WriteDiagnostic(const std::string& message);

}  // namespace karstctl

#endif  // KARSTCTL_IO_H_
