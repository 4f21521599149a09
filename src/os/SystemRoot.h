// SPDX-License-Identifier: Apache-2.0
// The directory below which everything of the system lies: "/" on a device, any directory elsewhere.
//
// The path is made canonical once, at the start, and the directory is held open, so that what the daemon calls its root
// cannot change under it. Immutable after the runtime directory was made or opened; any thread.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <string>
#include <string_view>

namespace zor::platform {

class SystemRoot {
public:
    /// An error when `directory` is no directory.
    [[nodiscard]] static ErrnoOr<SystemRoot> open(const std::string& directory);

    [[nodiscard]] bool isDeviceRoot() const { return canonicalPath_ == "/"; }
    [[nodiscard]] const std::string& canonicalPath() const { return canonicalPath_; }
    /// O_PATH | O_DIRECTORY.
    [[nodiscard]] int descriptor() const { return directory_.get(); }
    /// The true place of a path of the system: "/private/var" becomes DIR/private/var. A missing first slash is added,
    /// so the names of Names.h can be given as they stand; "/" is the root itself.
    [[nodiscard]] std::string path(std::string_view systemPath) const;

    /// Makes run/zorvane (0755) where it is missing and opens it. EPERM when the directory belongs to
    /// somebody else or others can write to it. Called once, before any thread.
    Errno makeRuntimeDirectory(Disk& disk);
    /// Opens run/zorvane as it is, with the same judgement: for programs that look at what a daemon left there.
    Errno openRuntimeDirectory();
    /// run/zorvane, a real descriptor; -1 until it was made or opened.
    [[nodiscard]] int runtimeDirectory() const { return runtimeDirectory_.get(); }

private:
    SystemRoot() = default;
    Errno adoptRuntimeDirectory(FileDescriptor directory);

    std::string canonicalPath_;
    FileDescriptor directory_;
    FileDescriptor runtimeDirectory_;
};

/// Keeps a second daemon off the same root: run/zorvane/zorvaned.lock, locked for the life of the process. The kernel
/// gives it up when the process ends, however it ends.
class DaemonLock {
public:
    /// EWOULDBLOCK when another daemon holds it.
    [[nodiscard]] static ErrnoOr<DaemonLock> take(const SystemRoot& root);

    /// Whether a daemon holds it, as far as this process can see. Does not try the lock: whoever tries it could keep a
    /// daemon from starting.
    [[nodiscard]] static bool isHeld(const SystemRoot& root);

private:
    explicit DaemonLock(FileDescriptor file) : file_(std::move(file)) {}
    FileDescriptor file_;
};

} // namespace zor::platform
