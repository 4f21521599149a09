// SPDX-License-Identifier: Apache-2.0
#include "Root.h"

#include "ToldContainers.h"

#include <cerrno>
#include <climits>
#include <fcntl.h>

namespace zorvanerun {

Result<Root> Root::open(const std::string& directory) {
    const std::string advice = "name the daemon's root with --root";
    Root root;
    root.descriptor.reset(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root.descriptor.valid())
        return std::unexpected(
            Failure{.what = withReason("cannot open the root " + directory, zor::Errno::last()), .advice = advice});
    char path[PATH_MAX];
    const std::string link = "/proc/self/fd/" + std::to_string(root.descriptor.get());
    const ssize_t length = ::readlink(link.c_str(), path, sizeof path);
    if (length < 0)
        return std::unexpected(
            Failure{.what = withReason("cannot read " + link, zor::Errno::last()), .advice = "mount /proc"});
    root.path.assign(path, static_cast<std::size_t>(length));
    if (root.path != "/" && !isPlainPath(root.path))
        return std::unexpected(Failure{.what = "the root " + root.path + " has no plain path", .advice = advice});
    return root;
}

} // namespace zorvanerun
