// SPDX-License-Identifier: Apache-2.0
// The directory below which everything of the system lies: "/" on a device, any directory elsewhere.
//
// The path is made canonical once, at the start, and the directory is held open, so that what the daemon calls its root
// cannot change under it. Immutable after the runtime directory was made or opened; any thread.
#pragma once

#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <string>
#include <string_view>

namespace zor::platform::names {

// Every name that the platform layer has below the system root, spelled here and nowhere else.
//
// Paths are relative to the root's descriptor and open with openBeneath; SystemRoot::path turns them into absolute
// ones.

// Files that the daemon reads.
inline constexpr const char* identityDirectory = "etc/zorvane/identities.d";
inline constexpr const char* identityFileSuffix = ".plist";
inline constexpr const char* wellKnownTable = "etc/zorvane/wellknown.plist";
inline constexpr const char* configurationFile = "etc/zorvane/zorvaned.conf";
inline constexpr const char* internalBuildMark = "etc/zorvane/internal-build";
inline constexpr const char* operatingSystemRelease = "etc/os-release";
inline constexpr const char* passwordFile = "etc/passwd";

// Names that live as long as the boot. Single names lie in runtimeDirectory.
inline constexpr const char* runParent = "run";
inline constexpr const char* runtimeName = "zorvane";
inline constexpr const char* runtimeDirectory = ipc::runtimeDirectory.data();
inline constexpr const char* serviceSocket = ipc::serviceName.data();
inline constexpr const char* upcallSocket = ipc::upcallServiceName.data();
inline constexpr const char* statusSocket = ipc::statusSocketName.data();
inline constexpr const char* lockFile = "zorvaned.lock";
inline constexpr const char* lockState = ipc::lockStateFile.data();
inline constexpr const char* usersFile = ipc::usersFile.data();
inline constexpr const char* sandboxDirectory = "sandbox";
inline constexpr const char* assertionDirectory = ipc::assertionDirectory.data();

// The log directory, which the store makes, and its files.
inline constexpr const char* logDirectory = "private/var/root/Library/Logs/Zorvane";
inline constexpr const char* logFile = "zorvaned.log";
inline constexpr const char* crashFile = "zorvaned.crash";

// POSIX semaphore, followed by "." and a hash of the root unless that is "/".
inline constexpr const char* bootMarker = "zorvaned.fb_check";
/// The directory in which the C library keeps a semaphore named X, in the file sem.X.
inline constexpr const char* semaphoreDirectory = "/dev/shm";
inline constexpr const char* semaphoreFilePrefix = "sem.";
/// The second boot marker, in runtimeDirectory.
inline constexpr const char* bootMarkerFile = "zorvaned.boot";
/// The kernel's name of this boot.
inline constexpr const char* bootIdentifier = "/proc/sys/kernel/random/boot_id";

// Extended attribute with a data-protection class: the first where the daemon is root.
inline constexpr const char* protectionAttribute = "trusted.zorvane.protection";
inline constexpr const char* protectionAttributeUser = "user.zorvane.protection";

// Names of the sockets that the service manager passes.
inline constexpr const char* passedServiceSocket = "ipsi";
inline constexpr const char* passedUpcallSocket = "upcall";
inline constexpr const char* passedStatusSocket = "status";

} // namespace zor::platform::names

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
    /// so the names above can be given as they stand; "/" is the root itself.
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
