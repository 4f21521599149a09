// SPDX-License-Identifier: Apache-2.0
// The daemon's log file: where lines go, not which lines are written (base/Log.h gates by level).
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace zor::platform {

class PlatformLog {
public:
    virtual ~PlatformLog() = default;
    /// Opens the log handle under a name with an initial level. False: there is no handle, and lines go to the default
    /// destination (standard error).
    virtual bool open(std::string_view name, int level) = 0;
    [[nodiscard]] virtual bool isOpen() const = 0;
    [[nodiscard]] virtual int level() const = 0;
    /// Sends lines to a file from now on. When a line would pass `fileBytesMax`, file is renamed to file.1, file.1 to
    /// file.2 and so on, `fileCount` files in all; with one file it is started anew.
    virtual void enableDiskLogging(const std::string& path, unsigned fileCount, std::size_t fileBytesMax) = 0;
    /// One event, one line: what steers or is not seen is escaped, but for tabs (plist/Text.h). Any thread.
    virtual void write(int level, std::string_view function, std::string_view message) = 0;
    /// The system's own log (syslog), for what happens before there is a handle.
    virtual void writeToSystemLog(int priority, std::string_view message) = 0;
};

} // namespace zor::platform
