// SPDX-License-Identifier: Apache-2.0
// The directories of the store as the daemon uses them: each is made where it is missing, judged and opened. One
// configuration is the system's, one each mobile user's, below the user's home, which comes and goes.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "base/Mutex.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "ipc/UserNumbers.h"
#include "os/BoundedQuestion.h"
#include "platform/Device.h"
#include "platform/Errno.h"
#include "store/StorePlaces.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

// The home of one mobile user: where it is, whether it is there, whether it is still the one that it was.
//
// Homes come and go while the daemon runs: they are mounted late, unlocked at a login, made for a user who was added.
// One that does not resolve is none for the moment, and is looked for again at each use. Every change of what was seen
// gives a new generation, by which a cache of things read below the home knows whether they count.
//
// Nothing here makes anything. The disk is asked without a lock, and not waited for without end; from the first look on
// no way into the home crosses a mount. Any thread.

/// The question for a home's path without links, asked where it may take for ever.
using HomeQuestion = platform::BoundedQuestion<ErrnoOr<std::string>>;

class UserHome {
public:
    UserHome(std::uint32_t userId, const Log& log, const fs::PathResolver& resolver,
             const platform::PasswordDatabase& passwords)
        : userId_(userId), log_(log), resolver_(resolver), passwords_(passwords) {}
    UserHome(const UserHome&) = delete;
    UserHome& operator=(const UserHome&) = delete;

    enum class State : std::uint8_t {
        /// Not to be told for want of descriptors or memory, or because the database could not be asked.
        unknown,
        noAccount,
        missing,
        present,
    };
    struct Seen {
        State state = State::unknown;
        /// While it is present: its path, without links; else nullptr.
        std::shared_ptr<const FileURL> directory;
        /// The generation of this state; never 0.
        std::uint64_t generation = 0;
    };
    /// Asks the disk.
    Seen look() ZOR_EXCLUDES(mutex_) { return lookAndOpen().seen; }
    struct Opened {
        Seen seen;
        /// The home that was seen, O_PATH, or an errno.
        fs::OpenResult directory;
    };
    Opened lookAndOpen() ZOR_EXCLUDES(mutex_);
    /// The same, but a home that was seen within the last second is taken to be there still: no system call then.
    Seen lookIfDue() ZOR_EXCLUDES(mutex_);
    /// The last look's; 0 before the first. One atomic read.
    [[nodiscard]] std::uint64_t generation() const { return generation_.load(std::memory_order_acquire); }

    /// The home that the password database names, without links; an error when it names none, or one that is not
    /// there; EHOSTDOWN when what the way to it lies on does not answer. `question` is one for each user.
    [[nodiscard]] static ErrnoOr<FileURL> pathOf(const platform::PasswordDatabase& passwords, std::uint32_t userId,
                                                 HomeQuestion& question);

private:
    struct Found {
        State state = State::unknown;
        std::shared_ptr<const FileURL> directory;
        fs::DirectoryId id;
        [[nodiscard]] bool isAs(const Found& other) const;
    };
    [[nodiscard]] Found find();
    Seen seenOf(const Found& found) const;

    const std::uint32_t userId_;
    const Log& log_;
    const fs::PathResolver& resolver_;
    const platform::PasswordDatabase& passwords_;
    HomeQuestion wayToHome_;
    std::atomic<std::uint64_t> generation_{0};
    platform::Mutex mutex_;
    Found found_ ZOR_GUARDED_BY(mutex_);
    /// Milliseconds of the coarse monotonic clock.
    std::int64_t dueMilliseconds_ ZOR_GUARDED_BY(mutex_) = 0;
};

/// A directory that a getter has made or found, and whether it may be used. An open one was judged.
struct UsableDirectory {
    FileURL url;
    Result<platform::FileDescriptor> opened;
};

// The places of the containers of one mobile user. Getters never fail: they make their directory on every call, log
// when they cannot, and return the place anyway. A home that is not there makes every place below it absent; the home
// itself is never made, nor anything on the way to it.
//
// Its own recursive lock is held for a whole getter. Lock order: the global configuration's lock before this one.

class ZORPerUserConfiguration {
public:
    /// nullptr, with a log line, for a user who is no mobile user: `home` is null then.
    static std::unique_ptr<ZORPerUserConfiguration> initWithUserId(std::uint32_t userId, const Log& log,
                                                                   ZORFileManager& fileManager, UserHome* home);

    [[nodiscard]] std::uint32_t userId() const { return userId_; }
    /// Absent while there is none; then looked for again at each call.
    [[nodiscard]] std::optional<FileURL> userHomeDirectory();
    /// Whether the home exists; makes nothing.
    [[nodiscard]] bool existsUserBaseDirectory();
    std::optional<FileURL> userBaseDirectory();
    std::optional<FileURL> transientDirectory();
    /// The class directory; absent (logged) for classes that are not per user.
    std::optional<FileURL> containerDirectoryURLForContentClass(ContainerClass containerClass, bool transient);
    /// The same directory, for moving containers into it. Each of those that lead there from the home is judged on the
    /// descriptor from which the next is reached.
    std::optional<UsableDirectory> openClassDirectory(ContainerClass containerClass, bool transient);

private:
    ZORPerUserConfiguration(std::uint32_t userId, const Log& log, ZORFileManager& fileManager, UserHome& home)
        : userId_(userId), log_(log), fileManager_(fileManager), home_(home) {}
    /// The home as it is now; nothing is made.
    std::optional<UsableDirectory> openHome();
    std::optional<UsableDirectory> openUserBaseDirectory();
    std::optional<UsableDirectory> openTransientDirectory();
    /// Below `base`, unless that is no directory of the user's.
    UsableDirectory openBelow(const UsableDirectory& base, FileURL url, const char* function, const char* what);
    UsableDirectory judged(FileURL url, Result<platform::FileDescriptor> opened, const char* function,
                           const char* what);

    const std::uint32_t userId_;
    const Log& log_;
    ZORFileManager& fileManager_;
    UserHome& home_;
    platform::RecursiveMutex lock_;
};

// The places of everything that does not belong to one mobile user, and the class directory of each container.
//
// A directory getter makes its directory on every call, so one that was moved away is there again at the next; it logs
// when that fails and returns the place anyway. Whether a user may own a class is its callers' question.
//
// One recursive lock is held for a whole getter, directory creation included, unless the directory is a mobile user's:
// then only that user's own. The password database and a user's home are asked without it.

using ipc::UserNumbers;

class ZORGlobalConfiguration {
public:
    ZORGlobalConfiguration(const Log& log, ZORFileManager& fileManager, const platform::PasswordDatabase& passwords,
                           const UserNumbers& users);

    /// The owners of containers; never changed.
    [[nodiscard]] const UserNumbers& users() const { return users_; }

    /// The mobile user's configuration, made at the first call; nullptr for any other user (logged each time). Lives as
    /// long as this object.
    ZORPerUserConfiguration* getPerUserConfigurationForUserId(std::uint32_t userId);

    /// The home of a mobile user; nullptr for any other user. No lock; lives as long as this object.
    [[nodiscard]] UserHome* homeOf(std::uint32_t userId) const;
    /// Knows the homes of all mobile users, so that no way into one crosses a mount. A launch calls it before all else.
    void fenceHomes();
    /// False when the file system of a mobile user's home does not answer, after `fs::homePatience` at the latest. A
    /// caller that is about to take a lock that others need asks first; for a home on a local disk that costs nothing.
    /// True for everybody else.
    [[nodiscard]] bool homeAnswers(std::uint32_t userId, fs::MountFence::Asked asked = fs::MountFence::Asked::lately);

    FileURL sharedContainersDirectory();
    FileURL logDirectory();
    FileURL cachesDirectory();
    FileURL libraryDirectory();
    FileURL transientDirectory();
    FileURL transientBundleDirectory();
    FileURL stagingDirectory();
    /// The same directory, open. One that is there costs no look at the directories above it.
    UsableDirectory openStagingDirectory();
    FileURL deathrowDirectory();
    FileURL replaceDirectory();
    FileURL bundleDirectory();
    /// The place where an older system kept bundle containers, and that of one class; not made here.
    [[nodiscard]] FileURL formerBundleDirectory() const { return places_.formerBundleDirectory(); }
    [[nodiscard]] FileURL formerBundleDirectory(ContainerClass containerClass) const {
        return places_.formerBundleDirectory(containerClass);
    }
    /// Directories at or above all containers, so that each file system that holds some is that of one of them. Some
    /// may not be there.
    [[nodiscard]] std::vector<FileURL> placesOfContainers() const;
    /// DIR/tmp; the system's, not made here.
    [[nodiscard]] FileURL temporaryDirectory() const { return places_.temporaryDirectory(); }

    /// Closes the home of the daemon's own directories to everybody else, where it is the daemon's, and makes it closed
    /// where it is missing: what is staged or deleted is private. True when it was open to others.
    Result<bool> closeHomeDirectory();

    /// The class directory, made if missing; absent only for a class or user that has none, or whose home is not there.
    std::optional<FileURL> containerDirectoryURLForUser(std::uint32_t userId, ContainerClass containerClass,
                                                        bool transient);
    /// The same directory, open, for moving containers into it. If it could not be opened, its URL is for messages
    /// alone.
    std::optional<UsableDirectory> openClassDirectory(std::uint32_t userId, ContainerClass containerClass,
                                                      bool transient);
    /// The user to whom such a directory belongs; ownerUnchanged: the daemon.
    [[nodiscard]] static std::uint32_t ownerOfClassDirectory(ContainerClass containerClass, std::uint32_t userId);
    /// The same by its place; absent where no class has its directory.
    [[nodiscard]] std::optional<std::uint32_t> ownerOfClassDirectory(const FileURL& directory);

    /// Its place, made or not; nothing is made here.
    std::optional<FileURL> placeOfClass(std::uint32_t userId, ContainerClass containerClass, bool transient);

    /// The layout of an application's data container.
    [[nodiscard]] static const std::array<std::string_view, 4>& appUserDataItemNames();

private:
    /// The directory, made where it is missing; a failure is logged.
    FileURL madeDirectory(FileURL url, const DirectoryAttributes& attributes, const char* function, const char* what,
                          Intermediates intermediates = Intermediates::yes);

    const Log& log_;
    ZORFileManager& fileManager_;
    const UserNumbers users_;
    const StorePlaces places_;
    std::vector<std::unique_ptr<UserHome>> homes_; // of every mobile user, in order; never changed
    platform::RecursiveMutex lock_;
    std::map<std::uint32_t, std::unique_ptr<ZORPerUserConfiguration>> perUserConfigurations_ ZOR_GUARDED_BY(lock_);
};

} // namespace zor
