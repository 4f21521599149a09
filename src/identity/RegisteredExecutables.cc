// SPDX-License-Identifier: Apache-2.0
#include "identity/RegisteredExecutables.h"

#include "os/FileChanges.h"
#include "os/FileDescriptor.h"

#include <climits>
#include <fcntl.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::platform {

namespace {

/// A file system that takes longer, and is not dead, makes its program unknown until it has answered.
constexpr std::chrono::milliseconds patienceOfPeers{1000};

/// The regular file that is open, or that lies at a path, whose last link is followed. The numbers that tell a file
/// apart never change, so its file system need not be asked for that.
std::optional<FileId> regularFile(int directory, const char* path, int flags) {
    struct statx status{};
    if (::statx(directory, path, flags | AT_STATX_DONT_SYNC, STATX_INO | STATX_TYPE, &status) != 0 ||
        !S_ISREG(status.stx_mode))
        return std::nullopt;
    return FileId{.device = makedev(status.stx_dev_major, status.stx_dev_minor), .inode = status.stx_ino};
}

/// The path without links; empty when it leads nowhere.
std::string resolved(const std::string& path) {
    const FileDescriptor file(::open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file.valid())
        return {};
    char buffer[PATH_MAX];
    const std::string link = "/proc/self/fd/" + std::to_string(file.get());
    const ssize_t bytes = ::readlink(link.c_str(), buffer, sizeof buffer);
    return bytes > 0 ? std::string(buffer, static_cast<std::size_t>(bytes)) : std::string();
}

void watchNameAt(const std::string& path, int inotify, std::uint32_t events, RegisteredExecutables::Found& watched) {
    const std::size_t slash = path.rfind('/');
    const FileDescriptor parent(::open(path.substr(0, slash + 1).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const auto number = parent.valid() ? watchDirectory(inotify, parent.get(), events) : Errno::last();
    if (number)
        watched.watches.push_back({.number = *number, .name = path.substr(slash + 1)});
    else
        watched.watchedAll = false;
}

RegisteredExecutables::Found lookAt(const std::string& path) {
    return {.file = regularFile(AT_FDCWD, path.c_str(), 0), .watches = {}};
}

RegisteredExecutables::Found watchAndLookAt(const std::string& path, int inotify, std::uint32_t events) {
    RegisteredExecutables::Found watched{.file = {}, .watches = {}, .watchedAll = true};
    // Watches come first: what changes after the look is then told.
    watchNameAt(path, inotify, events, watched);
    if (const std::string target = resolved(path); !target.empty() && target != path)
        watchNameAt(target, inotify, events, watched);
    watched.file = lookAt(path).file;
    return watched;
}

} // namespace

std::shared_ptr<RegisteredExecutables::Question> RegisteredExecutables::questionOf(const std::string& path) {
    const MutexLock held(mutex_);
    std::shared_ptr<Question>& question = questions_[path];
    if (!question)
        question = std::make_shared<Question>();
    return question;
}

std::optional<FileId> RegisteredExecutables::fileAt(const std::string& path) {
    const auto remembered = openRemembered(path.c_str());
    if (remembered)
        return regularFile(remembered->get(), "", AT_EMPTY_PATH);
    if (remembered.error() == ENOENT)
        return std::nullopt;
    const auto found = questionOf(path)->ask([path] { return lookAt(path); }, patienceOfPeers);
    return found ? found->file : std::nullopt;
}

std::optional<RegisteredExecutables::Found>
RegisteredExecutables::watch(const std::string& path, const std::shared_ptr<const FileDescriptor>& inotify,
                             std::uint32_t events, std::chrono::milliseconds patience) {
    return questionOf(path)->ask([path, inotify, events] { return watchAndLookAt(path, inotify->get(), events); },
                                 patience);
}

} // namespace zor::platform
