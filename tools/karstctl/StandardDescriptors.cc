// Descriptors 0, 1 and 2 are open before any other code of the process runs.
//
// Started with one of them closed, a process hands that number to the first
// file anything opens: the gRPC library opens an eventfd while it is being
// loaded, and karstctl then read that as its standard input ("Resource
// temporarily unavailable"). Every shared library's initializer runs before
// main() and before the executable's own constructors, but after the
// functions in the executable's .preinit_array, which the dynamic linker
// calls first of all. So a closed one of the three gets /dev/null from
// there: reading it finds nothing and writing to it is lost, as for any
// program run that way.

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace {

void OpenStandardDescriptors(int /*argc*/, char** /*argv*/, char** /*envp*/) {
  for (int fd = 0; fd <= 2; ++fd) {
    if (fcntl(fd, F_GETFD) != -1 || errno != EBADF) continue;
    // open() takes the lowest free number, which is this one. Without
    // /dev/null (a bare chroot) nothing better can be done, and the
    // descriptor stays closed.
    const int opened = open("/dev/null", O_RDWR);
    if (opened > fd) close(opened);
  }
}

// Nothing refers to it by name: "used" keeps the compiler from dropping it.
[[gnu::used, gnu::section(".preinit_array")]] void (*preinitOpenStandardDescriptors)(
    int, char**, char**) = OpenStandardDescriptors;

}  // namespace
