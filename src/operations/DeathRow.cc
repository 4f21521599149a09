// SPDX-License-Identifier: Apache-2.0
#include "operations/DeathRow.h"

#include "fs/AtomicFile.h"
#include "fs/FileSystemDeathRow.h"
#include "fs/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <unistd.h>

namespace zor {

namespace {

constexpr const char* moveFunction = "_moveItemAtURLToDeathRow";
/// Somebody may remove the fresh directory before the item is in it. That often in a row it is no accident.
constexpr int directoriesTriedMax = 16;

bool isMissing(int directory, const FileURL& url) {
    const auto item =
        platform::openBeneathOnMount(directory, std::string(url.lastPathComponent()).c_str(), O_PATH | O_NOFOLLOW);
    return !item && item.error() == ENOENT;
}

/// Whether an item that could not be moved for that reason may be hidden beside itself. Its name on death row may be
/// free under another; what is missing, or another's, is not to be moved at all; and what an own shortage stops, it
/// would stop again.
bool canBeHidden(const ZORError& error) {
    const bool isNameTaken = error.isPosix(ENOTEMPTY) || error.isPosix(EEXIST);
    return !isNameTaken && !error.isPosix(ENOENT) && !error.isPosix(DeathRow::notTheContainer) &&
           !error.isOwnShortage();
}

/// A directory of another user's. Anything else in a container's place its owner may remove anyway. Without root's
/// power all is the daemon's.
bool isAnothers(const struct stat& status, std::uint32_t owner) {
    return ::geteuid() == 0 && S_ISDIR(status.st_mode) && status.st_uid != owner;
}

} // namespace

bool DeathRow::isOf(int directory, std::uint32_t owner) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && !isAnothers(status, owner);
}

Result<void> DeathRow::_moveItemAtURLToDeathRow(const FileURL& url, StartDeletionThread startDeletionThread,
                                                std::optional<std::uint32_t> owner) {
    ZORFileManager& fileManager = needs_.fileManager;
    const FileURL deathRow = needs_.configuration.deathrowDirectory();
    for (int tried = 0;; ++tried) {
        std::optional<FileURL> unique;
        // A pass that met the fresh directory before what comes into it has been judged would remove that with it.
        const auto moved = [&]() -> Result<Row> {
            const platform::MutexLock moving(moving_);
            auto made = fileManager.createTemporaryDirectoryInDirectoryURL(deathRow);
            if (!made)
                return std::move(made).error();
            const FileURL destination = made->appendingDirectory(url.lastPathComponent());
            unique.emplace(std::move(*made));
            return condemn(url, destination, owner, moving);
        }();
        if (!unique)
            return makeError(needs_.log, {moveFunction, __LINE__}, ErrorCode::moveToDeathRowFailed, &moved.error(),
                             LogFlag::yes, "Failed to create unique directory at: %s", url.c_str());
        if (moved && *moved != Row::ofRoot)
            (void)fileManager.removeItemAtURL(unique);
        if (moved) {
            if (startDeletionThread == StartDeletionThread::yes || *moved == Row::besideItself)
                deleteContainersOnDeathRowWithCompletion(nullptr);
            return {};
        }
        // Only a missing source counts as success. When it is the unique directory that is missing, another one is
        // made.
        const bool somethingMissing = moved.error().isPosix(ENOENT);
        if (somethingMissing && fileManager.itemDoesNotExistAtURL(url))
            return {};
        if (somethingMissing && fileManager.itemDoesNotExistAtURL(*unique) && tried < directoriesTriedMax)
            continue;
        return makeError(needs_.log, {moveFunction, __LINE__}, ErrorCode::moveToDeathRowFailed, &moved.error(),
                         LogFlag::yes, "Failed to move item at: %s to: %s", url.c_str(),
                         unique->appendingDirectory(url.lastPathComponent()).c_str());
    }
}

Result<DeathRow::Row> DeathRow::condemn(const FileURL& url, const FileURL& destination,
                                        std::optional<std::uint32_t> owner) {
    auto moved = [&] {
        const platform::MutexLock moving(moving_);
        return condemn(url, destination, owner, moving);
    }();
    if (moved && *moved == Row::besideItself)
        deleteContainersOnDeathRowWithCompletion(nullptr); // nobody else asks for it
    return moved;
}

Result<DeathRow::Row> DeathRow::condemn(const FileURL& url, const FileURL& destination,
                                        std::optional<std::uint32_t> owner, const platform::MutexLock& /*moving*/) {
    const auto from = needs_.fileManager.resolver().openParent(url);
    const auto to = needs_.fileManager.resolver().openParent(destination);
    if (!from || !to) {
        const Errno error = from ? to.error() : from.error();
        return posixError({moveFunction, __LINE__}, error, "open of %s failed: %s",
                          (from ? destination : url).deletingLastPathComponent().c_str(), error.text());
    }
    if (owner)
        TRY(judgeOwner(from->directory.get(), url, *owner));
    const auto renamed = needs_.fileManager.renameItem(from->directory.get(), url, to->directory.get(), destination);
    if (renamed) {
        if (owner)
            TRY(putBackIfAnothers(from->directory.get(), url, to->directory.get(), destination, *owner));
        return Row::ofRoot;
    }
    const auto onItsFileSystem = renamed.error().isPosix(EXDEV)
                                     ? condemnOnItsFileSystem(from->directory.get(), url, owner)
                                     : Result<void>(renamed);
    if (onItsFileSystem)
        return Row::ofFileSystem;
    if (!canBeHidden(onItsFileSystem.error()))
        return onItsFileSystem.error();
    TRY(hideBesideItself(from->directory.get(), url, owner));
    return Row::besideItself;
}

Result<void> DeathRow::hideBesideItself(int from, const FileURL& url, std::optional<std::uint32_t> owner) {
    // Its name is one that boots know, and that no listing shows.
    const FileURL hidden = url.deletingLastPathComponent().appendingDirectory(fs::uniqueName(fs::copyPrefix));
    const Errno renamed = needs_.fileManager.disk().rename(from, std::string(url.lastPathComponent()).c_str(), from,
                                                           std::string(hidden.lastPathComponent()).c_str(), 0);
    if (renamed)
        return posixError({moveFunction, __LINE__}, renamed, "rename of %s to %s failed: %s", url.c_str(),
                          hidden.c_str(), renamed.text());
    if (owner)
        TRY(putBackIfAnothers(from, url, from, hidden, *owner));
    {
        const platform::MutexLock held(hiddenMutex_);
        hidden_.push_back({.url = hidden, .owner = owner});
    }
    return {};
}

Result<void> DeathRow::condemnOnItsFileSystem(int from, const FileURL& url, std::optional<std::uint32_t> owner) {
    ZORFileManager& fileManager = needs_.fileManager;
    const auto failed = [&](const FileURL& row, Errno error) {
        return posixError({moveFunction, __LINE__}, error, "death row %s cannot be used: %s", row.c_str(),
                          error.text());
    };
    const auto top = fs::topOfMount(fileManager.resolver(), url.deletingLastPathComponent());
    if (!top)
        return failed(url.deletingLastPathComponent(), top.error());
    const FileURL row = fs::deathRowBelow(top->url);
    for (int tried = 0;; ++tried) {
        const auto opened = fs::openOrMakeDeathRow(fileManager.disk(), top->directory.get());
        // Its owner may have renamed the directory that holds the row.
        const bool again = tried < directoriesTriedMax && !isMissing(from, url);
        if (!opened && opened.error() == ENOENT && again)
            continue;
        if (!opened)
            return failed(row, opened.error());
        const FileURL destination = row.appendingDirectory(fs::uniqueName("temp."));
        const auto renamed = fileManager.renameItem(from, url, opened->get(), destination);
        if (!renamed && renamed.error().isPosix(ENOENT) && again)
            continue;
        TRY(renamed);
        return owner ? putBackIfAnothers(from, url, opened->get(), destination, *owner) : Result<void>();
    }
}

Result<void> DeathRow::judgeOwner(int directory, const FileURL& url, std::uint32_t owner) {
    const auto item =
        platform::openBeneathOnMount(directory, std::string(url.lastPathComponent()).c_str(), O_PATH | O_NOFOLLOW);
    struct stat status{};
    if (!item || ::fstat(item->get(), &status) != 0) {
        const Errno error = item ? Errno::last() : item.error() == EXDEV ? Errno(EBUSY) : item.error();
        return posixError({moveFunction, __LINE__}, error, "open of %s failed: %s", url.c_str(), error.text());
    }
    // A power cut may have kept a directory that the daemon made and lost who was to own it. An empty one is nobody's
    // loss.
    const bool isHalfMade = status.st_uid == ::geteuid() && S_ISDIR(status.st_mode);
    if (!isAnothers(status, owner) || (isHalfMade && !needs_.fileManager.disk().removeDirectory(
                                                         directory, std::string(url.lastPathComponent()).c_str())))
        return {};
    return posixError({moveFunction, __LINE__}, Errno(notTheContainer),
                      "%s belongs to user %u: it is not the container, which is user %u's", url.c_str(), status.st_uid,
                      owner);
}

Result<void> DeathRow::putBackIfAnothers(int from, const FileURL& url, int to, const FileURL& destination,
                                         std::uint32_t owner) {
    const std::string name(destination.lastPathComponent());
    struct stat status{};
    if (::fstatat(to, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0 || !isAnothers(status, owner))
        return {};
    platform::Disk& disk = needs_.fileManager.disk();
    const std::string before(url.lastPathComponent());
    // Its place may have been taken meanwhile.
    std::string back = before;
    Errno renamed = disk.rename(to, name.c_str(), from, back.c_str(), RENAME_NOREPLACE);
    if (renamed) {
        back = fs::uniqueName(before + ".");
        renamed = disk.rename(to, name.c_str(), from, back.c_str(), 0);
    }
    needs_.log.write(logLevelError, moveFunction, "A directory of user %u was put in the place of %s; %s %s%s%s",
                     status.st_uid, url.c_str(), renamed ? "it could not be put back as" : "it is back as",
                     ZOR_SHOWN(back), renamed ? ": " : "", renamed ? renamed.text() : "");
    return posixError({moveFunction, __LINE__}, Errno(notTheContainer), "%s was swapped while it was taken away",
                      url.c_str());
}

} // namespace zor
