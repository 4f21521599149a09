// SPDX-License-Identifier: Apache-2.0
// A process that runs short of descriptors for a while.
#pragma once

#include <chrono>
#include <fcntl.h>
#include <sys/resource.h>
#include <thread>
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
