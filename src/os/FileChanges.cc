// SPDX-License-Identifier: Apache-2.0
#include "os/FileChanges.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <unistd.h>

namespace zor::platform {

ErrnoOr<int> watchDirectory(int inotify, int directory, std::uint32_t events) {
    char path[32];
    std::snprintf(path, sizeof path, "/proc/self/fd/%d", directory);
    const int watch = ::inotify_add_watch(inotify, path, events | IN_ONLYDIR);
    return watch < 0 ? ErrnoOr<int>(Errno::last()) : watch;
}

bool readInotify(int inotify, const std::function<bool(const inotify_event&, std::string_view name)>& counts) {
    bool counted = false;
    alignas(inotify_event) char buffer[8192];
    for (;;) {
        const ssize_t bytes = ::read(inotify, buffer, sizeof buffer);
        if (bytes < 0 && errno == EINTR)
            continue;
        if (bytes <= 0)
            return counted;
        for (std::size_t at = 0; at < static_cast<std::size_t>(bytes);) {
            inotify_event event{};
            std::memcpy(&event, buffer + at, sizeof event);
            const char* const name = buffer + at + sizeof event;
            counted |= counts(event, std::string_view(name, ::strnlen(name, event.len)));
            at += sizeof event + event.len;
        }
    }
}

} // namespace zor::platform
