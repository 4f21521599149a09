// SPDX-License-Identifier: Apache-2.0
#include "store/ZORPerUserConfiguration.h"

#include "store/StorePlaces.h"

namespace zor {

using platform::RecursiveMutexLock;

std::unique_ptr<ZORPerUserConfiguration> ZORPerUserConfiguration::initWithUserId(std::uint32_t userId, const Log& log,
                                                                                 ZORFileManager& fileManager,
                                                                                 UserHome* home) {
    if (!home) {
        log.write(logLevelError, __func__, "userId: %u must be in range", userId);
        return nullptr;
    }
    std::unique_ptr<ZORPerUserConfiguration> made(new ZORPerUserConfiguration(userId, log, fileManager, *home));
    const auto seen = home->look();
    if (seen.state == UserHome::State::noAccount || seen.state == UserHome::State::unknown)
        log.write(logLevelError, __func__, "Failed to getpwuid for uid: %u", userId);
    log.write(logLevelError, __func__, "user home Dir: %s", seen.directory ? seen.directory->c_str() : "(null)");
    return made;
}

std::optional<FileURL> ZORPerUserConfiguration::userHomeDirectory() {
    const auto directory = home_.lookIfDue().directory;
    return directory ? std::optional(*directory) : std::nullopt;
}

bool ZORPerUserConfiguration::existsUserBaseDirectory() {
    return home_.look().state == UserHome::State::present;
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openHome() {
    auto [seen, opened] = home_.lookAndOpen();
    const auto& home = seen.directory;
    if (!home)
        return std::nullopt;
    if (!opened)
        return judged(*home, posixError(ZOR_HERE, opened.error(), "open of the home failed: %s", opened.error().text()),
                      "userHomeDirectory", "user base");
    return UsableDirectory{.url = *home, .opened = std::move(*opened)};
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
    const std::string& top = base.url.path();
    const std::string relative = url.path().substr(top == "/" ? 1 : top.size() + 1);
    return judged(std::move(url),
                  fileManager_.openOrCreateDirectoryBelow(base.opened->get(), base.url, relative, Intermediates::yes,
                                                          {.mode = 0755, .owner = userId_}),
                  function, what);
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openUserBaseDirectory() {
    const RecursiveMutexLock held(lock_);
    const auto home = openHome();
    if (!home)
        return std::nullopt;
    return openBelow(*home, StorePlaces::userBaseDirectory(home->url), "userBaseDirectory", "user base");
}

std::optional<UsableDirectory> ZORPerUserConfiguration::openTransientDirectory() {
    const RecursiveMutexLock held(lock_);
    const auto base = openUserBaseDirectory();
    if (!base)
        return std::nullopt;
    return openBelow(*base, StorePlaces::userTransientDirectory(base->url.deletingLastPathComponent()),
                     "transientDirectory", "transient");
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
