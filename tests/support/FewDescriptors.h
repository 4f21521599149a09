// SPDX-License-Identifier: Apache-2.0
// A process that runs short of descriptors for a while.
#pragma once

#include <chrono>
#include <fcntl.h>
#include <sys/resource.h>
#include <thread>
#include <unistd.h>

namespace zor::support {

/// The soft limit on this process's descriptors, put back at the end.
class DescriptorLimit {
public:
    DescriptorLimit() { ::getrlimit(RLIMIT_NOFILE, &before_); }
    ~DescriptorLimit() { ::setrlimit(RLIMIT_NOFILE, &before_); }
    bool set(rlim_t count) const {
        const rlimit limit = {.rlim_cur = count, .rlim_max = before_.rlim_max};
        return ::setrlimit(RLIMIT_NOFILE, &limit) == 0;
    }
    [[nodiscard]] rlim_t hard() const { return before_.rlim_max; }

private:
    rlimit before_{};
};

/// Takes all descriptors of this process but some.
class FewDescriptors : public DescriptorLimit {
public:
    explicit FewDescriptors(rlim_t left) {
        const int lowest = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        ::close(lowest);
        set(static_cast<rlim_t>(lowest) + left);
    }
};

/// The same limit, there for a moment and gone for a moment, over and over, wherever the process is by then.
class DescriptorsThatComeAndGo {
public:
    DescriptorsThatComeAndGo()
        : changing_([](const std::stop_token& stop) {
              for (rlim_t round = 0; !stop.stop_requested(); ++round) {
                  {
                      const FewDescriptors few(round % 4);
                      std::this_thread::sleep_for(std::chrono::microseconds(20));
                  }
                  std::this_thread::sleep_for(std::chrono::microseconds(60));
              }
          }) {}

private:
    std::jthread changing_;
};

} // namespace zor::support
