// SPDX-License-Identifier: Apache-2.0
// Change notices of directories. Any thread, one reader at a time.
#pragma once

#include "platform/Errno.h"

#include <cstdint>
#include <functional>
#include <string_view>
#include <sys/inotify.h>

namespace zor::platform {

/// Watches an open directory, wherever its name points by now. The watch's number.
[[nodiscard]] ErrnoOr<int> watchDirectory(int inotify, int directory, std::uint32_t events);

/// Takes all pending events of a non-blocking inotify descriptor. True when `counts` accepted one of them.
bool readInotify(int inotify, const std::function<bool(const inotify_event&, std::string_view name)>& counts);

} // namespace zor::platform
