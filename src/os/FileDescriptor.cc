// SPDX-License-Identifier: Apache-2.0
#include "os/FileDescriptor.h"

#include <fcntl.h>
#include <initializer_list>
#include <unistd.h>

namespace zor::platform {

bool fillStandardDescriptors() {
    for (const int fd : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO})
        // The lowest number that is free is taken, and none below is.
        if (::fcntl(fd, F_GETFD) < 0 && ::open("/dev/null", O_RDWR) != fd)
            return false;
    return true;
}

} // namespace zor::platform
