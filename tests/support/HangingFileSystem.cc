// SPDX-License-Identifier: Apache-2.0
#include "support/HangingFileSystem.h"

#include <cstdio>
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>

namespace zor::support {

HangingFileSystem::HangingFileSystem(std::string at, uid_t server)
    : at_(std::move(at)), device_(::open("/dev/fuse", O_RDWR | O_CLOEXEC)) {
    struct stat status{};
    if (!device_.valid() || ::lstat(at_.c_str(), &status) != 0)
        return;
    char options[128];
    std::snprintf(options, sizeof options, "fd=%d,rootmode=%o,user_id=%u,group_id=%u,allow_other", device_.get(),
                  S_ISDIR(status.st_mode) ? 040755U : 0100644U, server, server);
    mounted_ = ::mount("hanging", at_.c_str(), "fuse", MS_NOSUID | MS_NODEV, options) == 0;
}

HangingFileSystem::~HangingFileSystem() {
    device_.reset();
    if (mounted_)
        ::umount2(at_.c_str(), MNT_DETACH);
}

} // namespace zor::support
