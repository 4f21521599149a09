// SPDX-License-Identifier: Apache-2.0
// Reads a store as it lies, with the daemon's own readers, and says what is wrong with it.
//
// Nothing is ever written, no lock is taken, no link is followed, nothing that could block is opened. A thing that a
// request in flight shows is not reported: where a first look finds something, a second one follows, and only what both
// saw counts. Containers are looked at one after another; memory grows with the number of identifiers in one class
// directory and with the findings. One thread.
#pragma once

#include "base/Log.h"
#include "check/Finding.h"
#include "device/DataProtection.h"
#include "device/DeviceQueries.h"
#include "fs/ZORFileManager.h"
#include "identity/Users.h"
#include "ipc/UserNumbers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Disk.h"
#include "platform/Errno.h"
#include "platform/Process.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <expected>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor::check {

// The system that a check looks at, on a disk that refuses every change.

// A disk that cannot be changed: every call that would fails with EROFS, whatever a reader that shares code with the
// daemon does.

class ReadOnlyDisk final : public platform::Disk {
public:
    Errno makeDirectory(int, const char*, mode_t) override { return Errno(EROFS); }
    ErrnoOr<platform::FileDescriptor> createFile(int, const char*, mode_t) override { return Errno(EROFS); }
    Errno makeSymbolicLink(const char*, int, const char*) override { return Errno(EROFS); }
    Errno makeHardLink(int, const char*, int, const char*) override { return Errno(EROFS); }
    Errno makeFifo(int, const char*, mode_t) override { return Errno(EROFS); }
    Errno rename(int, const char*, int, const char*, unsigned) override { return Errno(EROFS); }
    Errno unlinkFile(int, const char*) override { return Errno(EROFS); }
    Errno removeDirectory(int, const char*) override { return Errno(EROFS); }
    Errno changeMode(int, mode_t) override { return Errno(EROFS); }
    Errno changeOwner(int, uid_t, gid_t) override { return Errno(EROFS); }
    Errno changeOwnerOf(int, const char*, uid_t, gid_t) override { return Errno(EROFS); }
    Errno setTimes(int, const timespec&, const timespec&) override { return Errno(EROFS); }
    Errno setAttribute(int, const char*, std::span<const std::uint8_t>) override { return Errno(EROFS); }
    Errno setInodeFlags(int, int) override { return Errno(EROFS); }
    Errno write(int, std::span<const std::uint8_t>) override { return Errno(EROFS); }
    Errno cloneData(int, int) override { return Errno(EROFS); }
    ErrnoOr<std::size_t> copyData(int, int, std::size_t) override { return Errno(EROFS); }
    Errno sync(int) override { return Errno(EROFS); }
    Errno syncFileSystem(int) override { return Errno(EROFS); }
    Errno orderData(int) override { return Errno(EROFS); }
    ErrnoOr<std::size_t> read(int fd, std::span<std::uint8_t> bytes) override { return platform::readOnce(fd, bytes); }
    [[nodiscard]] bool hidesNames(int directory) override { return platform::hidesNames(directory); }
};

// The things that a check looks at: a system root, and the daemon's own readers over it, on a disk that refuses every
// change.
//
// Opening it makes nothing, takes no lock and asks no daemon. One thread.

/// Readers say in the log what they cannot read; here the findings say it.
class SilentLog final : public platform::PlatformLog {
public:
    bool open(std::string_view, int) override { return true; }
    [[nodiscard]] bool isOpen() const override { return true; }
    [[nodiscard]] int level() const override { return 0; }
    void enableDiskLogging(const std::string&, unsigned, std::size_t) override {}
    void write(int, std::string_view, std::string_view) override {}
    void writeToSystemLog(int, std::string_view) override {}
};

class CheckedSystem {
public:
    /// Else one line that says why this root cannot be checked by this process: only the user that the daemon runs as
    /// sees what the daemon sees.
    [[nodiscard]] static std::expected<std::unique_ptr<CheckedSystem>, std::string>
    open(const std::string& rootDirectory);

    [[nodiscard]] const platform::SystemRoot& root() const { return root_; }
    [[nodiscard]] const platform::PasswordDatabase& passwords() const { return passwords_; }
    /// The owners of containers here, as a daemon would read them.
    [[nodiscard]] const ipc::UserNumbers& users() const { return configured_.numbers; }
    [[nodiscard]] const std::vector<std::string>& userDoubts() const { return configured_.doubts; }
    [[nodiscard]] const platform::BootMarker& bootMarker() const { return bootMarker_; }
    [[nodiscard]] const platform::FileProtectionClass& protection() const { return protection_; }
    [[nodiscard]] const Log& log() const { return log_; }
    [[nodiscard]] ZORFileManager& fileManager() { return fileManager_; }
    [[nodiscard]] const StorePlaces& places() const { return places_; }
    /// Whether a daemon serves the root, as far as can be seen from outside.
    [[nodiscard]] bool daemonRuns() const;
    /// A daemon that is not root gives nothing to others.
    [[nodiscard]] bool ownersCount() const;
    /// Relative to the root, without a leading slash; what lies outside keeps its whole path.
    [[nodiscard]] std::string belowRoot(const FileURL& url) const;

private:
    CheckedSystem(platform::SystemRoot root, ipc::ConfiguredUsers configured);

    platform::SystemRoot root_;
    const ipc::ConfiguredUsers configured_;
    ReadOnlyDisk disk_;
    SilentLog silence_;
    Log log_{silence_};
    platform::LinuxPasswordDatabase passwords_{root_};
    platform::SemaphoreBootMarker bootMarker_{root_};
    platform::FileDeviceLockState lockState_{root_};
    platform::XattrProtectionClass protection_{disk_, lockState_};
    ZORFileManager fileManager_{log_, root_, disk_, protection_};
    StorePlaces places_{fileManager_.resolver()};
};

struct CheckOptions {
    /// The daemon answers its clients: what its start makes must be there.
    bool daemonServes = false;
    /// The place of the live container that such a daemon gives its clients; nothing when it does not say. Asked only
    /// of an identifier that has several, for what a daemon remembers is not to be seen on the disk.
    std::function<std::optional<std::string>(ContainerClass, std::uint32_t user, const std::string& identifier)>
        servedPath;
    /// UUIDs of containers whose data-protection class is being changed.
    std::set<std::string> changingProtection;
    /// UUIDs of containers whose info values the daemon could not write.
    std::set<std::string> unsavedInfo;
    /// Between the two looks; 0: one look alone, for a store that nobody works on.
    std::chrono::milliseconds pause{200};
    /// In place of the system's own.
    const platform::BootMarker* bootMarker = nullptr;
};

/// By path; notes among them (FindingPage::isNote).
[[nodiscard]] std::vector<Finding> checkStore(CheckedSystem& system, const CheckOptions& options);

/// Whether something counts: notes alone leave a store whole.
[[nodiscard]] bool isWhole(const std::vector<Finding>& findings);

} // namespace zor::check
