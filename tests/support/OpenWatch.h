// SPDX-License-Identifier: Apache-2.0
// Acts in the very moment in which a file or directory is opened for reading, as one whom root lets watch it may.
#pragma once

#include "os/FileDescriptor.h"

#include <fcntl.h>
#include <functional>
#include <poll.h>
#include <string>
#include <sys/fanotify.h>
#include <thread>
#include <unistd.h>

namespace zor::support {

class OpenWatch {
public:
    /// `allows` says, on a thread of its own, whether an open is let through; it waits for the answer.
    OpenWatch(const std::string& path, std::function<bool()> allows)
        : watch_(::fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDONLY | O_CLOEXEC)), allows_(std::move(allows)) {
        works_ = watch_.valid() &&
                 ::fanotify_mark(watch_.get(), FAN_MARK_ADD, FAN_OPEN_PERM | FAN_ONDIR, AT_FDCWD, path.c_str()) == 0;
        if (works_)
            answering_ = std::jthread([this](const std::stop_token& stop) { answer(stop); });
    }
    /// Needs root, and a kernel that lets an open be refused.
    [[nodiscard]] bool works() const { return works_; }

private:
    void answer(const std::stop_token& stop) {
        pollfd waiting{.fd = watch_.get(), .events = POLLIN, .revents = 0};
        fanotify_event_metadata event{};
        while (!stop.stop_requested())
            if (::poll(&waiting, 1, 1) == 1 && ::read(watch_.get(), &event, sizeof event) == sizeof event) {
                const platform::FileDescriptor asked(event.fd);
                const fanotify_response answer{.fd = event.fd,
                                               .response = allows_() ? std::uint32_t{FAN_ALLOW} : FAN_DENY};
                (void)!::write(watch_.get(), &answer, sizeof answer);
            }
    }

    platform::FileDescriptor watch_;
    const std::function<bool()> allows_;
    bool works_ = false;
    std::jthread answering_;
};

} // namespace zor::support
