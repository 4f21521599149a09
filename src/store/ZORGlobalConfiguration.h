// SPDX-License-Identifier: Apache-2.0
// The places of everything that does not belong to one mobile user, and the class directory of each container.
//
// A directory getter makes its directory on every call, so one that was moved away is there again at the next; it logs
// when that fails and returns the place anyway. Whether a user may own a class is its callers' question.
//
// One recursive lock is held for a whole getter, directory creation included, unless the directory is a mobile user's:
// then only that user's own. The password database and a user's home are asked without it.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Mutex.h"
#include "fs/ZORFileManager.h"
#include "ipc/UserNumbers.h"
#include "platform/Device.h"
#include "store/StorePlaces.h"
#include "store/ZORPerUserConfiguration.h"

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <string_view>
#include <vector>

namespace zor {

using ipc::UserNumbers;

class ZORGlobalConfiguration {
public:
    ZORGlobalConfiguration(const Log& log, ZORFileManager& fileManager, const platform::PasswordDatabase& passwords,
                           const UserNumbers& users);

    /// The owners of containers; never changed.
    [[nodiscard]] const UserNumbers& users() const { return users_; }

    /// The user's configuration, made at the first call; nullptr for who is none (tried and logged again each time).
    /// Lives as long as this object.
    ZORPerUserConfiguration* getPerUserConfigurationForUserId(std::uint32_t userId);

    /// The home of a mobile user, or nullptr for who is none. No lock; lives as long as this object.
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
    /// where it is missing: what is staged or deleted is private. Whether it was open.
    Result<bool> closeHomeDirectory();

    /// The class directory, made if missing; absent only for a class or user that has none, or whose home is not there.
    std::optional<FileURL> containerDirectoryURLForUser(std::uint32_t userId, ContainerClass containerClass,
                                                        bool transient);
    /// The same directory, open, for moving containers into it: with what it failed for, its URL is of use for messages
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
