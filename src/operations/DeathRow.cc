// SPDX-License-Identifier: Apache-2.0
#include "operations/DeathRow.h"

#include "fs/Durability.h"
#include "fs/FileSystemDeathRow.h"
#include "fs/MountFences.h"
#include "fs/Names.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <sys/xattr.h>
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
    const Reporter report(needs_.log, moveFunction);
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
            return report.error(ErrorCode::moveToDeathRowFailed, &moved.error(),
                                "Failed to create unique directory at: %s", url.c_str());
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
        return report.error(ErrorCode::moveToDeathRowFailed, &moved.error(), "Failed to move item at: %s to: %s",
                            url.c_str(), unique->appendingDirectory(url.lastPathComponent()).c_str());
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

// The passes that delete what earlier ones could not remove, and what is on death row: root's, and that of each other
// file system that holds containers.
//
// Passes run one after another on the death-row queue and take no lock. Items are taken as the directory is read, so no
// number of them is too large for the memory, and none that fails keeps the others. A power cut leaves what was on
// death row: nothing is removed whose move here could still be undone.
//
// An item that cannot be removed goes to the directory for temporary files, as root's and closed, and marked, so that
// later passes, of later daemons too, know it for theirs: only root can set such a mark, and names in that directory
// are anybody's to make. Killed between the steps, it is still on death row, closed. Nothing is copied: from another
// file system than that directory's it stays on its death row, which is closed.

namespace {

constexpr const char* passFunction = "deleteContainersOnDeathRowWithCompletion";

const char* undeletedMark() {
    return ::geteuid() == 0 ? names::undeletedAttribute : names::undeletedAttributeUser;
}

/// Root's alone and marked, so that a later pass finds it.
Errno closeAndMark(platform::Disk& disk, int directory) {
    static constexpr std::uint8_t mark[] = {'1'};
    TRY(disk.changeOwner(directory, ::geteuid(), ::getegid()));
    TRY(disk.changeMode(directory, platform::closedMode));
    return disk.setAttribute(directory, undeletedMark(), mark);
}

/// Whether an open directory is what closeAndMark made of it.
bool isClosedAndMarked(int directory) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && status.st_uid == ::geteuid() &&
           (status.st_mode & 0777) == platform::closedMode && ::fgetxattr(directory, undeletedMark(), nullptr, 0) > 0;
}

} // namespace

/// The state of one pass.
struct DeathRow::Pass {
    std::optional<ZORError> last;
    Left left;
    /// Tops of mounts that have been looked at.
    std::set<std::pair<dev_t, ino_t>> seen;
};

void DeathRow::deleteContainersOnDeathRowWithCompletion(std::function<void(ErrorCode)> completion) {
    // A pass that has not begun finds what comes until then: only who wants to be told of its end needs another. Else
    // whoever sends something here over and over would queue passes without end, each of which keeps the daemon busy.
    const bool isAwaited = completion != nullptr;
    if (!isAwaited && passWaits_.exchange(true))
        return;
    try {
        ZORDispatchAsyncWithTransaction(needs_.background, [this, completion = std::move(completion), isAwaited] {
            if (!isAwaited)
                passWaits_ = false;
            runDeletionPass(completion);
        });
    } catch (...) {
        if (!isAwaited)
            passWaits_ = false;
        throw;
    }
}

void DeathRow::runDeletionPass(const std::function<void(ErrorCode)>& completion) {
    const auto passed = needs_.boundary.run({passFunction, __LINE__}, [&]() -> Result<void> {
        Pass pass;
        deleteWhatIsInTemporary();
        deleteEverythingHidden(pass);
        deleteEverythingOnDeathRow(pass);
        for (const FileURL& place : needs_.configuration.placesOfContainers())
            deleteEverythingOnDeathRowOf(place, pass);
        if (inTemporary_)
            for (const std::string& name : *inTemporary_)
                pass.left.add(needs_.configuration.temporaryDirectory().appendingDirectory(name).path());
        {
            const platform::MutexLock held(leftMutex_);
            left_ = std::move(pass.left);
        }
        if (pass.last)
            return std::move(*pass.last);
        return {};
    });
    if (completion)
        completion(passed ? ErrorCode::success : passed.error().replyCode());
}

Result<void> DeathRow::forEachCondemned(int directory, const FileURL& row,
                                        const std::function<Result<void>(const FileURL&)>& remove, Pass& pass) {
    constexpr Here here{passFunction, __LINE__};
    std::optional<ZORError> unsynced;
    bool first = true;
    const auto listed = needs_.fileManager.forEachItemIn(
        directory, row, ZORFileManager::Leftovers::shown, [&](int, const FileURL& item) {
            // A power cut could bring back a container that is half removed where nothing keeps the order of changes.
            const Errno error = first ? needs_.durability.beforeRemoval(directory) : Errno();
            first = false;
            if (error) {
                unsynced = posixError(here, error, "sync of %s failed: %s", row.c_str(), error.text());
                return false;
            }
            {
                const platform::MutexLock judged(moving_);
            }
            const auto removed = needs_.boundary.run(here, [&] { return remove(item); });
            if (!removed) {
                pass.left.add(item.path());
                pass.last = Reporter(needs_.log, here.function)
                                .error({ErrorCode::deathRowItemNotDestroyed, here.line}, &removed.error(),
                                       "Failed to destroy item at: %s", item.c_str());
            }
            return true;
        });
    return unsynced ? Result<void>(std::move(*unsynced)) : listed;
}

void DeathRow::deleteEverythingOnDeathRow(Pass& pass) {
    const FileURL deathRow = needs_.configuration.deathrowDirectory();
    const auto opened = needs_.fileManager.resolver().openDirectory(deathRow);
    const auto emptied =
        opened ? forEachCondemned(
                     opened->get(), deathRow, [&](const FileURL& item) { return _removeItemOrMoveToTempAtURL(item); },
                     pass)
               : Result<void>(posixError({passFunction, __LINE__}, opened.error(), "opendir of %s failed: %s",
                                         deathRow.c_str(), opened.error().text()));
    if (emptied)
        return;
    pass.last = emptied.error().isPosix(ENOENT) ? emptied.error()
                                                : Reporter(needs_.log, passFunction)
                                                      .error(ErrorCode::listForDeletionFailed, &emptied.error(),
                                                             "Failed to get items for deletion: %s : %s",
                                                             deathRow.c_str(), emptied.error().text().c_str());
}

void DeathRow::deleteEverythingHidden(Pass& pass) {
    std::vector<Hidden> hidden;
    {
        const platform::MutexLock held(hiddenMutex_);
        hidden.swap(hidden_);
    }
    for (Hidden& one : hidden) {
        const auto parent = needs_.fileManager.resolver().openParent(one.url);
        if (!parent)
            continue; // the next boot finds it
        // Its owner may have put another's directory in its place since it was judged.
        const auto removed = needs_.fileManager.removeItemIn(
            parent->directory.get(), one.url, [&](int directory) { return !one.owner || isOf(directory, *one.owner); });
        if (removed)
            continue;
        pass.left.add(one.url.path());
        pass.last = Reporter(needs_.log, passFunction)
                        .error(ErrorCode::deathRowItemNotDestroyed, &removed.error(), "Failed to destroy item at: %s",
                               one.url.c_str());
        if (removed.error().isPosix(ESTALE))
            continue;
        const platform::MutexLock held(hiddenMutex_);
        hidden_.push_back(std::move(one));
    }
}

void DeathRow::deleteEverythingOnDeathRowOf(const FileURL& place, Pass& pass) {
    ZORFileManager& fileManager = needs_.fileManager;
    // A home that answered a moment ago may have died. In it this thread would wait for ever, and a stop for the
    // thread.
    if (!fileManager.resolver().answers(place, fs::MountFence::Asked::now))
        return;
    const auto top = fs::topOfMount(fileManager.resolver(), place);
    if (!top || !pass.seen.insert(top->identity).second)
        return;
    const auto row = fs::openDeathRow(top->directory.get());
    if (!row)
        return;
    const FileURL url = fs::deathRowBelow(top->url);
    const auto emptied = forEachCondemned(
        row->get(), url, [&](const FileURL& item) { return fileManager.removeItemIn(row->get(), item); }, pass);
    if (!emptied)
        pass.last =
            Reporter(needs_.log, passFunction)
                .error(ErrorCode::listForDeletionFailed, &emptied.error(), "Failed to get items for deletion: %s : %s",
                       url.c_str(), emptied.error().text().c_str());
    const platform::MutexLock moving(moving_);
    fs::removeEmptyDeathRow(fileManager.disk(), top->directory.get());
}

Result<void> DeathRow::_removeItemOrMoveToTempAtURL(const FileURL& url) {
    ZORFileManager& fileManager = needs_.fileManager;
    const auto removed = fileManager.removeItemAtURL(url);
    if (removed || removed.error().isPosix(ENOENT))
        return {};
    ZOR_LOG(needs_.log, logLevelDebug, "Couldn't remove, so moving item to /tmp: %s : %s", url.c_str(),
            removed.error().text().c_str());
    const FileURL temporary = needs_.configuration.temporaryDirectory();
    const auto moved = moveToTemporary(url, temporary.appendingDirectory(url.lastPathComponent()));
    if (moved)
        return {};
    return Reporter(needs_.log, __func__)
        .error(ErrorCode::moveToTemporaryFailed, &moved.error(), "Failed to move dir: %s to: %s", url.c_str(),
               temporary.c_str());
}

Result<void> DeathRow::moveToTemporary(const FileURL& url, const FileURL& destination) {
    ZORFileManager& fileManager = needs_.fileManager;
    const auto item = fileManager.resolver().openDirectory(url);
    const auto from = fileManager.resolver().openParent(url);
    const auto to = fileManager.resolver().openParent(destination);
    Errno error = !item ? item.error() : !from ? from.error() : !to ? to.error() : Errno();
    if (!error)
        error = closeAndMark(fileManager.disk(), item->get());
    if (error)
        return posixError(ZOR_HERE, error, "closing of %s failed: %s", url.c_str(), error.text());
    TRY(fileManager.renameItem(from->directory.get(), url, to->directory.get(), destination));
    if (inTemporary_)
        inTemporary_->emplace(destination.lastPathComponent());
    return {};
}

void DeathRow::findInTemporary(int directory, const FileURL& temporary) {
    auto& known = inTemporary_.emplace();
    (void)needs_.fileManager.forEachItemIn(
        directory, temporary, ZORFileManager::Leftovers::shown, [&](int, const FileURL& item) {
            const std::string name(item.lastPathComponent());
            if (!item.isDirectory())
                return true;
            const auto opened =
                platform::openBeneathOnMount(directory, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
            if (opened && isClosedAndMarked(opened->get()))
                known.insert(name);
            return true;
        });
}

void DeathRow::deleteWhatIsInTemporary() {
    const FileURL temporary = needs_.configuration.temporaryDirectory();
    const auto directory = needs_.fileManager.resolver().openDirectory(temporary);
    if (!directory)
        return;
    auto& known = inTemporary_;
    if (!known)
        findInTemporary(directory->get(), temporary);
    std::erase_if(*known, [&](const std::string& name) {
        const auto opened =
            platform::openBeneathOnMount(directory->get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
        // Somebody else may have removed it, and another may have taken the name.
        if (!opened || !isClosedAndMarked(opened->get()))
            return true;
        const FileURL item = temporary.appendingDirectory(name);
        return needs_.boundary
            .run({passFunction, __LINE__}, [&] { return needs_.fileManager.removeItemIn(directory->get(), item); })
            .has_value();
    });
}

} // namespace zor
