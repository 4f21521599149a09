// SPDX-License-Identifier: Apache-2.0
#include "ContainerDirectory.h"

#include "fs/MetadataFileName.h"
#include "fs/OwnedFile.h"
#include "os/Openat2.h"

#include <fcntl.h>

namespace zorvanectl::content {

using zor::platform::FileDescriptor;

Outcome<FileDescriptor> openContainer(const std::string& path) {
    const FileDescriptor root(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    const std::size_t begin = path.starts_with('/') ? 1 : 0;
    auto container = zor::platform::openBeneath(root.get(), path.c_str() + begin, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!container)
        return failed("the new container cannot be opened", container.error());
    if (!zor::fs::readOwnedFile(container->get(), zor::names::metadataFile, zor::fs::metadataFileBytesMax))
        return failed("somebody put something else in the place of the new container");
    return std::move(*container);
}

} // namespace zorvanectl::content
