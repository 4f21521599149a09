// SPDX-License-Identifier: Apache-2.0
#include "device/FileCrashAnnotation.h"

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <fcntl.h>
#include <string>
#include <syslog.h>

namespace zor::platform {

namespace {
constexpr mode_t annotationMode = 0640;
constexpr std::size_t messageBytesMax = 1024 * 1024;
} // namespace

void FileCrashAnnotation::record(std::string_view message) {
    message = message.substr(0, messageBytesMax);
    if (replaceFile(message))
        ::syslog(LOG_DAEMON | LOG_CRIT, "%.*s", static_cast<int>(message.size()), message.data());
}

Errno FileCrashAnnotation::replaceFile(std::string_view message) {
    const FileDescriptor directory = TRY(openBeneath(root_.descriptor(), names::logDirectory, O_RDONLY | O_DIRECTORY));
    const std::string temporary = std::string(".") + names::crashFile;
    (void)disk_.unlinkFile(directory.get(), temporary.c_str());
    const FileDescriptor file = TRY(disk_.createFile(directory.get(), temporary.c_str(), annotationMode));
    TRY(disk_.write(file.get(), {reinterpret_cast<const std::uint8_t*>(message.data()), message.size()}));
    TRY(disk_.sync(file.get()));
    TRY(disk_.rename(directory.get(), temporary.c_str(), directory.get(), names::crashFile, 0));
    return disk_.sync(directory.get());
}

} // namespace zor::platform
