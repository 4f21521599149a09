// SPDX-License-Identifier: Apache-2.0
#include "store/Configuration.h"

#include "base/Log.h"
#include "base/ZORError.h"
#include "fs/MountFences.h"
#include "ipc/Protocol.h"
#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <optional>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace zor {

using platform::coarseMilliseconds;
using platform::MutexLock;

namespace {

/// How long a home that was there is taken to be there still by who only reads what is cached.
constexpr std::int64_t lookEveryMilliseconds = 1000;

/// The path without links of a home that the kernel remembers and that lies on a disk of this machine: nobody is asked,
/// so a busy machine takes none for dead.
std::optional<FileURL> rememberedPath(const std::string& home) {
    const auto opened = platform::openRemembered(home.c_str());
    if (!opened || fs::kindOfMount(fs::mountNumber(opened->get())) != fs::MountKind::local)
        return std::nullopt;
    char path[PATH_MAX];
    const ssize_t bytes =
        ::readlinkat(AT_FDCWD, formatted("/proc/self/fd/%d", opened->get()).c_str(), path, sizeof path);
    if (bytes <= 0 || static_cast<std::size_t>(bytes) == sizeof path || path[0] != '/')
        return std::nullopt;
    return FileURL::directory(std::string(path, static_cast<std::size_t>(bytes)));
}

ErrnoOr<FileURL> resolved(const platform::PasswordEntry& entry, HomeQuestion& question) {
    if (auto path = rememberedPath(entry.homeDirectory))
        return std::move(*path);
    // A home may be reached through links that its administrator made; below it, none is followed.
    const auto path = question.ask(
        [home = entry.homeDirectory]() -> ErrnoOr<std::string> {
            char whole[PATH_MAX];
            if (!::realpath(home.c_str(), whole))
                return Errno::last();
            return whole;
        },
        fs::homePatience);
    if (!path)
        return Errno(EHOSTDOWN);
    return FileURL::directory(TRY(*path));
}

} // namespace

ErrnoOr<FileURL> UserHome::pathOf(const platform::PasswordDatabase& passwords, std::uint32_t userId,
                                  HomeQuestion& question) {
    return resolved(TRY(passwords.entryForUserId(userId)), question);
}

UserHome::Found UserHome::find() {
    const auto entry = passwords_.entryForUserId(userId_);
    if (!entry)
        return {.state = entry.error() == ENOENT ? State::noAccount : State::unknown, .directory = {}, .id = {}};
    const auto path = resolved(*entry, wayToHome_);
    if (path)
        resolver_.fence(*path, fs::MountFence::Kind::home);
    const auto opened = path ? resolver_.openDirectoryPath(*path) : path.error();
    const auto id = opened ? fs::directoryIdOf(opened->get()) : opened.error();
    if (!id)
        return {.state = isOwnShortage(id.error()) ? State::unknown : State::missing, .directory = {}, .id = {}};
    return {.state = State::present, .directory = std::make_shared<const FileURL>(*path), .id = *id};
}

bool UserHome::Found::isAs(const Found& other) const {
    return state == other.state && id == other.id && !directory == !other.directory &&
           (!directory || directory->path() == other.directory->path());
}

UserHome::Seen UserHome::seenOf(const Found& found) const {
    return {.state = found.state, .directory = found.directory, .generation = generation()};
}

UserHome::Opened UserHome::lookAndOpen() {
    Found before;
    {
        const MutexLock held(mutex_);
        before = found_;
    }
    // The database is asked when there is nothing yet, or when what it named has changed.
    auto opened = before.directory ? resolver_.openDirectoryPath(*before.directory) : Errno(ENOENT);
    const auto id = opened ? fs::directoryIdOf(opened->get()) : opened.error();
    const bool same = id && *id == before.id;
    Found now = same ? before : find();
    if (!same)
        opened = now.directory ? resolver_.openDirectoryPath(*now.directory) : Errno(ENOENT);
    const MutexLock held(mutex_);
    dueMilliseconds_ = now.state == State::present ? coarseMilliseconds() + lookEveryMilliseconds : 0;
    // A look that fails leaves the state that was known.
    if (now.state == State::unknown)
        return {.seen = {.state = State::unknown, .directory = {}, .generation = generation()},
                .directory = std::move(opened)};
    if (!now.isAs(found_)) {
        if (found_.state != State::unknown)
            log_.write(logLevelNotice, "UserHome", "The home of user %u is now %s", userId_,
                       now.directory ? now.directory->c_str() : "(null)");
        found_ = std::move(now);
        generation_.fetch_add(1, std::memory_order_acq_rel);
    }
    return {.seen = seenOf(found_), .directory = std::move(opened)};
}

UserHome::Seen UserHome::lookIfDue() {
    {
        const MutexLock held(mutex_);
        if (found_.state == State::present && coarseMilliseconds() < dueMilliseconds_)
            return seenOf(found_);
    }
    return look();
}

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
    // A healthy start says both for every user of the range, at the level of an error; in the system's journal they are
    // none.
    std::optional<LogCodeScope> healthy;
    if (seen.state != UserHome::State::unknown)
        healthy.emplace(seen.directory ? ErrorCode::success : ErrorCode::notFound);
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

using platform::RecursiveMutexLock;

namespace {

/// Files of the daemon itself stay readable while the device is locked. The home above them may be missing.
constexpr DirectoryAttributes ownDirectory{
    .mode = 0755, .protectionClass = 4, .intermediateMode = platform::closedMode};
constexpr DirectoryAttributes plainDirectory{.mode = 0755};

DirectoryAttributes ownedBy(std::uint32_t installer) {
    return {.mode = 0755, .owner = installer};
}

} // namespace

ZORGlobalConfiguration::ZORGlobalConfiguration(const Log& log, ZORFileManager& fileManager,
                                               const platform::PasswordDatabase& passwords, const UserNumbers& users)
    : log_(log), fileManager_(fileManager), users_(users), places_(fileManager.resolver()) {
    places_.fenceMounts(fileManager);
    for (std::uint32_t userId = users_.first; userId <= users_.last; ++userId)
        homes_.push_back(std::make_unique<UserHome>(userId, log, fileManager.resolver(), passwords));
}

UserHome* ZORGlobalConfiguration::homeOf(std::uint32_t userId) const {
    return users_.isMobile(userId) ? homes_[userId - users_.first].get() : nullptr;
}

FileURL ZORGlobalConfiguration::madeDirectory(FileURL url, const DirectoryAttributes& attributes, const char* function,
                                              const char* what, Intermediates intermediates) {
    const auto made = fileManager_.createDirectoryAtURL(url, intermediates, attributes);
    if (!made)
        log_.write(logLevelError, function, "Failed to create %s at \"%s\": %s", what, url.c_str(),
                   made.error().text().c_str());
    return url;
}

ZORPerUserConfiguration* ZORGlobalConfiguration::getPerUserConfigurationForUserId(std::uint32_t userId) {
    {
        const RecursiveMutexLock held(lock_);
        const auto known = perUserConfigurations_.find(userId);
        if (known != perUserConfigurations_.end())
            return known->second.get();
    }
    // The password database and the home may be slow; nobody else waits for them.
    auto made = ZORPerUserConfiguration::initWithUserId(userId, log_, fileManager_, homeOf(userId));
    if (!made)
        return nullptr;
    const RecursiveMutexLock held(lock_);
    return perUserConfigurations_.try_emplace(userId, std::move(made)).first->second.get();
}

void ZORGlobalConfiguration::fenceHomes() {
    for (const auto& home : homes_)
        (void)home->look();
}

bool ZORGlobalConfiguration::homeAnswers(std::uint32_t userId, fs::MountFence::Asked asked) {
    UserHome* const home = homeOf(userId);
    const auto directory = home ? home->lookIfDue().directory : nullptr;
    return !directory || fileManager_.resolver().answers(*directory, asked);
}

FileURL ZORGlobalConfiguration::sharedContainersDirectory() {
    const RecursiveMutexLock held(lock_);
    return madeDirectory(places_.sharedContainersDirectory(), plainDirectory, __func__, "shared container dir");
}

FileURL ZORGlobalConfiguration::logDirectory() {
    return madeDirectory(places_.logDirectory(), ownDirectory, __func__, "log directory");
}

FileURL ZORGlobalConfiguration::cachesDirectory() {
    const RecursiveMutexLock held(lock_);
    return madeDirectory(places_.cachesDirectory(), ownDirectory, __func__, "cache dir");
}

FileURL ZORGlobalConfiguration::libraryDirectory() {
    const RecursiveMutexLock held(lock_);
    return madeDirectory(places_.libraryDirectory(), ownDirectory, __func__, "library dir");
}

FileURL ZORGlobalConfiguration::transientDirectory() {
    const RecursiveMutexLock held(lock_);
    cachesDirectory();
    return madeDirectory(places_.transientDirectory(), plainDirectory, __func__, "transient dir");
}

FileURL ZORGlobalConfiguration::stagingDirectory() {
    return openStagingDirectory().url;
}

UsableDirectory ZORGlobalConfiguration::openStagingDirectory() {
    const RecursiveMutexLock held(lock_);
    FileURL url = places_.stagingDirectory();
    auto opened = fileManager_.openOrCreateDirectoryAtURL(url, Intermediates::no, plainDirectory);
    if (!opened && opened.error().isPosix(ENOENT)) {
        cachesDirectory();
        opened = fileManager_.openOrCreateDirectoryAtURL(url, Intermediates::yes, plainDirectory);
    }
    if (!opened)
        log_.write(logLevelError, "stagingDirectory", "Failed to create %s at \"%s\": %s", "staging dir", url.c_str(),
                   opened.error().text().c_str());
    return {.url = std::move(url), .opened = std::move(opened)};
}

FileURL ZORGlobalConfiguration::deathrowDirectory() {
    const RecursiveMutexLock held(lock_);
    cachesDirectory();
    return madeDirectory(places_.deathrowDirectory(), plainDirectory, __func__, "deathrow dir");
}

FileURL ZORGlobalConfiguration::replaceDirectory() {
    const RecursiveMutexLock held(lock_);
    libraryDirectory();
    return madeDirectory(places_.replaceDirectory(), plainDirectory, __func__, "replace dir");
}

FileURL ZORGlobalConfiguration::bundleDirectory() {
    const RecursiveMutexLock held(lock_);
    sharedContainersDirectory();
    // The migration of an older system's bundles gives the installer the whole place.
    return madeDirectory(places_.bundleDirectory(), {.mode = 0755, .otherOwner = users_.installer}, __func__,
                         "bundle dir");
}

FileURL ZORGlobalConfiguration::transientBundleDirectory() {
    const RecursiveMutexLock held(lock_);
    // One level at a time, never the home itself: the home of another service is not this daemon's to make.
    FileURL url = places_.brevadHomeDirectory();
    for (const std::string_view level : names::cachesLevels) {
        url = madeDirectory(url.appendingDirectory(level), ownedBy(users_.installer), __func__, "transient bundle dir",
                            Intermediates::no);
    }
    return url;
}

std::vector<FileURL> ZORGlobalConfiguration::placesOfContainers() const {
    std::vector<FileURL> places = places_.placesOfSharedContainers();
    for (const auto& home : homes_)
        if (auto seen = home->look(); seen.state == UserHome::State::present && seen.directory)
            places.push_back(*seen.directory);
    return places;
}

Result<bool> ZORGlobalConfiguration::closeHomeDirectory() {
    const FileURL& home = places_.homeDirectory();
    const fs::PathResolver& resolver = fileManager_.resolver();
    const auto opened = resolver.openDirectoryPath(home);
    if (!opened && opened.error() == ENOENT) {
        TRY(fileManager_.createDirectoryAtURL(home, Intermediates::yes, {.mode = platform::closedMode}));
        return false;
    }
    struct stat status{};
    Errno failure = !opened ? opened.error() : ::fstat(opened->get(), &status) != 0 ? Errno::last() : Errno();
    const bool isOpen = !failure && (status.st_mode & (S_IRWXG | S_IRWXO)) != 0;
    if (!failure && isOpen && status.st_uid == ::geteuid())
        failure = fileManager_.disk().changeMode(opened->get(), platform::closedMode);
    else if (isOpen)
        failure = Errno(EPERM);
    if (failure)
        return posixError(ZOR_HERE, failure, "%s cannot be closed to others, who may read what is deleted: %s",
                          home.c_str(), failure.text());
    return isOpen;
}

std::uint32_t ZORGlobalConfiguration::ownerOfClassDirectory(ContainerClass containerClass, std::uint32_t userId) {
    return isSystemClass(containerClass) ? ownerUnchanged : userId;
}

std::optional<std::uint32_t> ZORGlobalConfiguration::ownerOfClassDirectory(const FileURL& directory) {
    const auto isOf = [&](ContainerClass containerClass, const std::optional<FileURL>& home) {
        for (const bool transient : {false, true}) {
            const auto base = places_.baseOfClass(containerClass, transient, home);
            if (base && base->appendingDirectory(className(containerClass)) == directory)
                return true;
        }
        return false;
    };
    std::vector<ContainerClass> ofUsers;
    for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number) {
        const auto containerClass = static_cast<ContainerClass>(number);
        if (isPerUserClass(containerClass))
            ofUsers.push_back(containerClass);
        else if (isOf(containerClass, std::nullopt))
            return ownerOfClassDirectory(containerClass, users_.installer);
    }
    for (std::uint32_t userId = users_.first; userId <= users_.last; ++userId) {
        ZORPerUserConfiguration* const user = getPerUserConfigurationForUserId(userId);
        const auto home = user ? user->userHomeDirectory() : std::nullopt;
        if (home &&
            std::ranges::any_of(ofUsers, [&](ContainerClass containerClass) { return isOf(containerClass, home); }))
            return userId;
    }
    return std::nullopt;
}

std::optional<FileURL> ZORGlobalConfiguration::containerDirectoryURLForUser(std::uint32_t userId,
                                                                            ContainerClass containerClass,
                                                                            bool transient) {
    auto directory = openClassDirectory(userId, containerClass, transient);
    return directory ? std::optional(std::move(directory->url)) : std::nullopt;
}

std::optional<UsableDirectory>
ZORGlobalConfiguration::openClassDirectory(std::uint32_t userId, ContainerClass containerClass, bool transient) {
    const bool bundle = isBundleClass(containerClass);
    if (!bundle && !isSystemClass(containerClass)) {
        // Outside the lock: what makes this user's home wait is nobody else's.
        ZORPerUserConfiguration* user = getPerUserConfigurationForUserId(userId);
        return user ? user->openClassDirectory(containerClass, transient) : std::nullopt;
    }
    const RecursiveMutexLock held(lock_);
    FileURL base;
    if (!transient)
        base = sharedContainersDirectory();
    else
        base = bundle ? transientBundleDirectory() : transientDirectory();
    FileURL url = base.appendingDirectory(className(containerClass));
    auto opened = fileManager_.openOrCreateDirectoryAtURL(url, Intermediates::yes,
                                                          bundle ? ownedBy(users_.installer) : plainDirectory);
    if (!opened)
        log_.write(logLevelError, "containerDirectoryURLForUser", "Failed to create container dir at \"%s\": %s",
                   url.c_str(), opened.error().text().c_str());
    return UsableDirectory{.url = std::move(url), .opened = std::move(opened)};
}

std::optional<FileURL> ZORGlobalConfiguration::placeOfClass(std::uint32_t userId, ContainerClass containerClass,
                                                            bool transient) {
    std::optional<FileURL> home;
    if (isPerUserClass(containerClass)) {
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
