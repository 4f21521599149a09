// SPDX-License-Identifier: Apache-2.0
// The places of the containers of one mobile user. Getters never fail: they make their directory on every call, log
// when they cannot, and return the place anyway. A home that is not there makes every place below it absent; the home
// itself is never made, nor anything on the way to it.
//
// Its own recursive lock is held for a whole getter. Lock order: the global configuration's lock before this one.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Mutex.h"
#include "fs/ZORFileManager.h"
#include "store/UserHome.h"

#include <memory>
#include <optional>

namespace zor {

/// A directory that a getter has made or found, and whether it may be used. An open one was judged.
struct UsableDirectory {
    FileURL url;
    Result<platform::FileDescriptor> opened;
};

class ZORPerUserConfiguration {
public:
    /// nullptr, with a log line, for who is no mobile user: `home` is null.
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

} // namespace zor
