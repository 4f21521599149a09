// SPDX-License-Identifier: Apache-2.0
// The file manager's work on whole trees: removing, copying, moving, walking, listing, measuring.
#include "fs/Durability.h"
#include "fs/MountFences.h"
#include "fs/Names.h"
#include "fs/PathResolver.h"
#include "fs/TreeWalker.h"
#include "fs/Trees.h"
#include "fs/ZORFileManager.h"
#include "os/FileDescriptor.h"

#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <sys/stat.h>

namespace zor {

using fs::WalkEntry;
using fs::WalkEntryKind;
using fs::WalkStep;

namespace {

std::string below(const FileURL& root, const std::string& relative) {
    return relative.empty() ? root.path() : root.path() + "/" + relative;
}

/// Lines of one pass about items that stay somebody else's: who put them there may have put a million.
constexpr std::uint64_t othersSaidMax = 100;

/// 0755 for directories and whatever somebody may execute, else 0644.
mode_t standardMode(mode_t mode) {
    return S_ISDIR(mode) || (mode & 0111) ? 0755 : 0644;
}

/// Whether the names in an open directory are in nobody's hands but the owner's.
bool namesAreOf(uid_t owner, int directory) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && status.st_uid == owner && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

} // namespace

Result<void> ZORFileManager::removeItemAtURL(const std::optional<FileURL>& url) {
    if (!url)
        return posixError(ZOR_HERE, Errno(EFAULT), "nil url passed to -removeItemAtURL:error:");
    const auto parent = resolver_.openParent(*url);
    if (!parent && parent.error() == ENOENT)
        return {};
    if (!parent)
        return posixError(ZOR_HERE, parent.error(), "prunetree of %s failed: %s", url->c_str(), parent.error().text());
    return removeItemIn(parent->directory.get(), *url);
}

Result<void> ZORFileManager::removeItemIn(int directory, const FileURL& url,
                                          const std::function<bool(int directory)>& isMeant) {
    Errno firstError;
    const Reporter report(log_, "removeItemAtURL");
    fs::RemoveCallbacks callbacks;
    callbacks.isMeant = isMeant;
    callbacks.directoryMadeMutable = [&](const std::string& path) {
        report.write(logLevelNotice, "Unset UF_IMMUTABLE on %s", ZOR_SHOWN(below(url, path)));
    };
    callbacks.failed = [&](const fs::RemoveFailure& failure) {
        const std::string path = below(url, failure.path);
        if (failure.error != ENOENT)
            report.write(logLevelError, "prunetree hit error for %s : %s", ZOR_SHOWN(path), failure.error.text());
        struct stat status{};
        const Errno unexamined =
            failure.error == EPERM ? fs::statusOfName(failure.parent, failure.name, status) : failure.error;
        const bool examined = !unexamined;
        if (failure.error == EPERM && !examined)
            report.write(logLevelError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", ZOR_SHOWN(path),
                         unexamined.text());
        if (examined) {
            const auto cleared = fs::clearImmutable(disk_, failure.parent, failure.name);
            if (!cleared)
                report.write(logLevelError, "Failed to lchflags %s: %s", ZOR_SHOWN(path), cleared.error().text());
            if (cleared.value_or(false)) {
                report.write(logLevelNotice, "Unset UF_IMMUTABLE on %s", ZOR_SHOWN(path));
                const Errno removed = disk_.unlinkFile(failure.parent, failure.name);
                if (!removed)
                    return;
                report.write(logLevelError, "unlink of %s failed: %s", ZOR_SHOWN(path), removed.text());
            }
        }
        if (!firstError)
            firstError = failure.error;
    };
    const Errno status = fs::removeTree(disk_, directory, std::string(url.lastPathComponent()).c_str(), callbacks);
    const Errno number = status && status != ENOENT ? status : firstError;
    if (!number || number == ENOENT)
        return {};
    return posixError(ZOR_HERE, number, "prunetree of %s failed: %s", url.c_str(), number.text());
}

Result<void> ZORFileManager::copyItemAtURL(const FileURL& source, const FileURL& destination) {
    return _copyItemAtURL(source, destination, MissingSource::fails);
}

Result<void> ZORFileManager::copyItemIfExistsAtURL(const FileURL& source, const FileURL& destination) {
    return _copyItemAtURL(source, destination, MissingSource::isFine);
}

Result<void> ZORFileManager::moveItemAtURL(const FileURL& source, const FileURL& destination, const GoOn& goOn) {
    return _moveItemAtURL(source, destination, MissingSource::fails, goOn);
}

Result<void> ZORFileManager::moveItemIfExistsAtURL(const FileURL& source, const FileURL& destination) {
    return _moveItemAtURL(source, destination, MissingSource::isFine, {});
}

Result<bool> ZORFileManager::sourceIsMissing(const FileURL& source) {
    struct stat status{};
    const Errno failure = resolver_.status(source, status);
    if (failure && failure != ENOENT)
        return posixError(ZOR_HERE, failure, "stat of %s failed: %s", source.c_str(), failure.text());
    if (failure == ENOENT && fs::hiddenBy(resolver_, disk_, source))
        return posixError(ZOR_HERE, Errno(ENOKEY), "stat of %s failed: %s", source.c_str(), Errno(ENOKEY).text());
    return failure == ENOENT;
}

Result<void> ZORFileManager::_copyItemAtURL(const FileURL& source, const FileURL& destination, MissingSource missing) {
    if (missing == MissingSource::isFine && TRY(sourceIsMissing(source)))
        return {};
    const auto from = resolver_.openParent(source);
    const auto to = resolver_.openParent(destination);
    if (!from || !to) {
        const Errno number = from ? to.error() : from.error();
        return posixError({"copyTree", __LINE__}, number, "clonetree of %s to %s failed: %s", source.c_str(),
                          destination.c_str(), number.text());
    }
    return copyTree(from->directory.get(), source, to->directory.get(), destination, {});
}

Result<void> ZORFileManager::copyTree(int fromDirectory, const FileURL& source, int toDirectory,
                                      const FileURL& destination, const GoOn& goOn) {
    const std::string hidden = fs::uniqueName(fs::copyPrefix);
    Errno status = fs::copyTree(disk_, fromDirectory, std::string(source.lastPathComponent()).c_str(), toDirectory,
                                hidden.c_str(), goOn);
    if (status == ECANCELED) // who is to end does not stay to tidy up
        return posixError(ZOR_HERE, Errno(ECANCELED), "clonetree of %s to %s was stopped", source.c_str(),
                          destination.c_str());
    // Nothing of a copy may be missing once it has its name, whatever the power does.
    if (!status) {
        const auto copied = platform::openBeneath(toDirectory, ".", O_RDONLY | O_DIRECTORY);
        status = copied ? disk_.syncFileSystem(copied->get()) : copied.error();
    }
    if (!status)
        status = disk_.rename(toDirectory, hidden.c_str(), toDirectory,
                              std::string(destination.lastPathComponent()).c_str(), 0);
    if (status)
        (void)fs::removeTree(disk_, toDirectory, hidden.c_str());
    if (status)
        return posixError(ZOR_HERE, status, "clonetree of %s to %s failed: %s", source.c_str(), destination.c_str(),
                          status.text());
    return {};
}

Result<void> ZORFileManager::_moveItemAtURL(const FileURL& source, const FileURL& destination, MissingSource missing,
                                            const GoOn& goOn) {
    if (missing == MissingSource::isFine && TRY(sourceIsMissing(source)))
        return {};
    const auto from = resolver_.openParent(source);
    const auto to = resolver_.openParent(destination);
    if (!from || !to)
        return posixError(ZOR_HERE, from ? to.error() : from.error(), "rename of %s to %s failed: %s", source.c_str(),
                          destination.c_str(), (from ? to.error() : from.error()).text());
    TRY(moveItem(from->directory.get(), source, to->directory.get(), destination, goOn));
    return {};
}

Result<void> ZORFileManager::moveAcrossFileSystems(int fromDirectory, const FileURL& source, int toDirectory,
                                                   const FileURL& destination, const GoOn& goOn) {
    TRY(copyTree(fromDirectory, source, toDirectory, destination, goOn));
    const Errno removed = removeMovedSource(fromDirectory, source, toDirectory, goOn);
    if (removed && removed != ECANCELED)
        log_.write(logLevelError, __func__, "Failed to remove source %s : %s", source.c_str(), removed.text());
    return {};
}

Errno ZORFileManager::removeMovedSource(int fromDirectory, const FileURL& source, int toDirectory, const GoOn& goOn) {
    const auto synced = [this](int directory) -> Errno {
        return disk_.sync(TRY(platform::openBeneath(directory, ".", O_RDONLY | O_DIRECTORY)).get()); // it may be O_PATH
    };
    const std::string hidden = fs::uniqueName(fs::copyPrefix);
    // The source leaves its name in one step, when the copy cannot lose its own any more; only then it is taken apart.
    TRY(synced(toDirectory));
    TRY(disk_.rename(fromDirectory, std::string(source.lastPathComponent()).c_str(), fromDirectory, hidden.c_str(), 0));
    TRY(synced(fromDirectory));
    return fs::removeTree(disk_, fromDirectory, hidden.c_str(), goOn);
}

Result<void> ZORFileManager::_traverseDirectory(const FileURL& url,
                                                const std::function<Result<void>(const WalkEntry&)>& visitor) {
    const auto parent = resolver_.openParent(url);
    if (!parent)
        return posixError(ZOR_HERE, parent.error(), "fts_open failed for %s with error %s", url.c_str(),
                          parent.error().text());
    std::optional<ZORError> failure;
    // A directory is walked as itself: whether it may be a mount point, the way to it decides.
    const auto directory = resolver_.openDirectory(url);
    fs::TreeWalker walker;
    const Errno status = walker.walk(directory ? directory->get() : parent->directory.get(),
                                     directory ? "." : parent->name.c_str(), [&](const WalkEntry& entry) {
                                         if (entry.kind == WalkEntryKind::noStatus) {
                                             failure =
                                                 posixError({"_traverseDirectory", __LINE__}, entry.error,
                                                            "Error for path %s: %s", url.c_str(), entry.error.text());
                                             return WalkStep::stop;
                                         }
                                         if (auto answer = visitor(entry); !answer) {
                                             failure = std::move(answer).error();
                                             return WalkStep::stop;
                                         }
                                         return WalkStep::proceed;
                                     });
    if (failure)
        return *failure;
    if (status)
        return posixError(ZOR_HERE, status, "Error for path %s: %s", url.c_str(), status.text());
    return {};
}

void ZORFileManager::standardizeEntry(int parent, const char* name, int directory, const std::string& path,
                                      Standard& standard, fs::NamesMet& namesMet) {
    const Reporter report(log_, "standardizeOwnershipAtURL");
    const auto [uid, gid, formerOwner, others] = standard;
    const auto notGiven = [&](Errno number) {
        report.write(logLevelError, "Could not chown %s: %s", ZOR_SHOWN(path), number.text());
    };
    platform::FileDescriptor opened;
    if (directory < 0) {
        auto item = platform::openBeneathOnMount(parent, name, O_PATH | O_NOFOLLOW);
        if (!item && item.error() != ENOENT)
            notGiven(item.error());
        if (!item)
            return;
        opened = std::move(*item);
    }
    // A directory that is walked is given away itself, whatever has its name by now: then nobody moves names in it.
    const int item = directory < 0 ? opened.get() : directory;
    struct stat status{};
    if (::fstat(item, &status) != 0)
        return notGiven(Errno::last());
    // The former owner can have named another's file or directory so that it lies here.
    if (daemon_ == 0 && status.st_uid != formerOwner && status.st_uid != uid) {
        if (others < othersSaidMax)
            report.write(logLevelError, "%s belongs to user %u: it keeps its owner and mode", ZOR_SHOWN(path),
                         status.st_uid);
        ++standard.others;
        return;
    }
    // A file with another name elsewhere may belong to somebody else's tree. A name counts once its directory has been
    // given away: before, the former owner could move it on and have it counted again.
    const bool sharedElsewhere =
        !S_ISDIR(status.st_mode) && status.st_nlink > 1 && !(namesAreOf(uid, parent) && namesMet.wasLast(status));
    if (!sharedElsewhere && (status.st_uid != uid || status.st_gid != gid))
        if (const Errno changed = disk_.changeOwner(item, uid, gid))
            notGiven(changed);
    if (sharedElsewhere || S_ISLNK(status.st_mode)) // Linux keeps no mode for a link
        return;
    if (const Errno changed = disk_.changeMode(item, standardMode(status.st_mode)))
        report.write(logLevelError, "Could not chmod %s: %s", ZOR_SHOWN(path), changed.text());
}

Result<void> ZORFileManager::standardizeOwnershipAtURL(const FileURL& url, uid_t uid, gid_t gid, uid_t formerOwner,
                                                       const GoOn& goOn) {
    Standard standard{.uid = uid, .gid = gid, .formerOwner = formerOwner};
    const bool rootIsMetadata = url.path().find(names::metadataFile) != std::string::npos;
    fs::NamesMet namesMet;
    Result<void> walked = _traverseDirectory(url, [&](const WalkEntry& entry) -> Result<void> {
        if (goOn && !goOn())
            return posixError({"standardizeOwnershipAtURL", __LINE__}, Errno(ECANCELED),
                              "The change of owners below %s was stopped", url.c_str());
        const std::string path = below(url, entry.path());
        if (entry.kind != WalkEntryKind::directoryEnd && !entry.onOtherFileSystem &&
            path.find(names::metadataFile) == std::string::npos)
            standardizeEntry(entry.parent, entry.name, entry.directory, path, standard, namesMet);
        return {};
    });
    if (standard.others > othersSaidMax)
        log_.write(logLevelError, __func__, "%llu more items below %s keep their owner and mode",
                   static_cast<unsigned long long>(standard.others - othersSaidMax), url.c_str());
    const auto parent = resolver_.openParent(url);
    struct stat status{};
    const Errno failure = parent ? resolver_.status(url, status) : parent.error();
    if (failure)
        return posixError(ZOR_HERE, failure, "Could not stat %s: %s", url.c_str(), failure.text());
    fs::NamesMet again;              // the root's name has been counted
    standard.others = othersSaidMax; // the root has been said
    const auto directory = resolver_.openDirectoryPath(url);
    if (!rootIsMetadata)
        standardizeEntry(parent->directory.get(), parent->name.c_str(), directory ? directory->get() : -1, url.path(),
                         standard, again);
    return walked;
}

Result<std::vector<FileURL>> ZORFileManager::urlsForItemsInDirectoryAtURL(const FileURL& directory) {
    std::vector<FileURL> urls;
    TRY(forEachItemInDirectoryAtURL(directory, Leftovers::hidden, [&](int, const FileURL& item) {
        urls.push_back(item);
        return true;
    }));
    return urls;
}

Result<void> ZORFileManager::forEachItemInDirectoryAtURL(const FileURL& directory, Leftovers leftovers,
                                                         const ItemVisitor& visitor) {
    const auto opened = resolver_.openDirectory(directory);
    const bool hidden = opened ? disk_.hidesNames(opened->get())
                               : opened.error() == ENOENT && fs::hiddenBy(resolver_, disk_, directory);
    if (opened && !hidden)
        return forEachItemIn(opened->get(), directory, leftovers, visitor);
    const Errno number = hidden ? Errno(ENOKEY) : opened.error();
    if (number != ENOENT)
        log_.write(logLevelError, "_IterateDirectory", "opendir of %s failed: %s", directory.c_str(), number.text());
    return posixError({"urlsForItemsInDirectoryAtURL", __LINE__}, number, "_IterateDirectory for %s returned %s",
                      directory.c_str(), number.text());
}

Result<void> ZORFileManager::forEachItemIn(int directory, const FileURL& url, Leftovers leftovers,
                                           const ItemVisitor& visitor) {
    const auto buffer = std::make_unique<fs::BulkDirectoryRead::Buffer>();
    fs::BulkDirectoryRead entries(directory, *buffer);
    while (const auto* entry = entries.next()) {
        if (entry->name[0] == '.' && (leftovers == Leftovers::hidden || !fs::isCopyLeftover(entry->name)))
            continue;
        unsigned char type = entry->type;
        struct stat status{};
        if (type == DT_UNKNOWN && !fs::statusOfName(directory, entry->name, status))
            type = static_cast<unsigned char>(IFTODT(status.st_mode));
        if (!visitor(directory, type == DT_DIR ? url.appendingDirectory(entry->name) : url.appendingFile(entry->name)))
            return {};
    }
    if (entries.error())
        return posixError({"urlsForItemsInDirectoryAtURL", __LINE__}, entries.error(),
                          "_IterateDirectory for %s returned %s", url.c_str(), entries.error().text());
    return {};
}

std::vector<FileURL> ZORFileManager::itemsNamed(const FileURL& directory, bool (*belongs)(std::string_view)) const {
    std::vector<FileURL> items;
    const auto opened = resolver_.openDirectory(directory);
    if (!opened)
        return items;
    fs::BulkDirectoryRead::Buffer buffer;
    fs::BulkDirectoryRead entries(opened->get(), buffer);
    while (const auto* entry = entries.next())
        if (belongs(entry->name))
            items.push_back(directory.appendingDirectory(entry->name));
    return items;
}

std::vector<FileURL> ZORFileManager::copyLeftoversInDirectoryAtURL(const FileURL& directory) {
    return itemsNamed(directory, fs::isCopyLeftover);
}

std::vector<FileURL> ZORFileManager::writeLeftoversInDirectoryAtURL(const FileURL& directory) {
    return itemsNamed(directory, fs::isWriteLeftover);
}

void ZORFileManager::printDirectoryStructureAtURL(const FileURL& url) {
    const auto parent = resolver_.openParent(url);
    if (!parent) {
        log_.write(logLevelError, __func__, "fts_open failed for %s : %s", url.c_str(), parent.error().text());
        return;
    }
    const Reporter report(log_, "printDirectoryStructureAtURL");
    fs::TreeWalker walker(fs::WalkStatus::typeOnly);
    const Errno status = walker.walk(parent->directory.get(), parent->name.c_str(), [&](const WalkEntry& entry) {
        const std::string path = below(url, entry.path());
        if (entry.kind == WalkEntryKind::unreadableDirectory || entry.kind == WalkEntryKind::noStatus)
            report.write(logLevelError, "FTS returned error for %s : %s", ZOR_SHOWN(path), entry.error.text());
        else if (entry.kind != WalkEntryKind::directoryEnd)
            report.write(logLevelError, "\tOrphaned File: %s", ZOR_SHOWN(path));
        return WalkStep::proceed;
    });
    if (status)
        report.write(logLevelError, "FTS returned error for %s : %s", url.c_str(), status.text());
}

std::uint64_t ZORFileManager::diskUsageForURL(const FileURL& url) {
    const Reporter report(log_, "diskUsageForURL");
    if (url.empty()) {
        report.write(logLevelError, "Failed to get path to url %s", url.c_str());
        return 0;
    }
    return diskUsageOfDirectory(resolver_.openDirectory(url), url).bytes;
}

fs::Usage ZORFileManager::diskUsageOfDirectory(const fs::OpenResult& directory, const FileURL& url) {
    constexpr const char* function = "diskUsageForURL";
    if (!directory) {
        log_.write(logLevelError, function, "Failed to open directory %s : %s", url.c_str(), directory.error().text());
        return {.bytes = 0, .cutShort = isOwnShortage(directory.error())};
    }
    fs::UsageLog usageLog;
    usageLog.write = [&](int level, const std::string& message) { log_.writeText(level, function, message); };
    usageLog.levelMax = log_.writes(logLevelDebug) ? logLevelDebug : logLevelError;
    return fs::diskUsage(directory->get(), url.path(), usageLog);
}

} // namespace zor
