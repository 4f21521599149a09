// SPDX-License-Identifier: Apache-2.0
// The device as the daemon knows it: one role for each thing that it asks of the device, or tells it.
#pragma once

#include "platform/Errno.h"
#include "platform/Process.h"

#include <cerrno>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::platform {

class RunLoop;

// Small questions that the daemon asks of the device. All may be asked from any thread.

class InternalBuildQuery {
public:
    virtual ~InternalBuildQuery() = default;
    [[nodiscard]] virtual bool isInternalBuild() const = 0;
};

class SystemVersionQuery {
public:
    virtual ~SystemVersionQuery() = default;
    /// The operating system's build version; empty when unknown.
    [[nodiscard]] virtual std::string buildVersion() const = 0;
};

struct PasswordEntry {
    std::string name;
    std::uint32_t uid = 0;
    /// Absolute; on a root other than "/" it already begins with the root.
    std::string homeDirectory;
};

class PasswordDatabase {
public:
    virtual ~PasswordDatabase() = default;
    /// ENOENT where the database has no such entry, or one without an absolute home; any other error where it could not
    /// be asked.
    [[nodiscard]] virtual ErrnoOr<PasswordEntry> entryForUserId(std::uint32_t uid) const = 0;
    [[nodiscard]] virtual ErrnoOr<PasswordEntry> entryForName(std::string_view name) const = 0;
};

// The mark that the once-per-boot work is done; it ends with the boot.

class BootMarker {
public:
    virtual ~BootMarker() = default;
    /// Whether the mark exists and is ours. A mark made by somebody else counts as absent; `foreign` then is true.
    struct State {
        bool present = false;
        bool foreign = false;
    };
    [[nodiscard]] virtual State look() const = 0;
    /// Makes the mark.
    virtual Errno make() = 0;
    /// Removes the mark: the next launch takes itself for the first of its boot.
    virtual void forget() = 0;
    [[nodiscard]] virtual std::string name() const = 0;
};

// A last message kept where a crash report is looked for.

class CrashAnnotation {
public:
    virtual ~CrashAnnotation() = default;
    /// Records the message; the process ends right after. Any thread, one at a time.
    virtual void record(std::string_view message) = 0;
};

// Whether the device is locked.

class DeviceLockState {
public:
    virtual ~DeviceLockState() = default;
    static constexpr int unlocked = 0;
    static constexpr int locked = 1;
    /// One of these, or another number for another condition. Any thread.
    [[nodiscard]] virtual int currentState() const = 0;
    /// Calls `changed` on the loop whenever the state may have changed. After an error, which is to be logged, changes
    /// are found a moment late, until it can be done as it should.
    virtual Errno registerForChanges(RunLoop& loop, std::function<void()> changed) = 0;
    /// The names in the two log lines of a failed registration.
    [[nodiscard]] virtual const char* registrationCallName() const = 0;
    [[nodiscard]] virtual const char* notificationName() const = 0;
};

// Data-protection class of an open file or directory.

/// The class that a file without a recorded one has.
inline constexpr int defaultProtectionClass = 3;

/// An error of the kernel's for who takes EPERM for a locked device: an immutable file, a listener that forbids an
/// open, are none.
[[nodiscard]] constexpr Errno neverLocked(Errno error) {
    return error == EPERM ? Errno(EACCES) : error;
}

class FileProtectionClass {
public:
    virtual ~FileProtectionClass() = default;
    /// `fd` is a real descriptor (not O_PATH) of a regular file or a directory.
    [[nodiscard]] virtual ErrnoOr<int> classOf(int fd) const = 0;
    /// EPERM means that the device is locked, and nothing else: the kernel's own EPERM becomes EACCES.
    virtual Errno setClass(int fd, int protectionClass) = 0;
    /// False once a set has met a file system without extended attributes.
    [[nodiscard]] virtual bool supported() const = 0;
};

// Tells the sandbox which directory is the container of (user, item type, identifier).

/// The kinds of mapping; the numbers are the sandbox's own.
enum class SandboxItemType : std::uint64_t { dataContainer = 1, groupContainer = 2 };

class SandboxUserState {
public:
    virtual ~SandboxUserState() = default;
    /// Sets the mapping to `path`, or removes it when there is none (removing what is not there succeeds).
    /// Any thread; calls for one identifier are serialised by the caller's identifier locks.
    virtual Errno setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                             const std::optional<std::string>& path) = 0;
    /// Removes every mapping whose target is gone, of the users of whom that may be concluded: a home that is not there
    /// now comes back with its containers. `isGone` is asked of targets inside the system root: it knows where a look
    /// could wait for a user's file system. A launch calls it once. How many were removed.
    virtual unsigned removeDanglingMappings(const std::function<bool(std::uint32_t userId)>& mayConclude,
                                            const std::function<bool(const std::string& path)>& isGone) = 0;
};

// Keeps an application from being started while its files are changed.

/// Why an application is kept from running. The numbers are those that an assertion's file holds.
enum class TerminationReason : std::uint8_t { installation = 0, cacheDeletion = 1, critical = 255 };

/// For people.
[[nodiscard]] constexpr std::string_view terminationReasonText(TerminationReason reason) {
    switch (reason) {
    case TerminationReason::installation:
        return "its files are being changed";
    case TerminationReason::cacheDeletion:
        return "its caches are being deleted";
    case TerminationReason::critical:
        break;
    }
    return "the system needs it to be still";
}

class TerminationAssertionService {
public:
    /// An assertion that was asked for. Its end gives it back.
    class Assertion {
    public:
        virtual ~Assertion() = default;
    };
    using AcquisitionHandler = std::function<void(const std::optional<std::string>& error)>;

    virtual ~TerminationAssertionService() = default;
    /// Asks for an assertion on an application. The handler is called once, on any thread and perhaps before this
    /// returns, with an error or none. nullptr: there is none to be had, and the handler may never be called. Any
    /// thread.
    virtual std::unique_ptr<Assertion> acquire(std::string_view bundleIdentifier, TerminationReason reason,
                                               AcquisitionHandler handler) = 0;
    /// Identifiers with an assertion, in ascending order.
    [[nodiscard]] virtual std::vector<std::string> held() const = 0;
};

} // namespace zor::platform
