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

void ZORPerUserConfiguration::makeDirectory(const FileURL& url, const char* function, const char* what) {
    const auto made = fileManager_.createDirectoryAtURL(url, Intermediates::yes, {.mode = 0755, .owner = userId_});
    if (!made)
        log_.write(logLevelError, function, "Failed to create %s dir at \"%s\": %s", what, url.c_str(),
                   made.error().text().c_str());
}

std::optional<FileURL> ZORPerUserConfiguration::userBaseDirectory() {
    const RecursiveMutexLock held(lock_);
    const auto home = userHomeDirectory();
    if (!home)
        return std::nullopt;
    FileURL url = StorePlaces::userBaseDirectory(*home);
    makeDirectory(url, __func__, "user base");
    return url;
}

std::optional<FileURL> ZORPerUserConfiguration::transientDirectory() {
    const RecursiveMutexLock held(lock_);
    if (!userBaseDirectory())
        return std::nullopt;
    FileURL url = StorePlaces::userTransientDirectory(*userHomeDirectory_);
    makeDirectory(url, __func__, "transient");
    return url;
}

std::optional<FileURL> ZORPerUserConfiguration::containerDirectoryURLForContentClass(ContainerClass containerClass,
                                                                                     bool transient) {
    const RecursiveMutexLock held(lock_);
    if (!isPerUserClass(containerClass)) {
        log_.write(logLevelError, __func__, "Invalid class for a per user container directory: %llu",
                   static_cast<unsigned long long>(containerClass));
        return std::nullopt;
    }
    const auto base = transient ? transientDirectory() : userBaseDirectory();
    if (!base)
        return std::nullopt;
    FileURL url = base->appendingDirectory(className(containerClass));
    makeDirectory(url, __func__, "container");
    return url;
}

} // namespace zor
