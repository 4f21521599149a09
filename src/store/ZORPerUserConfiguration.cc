// SPDX-License-Identifier: Apache-2.0
#include "store/ZORPerUserConfiguration.h"

#include "daemon/base/UserIdentity.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <climits>
#include <cstdlib>

namespace zor {

using platform::RecursiveMutexLock;

std::unique_ptr<ZORPerUserConfiguration>
ZORPerUserConfiguration::initWithUserId(std::uint32_t userId, const Log& log, ZORFileManager& fileManager,
                                        const platform::PasswordDatabase& passwords) {
    if (userId < firstMobileUserId || userId > lastMobileUserId) {
        log.write(logLevelError, __func__, "userId: %u must be in range", userId);
        return nullptr;
    }
    std::unique_ptr<ZORPerUserConfiguration> made(new ZORPerUserConfiguration(userId, log, fileManager, passwords));
    const auto home = made->userHomeDirectory();
    if (!home)
        log.write(logLevelError, __func__, "Failed to getpwuid for uid: %u", userId);
    log.write(logLevelError, __func__, "user home Dir: %s", home ? home->c_str() : "(null)");
    return made;
}

std::expected<FileURL, int> ZORPerUserConfiguration::homeOf(const platform::PasswordDatabase& passwords,
                                                            std::uint32_t userId) {
    const auto entry = passwords.entryForUserId(userId);
    if (!entry)
        return std::unexpected(entry.error());
    // A home may be reached through links that its administrator made; below it, none is followed.
    char resolved[PATH_MAX];
    const char* path = ::realpath(entry->homeDirectory.c_str(), resolved);
    if (!path && isOwnShortage(errno))
        return std::unexpected(errno);
    return FileURL::directory(path ? path : entry->homeDirectory);
}

std::optional<FileURL> ZORPerUserConfiguration::userHomeDirectory() {
    const RecursiveMutexLock held(lock_);
    if (!homeIsLookedUp_) {
        auto home = homeOf(passwords_, userId_);
        homeIsLookedUp_ = home || !isOwnShortage(home.error());
        if (home)
            userHomeDirectory_ = std::move(*home);
    }
    return userHomeDirectory_;
}

bool ZORPerUserConfiguration::isKnownToHaveNoHome() {
    const RecursiveMutexLock held(lock_);
    return !userHomeDirectory() && homeIsLookedUp_;
}

bool ZORPerUserConfiguration::existsUserBaseDirectory() {
    const auto home = userHomeDirectory();
    return home && fileManager_.itemExistsAtURL(*home);
}

UsableDirectory ZORPerUserConfiguration::judged(FileURL url, Result<platform::FileDescriptor> opened,
                                                const char* function, const char* what) {
    if (!opened)
        log_.write(logLevelError, function, "Failed to create %s dir at \"%s\": %s", what, url.c_str(),
                   opened.error().text().c_str());
    return {.url = std::move(url), .opened = std::move(opened)};
}

UsableDirectory ZORPerUserConfiguration::openBelow(const UsableDirectory& base, FileURL url, const char* function,
                                                   const char* what) {
    if (!base.opened)
        return judged(std::move(url), base.opened.error(), function, what);
    const std::string relative = url.path().substr(base.url.path().size() + 1);
    return judged(std::move(url),
                  fileManager_.openOrCreateDirectoryBelow(base.opened->get(), base.url, relative, Intermediates::yes,
                                                          {.mode = 0755, .owner = userId_}),
                  function, what);
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openUserBaseDirectory() {
    const RecursiveMutexLock held(lock_);
    const auto home = userHomeDirectory();
    if (!home)
        return std::nullopt;
    FileURL url = StorePlaces::userBaseDirectory(*home);
    auto opened = fileManager_.openOrCreateDirectoryAtURL(url, Intermediates::yes, {.mode = 0755, .owner = userId_});
    return judged(std::move(url), std::move(opened), "userBaseDirectory", "user base");
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openTransientDirectory() {
    const RecursiveMutexLock held(lock_);
    const auto base = openUserBaseDirectory();
    if (!base)
        return std::nullopt;
    return openBelow(*base, StorePlaces::userTransientDirectory(*userHomeDirectory_), "transientDirectory",
                     "transient");
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openClassDirectory(ContainerClass containerClass,
                                                                           bool transient) {
    constexpr const char* function = "containerDirectoryURLForContentClass";
    const RecursiveMutexLock held(lock_);
    if (!isPerUserClass(containerClass)) {
        log_.write(logLevelError, function, "Invalid class for a per user container directory: %llu",
                   static_cast<unsigned long long>(containerClass));
        return std::nullopt;
    }
    const auto base = transient ? openTransientDirectory() : openUserBaseDirectory();
    if (!base)
        return std::nullopt;
    return openBelow(*base, base->url.appendingDirectory(className(containerClass)), function, "container");
}

std::optional<FileURL> ZORPerUserConfiguration::userBaseDirectory() {
    auto base = openUserBaseDirectory();
    return base ? std::optional(std::move(base->url)) : std::nullopt;
}

std::optional<FileURL> ZORPerUserConfiguration::transientDirectory() {
    auto directory = openTransientDirectory();
    return directory ? std::optional(std::move(directory->url)) : std::nullopt;
}

std::optional<FileURL> ZORPerUserConfiguration::containerDirectoryURLForContentClass(ContainerClass containerClass,
                                                                                     bool transient) {
    auto directory = openClassDirectory(containerClass, transient);
    return directory ? std::optional(std::move(directory->url)) : std::nullopt;
}

} // namespace zor
