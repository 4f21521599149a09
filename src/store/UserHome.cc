// SPDX-License-Identifier: Apache-2.0
#include "store/UserHome.h"

#include "base/Format.h"
#include "base/ZORError.h"
#include "fs/ItemStatus.h"
#include "os/CoarseClock.h"
#include "os/Openat2.h"

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

} // namespace zor
