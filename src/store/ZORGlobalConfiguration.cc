// SPDX-License-Identifier: Apache-2.0
#include "store/ZORGlobalConfiguration.h"

#include "daemon/base/UserIdentity.h"
#include "store/Names.h"

namespace zor {

using platform::RecursiveMutexLock;

namespace {

/// Files of the daemon itself stay readable while the device is locked.
constexpr DirectoryAttributes ownDirectory{.mode = 0755, .protectionClass = 4};
constexpr DirectoryAttributes plainDirectory{.mode = 0755};
constexpr DirectoryAttributes bundleOwnedDirectory{.mode = 0755, .owner = bundleOwnerUserId};

} // namespace

ZORGlobalConfiguration::ZORGlobalConfiguration(const Log& log, ZORFileManager& fileManager,
                                               const platform::PasswordDatabase& passwords)
    : log_(log), fileManager_(fileManager), passwords_(passwords), places_(fileManager.resolver()) {}

void ZORGlobalConfiguration::makeDirectory(const FileURL& url, const DirectoryAttributes& attributes,
                                           const char* function, const char* what, Intermediates intermediates) {
    const auto made = fileManager_.createDirectoryAtURL(url, intermediates, attributes);
    if (!made)
        log_.write(logLevelError, function, "Failed to create %s at \"%s\": %s", what, url.c_str(),
                   made.error().text().c_str());
}

ZORPerUserConfiguration* ZORGlobalConfiguration::getPerUserConfigurationForUserId(std::uint32_t userId) {
    const RecursiveMutexLock held(lock_);
    const auto known = perUserConfigurations_.find(userId);
    if (known != perUserConfigurations_.end())
        return known->second.get();
    auto made = ZORPerUserConfiguration::initWithUserId(userId, log_, fileManager_, passwords_);
    if (!made)
        return nullptr;
    return perUserConfigurations_.emplace(userId, std::move(made)).first->second.get();
}

FileURL ZORGlobalConfiguration::sharedContainersDirectory() {
    const RecursiveMutexLock held(lock_);
    makeDirectory(places_.sharedContainersDirectory(), plainDirectory, __func__, "shared container dir");
    return places_.sharedContainersDirectory();
}

FileURL ZORGlobalConfiguration::logDirectory() {
    FileURL url = places_.logDirectory();
    makeDirectory(url, ownDirectory, __func__, "log directory");
    return url;
}

FileURL ZORGlobalConfiguration::cachesDirectory() {
    const RecursiveMutexLock held(lock_);
    FileURL url = places_.cachesDirectory();
    makeDirectory(url, ownDirectory, __func__, "cache dir");
    return url;
}

FileURL ZORGlobalConfiguration::libraryDirectory() {
    const RecursiveMutexLock held(lock_);
    FileURL url = places_.libraryDirectory();
    makeDirectory(url, ownDirectory, __func__, "library dir");
    return url;
}

FileURL ZORGlobalConfiguration::transientDirectory() {
    const RecursiveMutexLock held(lock_);
    cachesDirectory();
    FileURL url = places_.transientDirectory();
    makeDirectory(url, plainDirectory, __func__, "transient dir");
    return url;
}

FileURL ZORGlobalConfiguration::stagingDirectory() {
    const RecursiveMutexLock held(lock_);
    cachesDirectory();
    FileURL url = places_.stagingDirectory();
    makeDirectory(url, plainDirectory, __func__, "staging dir");
    return url;
}

FileURL ZORGlobalConfiguration::deathrowDirectory() {
    const RecursiveMutexLock held(lock_);
    cachesDirectory();
    FileURL url = places_.deathrowDirectory();
    makeDirectory(url, plainDirectory, __func__, "deathrow dir");
    return url;
}

FileURL ZORGlobalConfiguration::replaceDirectory() {
    const RecursiveMutexLock held(lock_);
    libraryDirectory();
    FileURL url = places_.replaceDirectory();
    makeDirectory(url, plainDirectory, __func__, "replace dir");
    return url;
}

FileURL ZORGlobalConfiguration::bundleDirectory() {
    const RecursiveMutexLock held(lock_);
    sharedContainersDirectory();
    FileURL url = places_.bundleDirectory();
    makeDirectory(url, plainDirectory, __func__, "bundle dir");
    return url;
}

FileURL ZORGlobalConfiguration::transientBundleDirectory() {
    const RecursiveMutexLock held(lock_);
    // One level at a time, never the home itself: the home of another service is not this daemon's to make.
    FileURL url = places_.brevadHomeDirectory();
    for (const std::string_view level : names::cachesLevels) {
        url = url.appendingDirectory(level);
        makeDirectory(url, bundleOwnedDirectory, __func__, "transient bundle dir", Intermediates::no);
    }
    return url;
}

std::optional<FileURL> ZORGlobalConfiguration::containerDirectoryURLForUser(std::uint32_t userId,
                                                                            ContainerClass containerClass,
                                                                            bool transient) {
    const RecursiveMutexLock held(lock_);
    const bool bundle = isBundleClass(containerClass);
    if (!bundle && !isSystemClass(containerClass)) {
        ZORPerUserConfiguration* user = getPerUserConfigurationForUserId(userId);
        return user ? user->containerDirectoryURLForContentClass(containerClass, transient) : std::nullopt;
    }
    FileURL base;
    if (!transient)
        base = sharedContainersDirectory();
    else
        base = bundle ? transientBundleDirectory() : transientDirectory();
    FileURL url = base.appendingDirectory(className(containerClass));
    makeDirectory(url, bundle ? bundleOwnedDirectory : plainDirectory, __func__, "container dir");
    return url;
}

std::optional<FileURL> ZORGlobalConfiguration::placeOfClass(std::uint32_t userId, ContainerClass containerClass,
                                                            bool transient) {
    std::optional<FileURL> home;
    if (isPerUserClass(containerClass)) {
        const RecursiveMutexLock held(lock_);
        ZORPerUserConfiguration* user = getPerUserConfigurationForUserId(userId);
        home = user ? user->userHomeDirectory() : std::nullopt;
    }
    const auto base = places_.baseOfClass(containerClass, transient, home);
    return base ? std::optional(base->appendingDirectory(className(containerClass))) : std::nullopt;
}

const std::array<std::string_view, 4>& ZORGlobalConfiguration::appUserDataItemNames() {
    static constexpr std::array<std::string_view, 4> items = {"Documents", "Library", "tmp", "Tillwerk"};
    return items;
}

} // namespace zor
