// SPDX-License-Identifier: Apache-2.0
#include "store/ZORPerUserConfiguration.h"

#include "base/Format.h"
#include "base/ZORError.h"
#include "fs/ItemStatus.h"
#include "os/CoarseClock.h"
#include "os/FileDescriptor.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <optional>
#include <string>
#include <unistd.h>

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
