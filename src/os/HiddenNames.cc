// SPDX-License-Identifier: Apache-2.0
#include "os/HiddenNames.h"

#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace zor::platform {

bool hidesNames(int directory) {
    struct statx status{};
    if (::statx(directory, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, 0, &status) != 0 ||
        (status.stx_attributes & STATX_ATTR_ENCRYPTED) == 0)
        return false;
    // Only making something needs the key. A file without a name is gone when it is closed.
    const auto unnamed = openBeneath(directory, ".", O_TMPFILE | O_RDWR, 0600);
    return !unnamed && unnamed.error() == ENOKEY;
}

} // namespace zor::platform
