// SPDX-License-Identifier: Apache-2.0
// A process that runs short of descriptors for a while.
#pragma once

#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

namespace zor::support {

/// Takes all descriptors of this process but some.
class FewDescriptors {
public:
    explicit FewDescriptors(rlim_t left) {
        ::getrlimit(RLIMIT_NOFILE, &before_);
        const int lowest = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        ::close(lowest);
        const rlimit few{static_cast<rlim_t>(lowest) + left, before_.rlim_max};
        ::setrlimit(RLIMIT_NOFILE, &few);
    }
    ~FewDescriptors() { ::setrlimit(RLIMIT_NOFILE, &before_); }
    FewDescriptors(const FewDescriptors&) = delete;
    FewDescriptors& operator=(const FewDescriptors&) = delete;

private:
    rlimit before_{};
};

} // namespace zor::support
