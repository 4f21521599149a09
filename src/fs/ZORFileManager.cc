// SPDX-License-Identifier: Apache-2.0
// Creating directories, asking what exists, renaming, and protection classes.
#include "fs/ZORFileManager.h"

#include "fs/Durability.h"
#include "fs/MountFences.h"
#include "fs/PathResolver.h"
#include "fs/TreeWalker.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace zor {

using fs::Mounts;
using fs::uniqueName;
using platform::FileDescriptor;
using platform::openBeneathOnMount;

namespace {

constexpr int namesTriedMax = 16;
/// Users can mount in any number of places; behind these the log has said enough.
constexpr std::size_t leftSaidMax = 200;

/// lstat.
Errno statusBelow(int base, const std::string& relativePath, Mounts mounts, struct stat& status) {
    const std::size_t slash = relativePath.rfind('/');
    const std::string above = slash == relativePath.npos ? "." : relativePath.substr(0, slash);
    const FileDescriptor parent = TRY(fs::openBelow(base, above.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW, mounts));
    const char* const name = relativePath.c_str() + (slash == relativePath.npos ? 0 : slash + 1);
    const Errno error = fs::statusOfName(parent.get(), name, status);
    return error == EXDEV && mounts == Mounts::crossed ? Errno() : error;
}

/// The call in messages.
const char* makingVerb(Intermediates intermediates) {
    return intermediates == Intermediates::yes ? "dirchain" : "mkdir";
}

} // namespace

void ZORFileManager::sayLeft(const std::string& path, Errno error) {
    {
        const platform::MutexLock held(saidMutex_);
        if (saidLeft_.size() >= leftSaidMax || !saidLeft_.insert(path).second)
            return;
    }
    log_.write(logLevelError, __func__, "Leaving %s: %s", ZOR_SHOWN(path),
               error == EXDEV ? "a file system that a user may have mounted is in the way"
                              : "the file system of the home does not answer");
}

Result<void> ZORFileManager::createDirectoryAtURL(const FileURL& url, Intermediates intermediates,
                                                  const DirectoryAttributes& attributes) {
    TRY(openOrCreateDirectoryAtURL(url, intermediates, attributes));
    return {};
}

Result<FileDescriptor> ZORFileManager::openOrCreateDirectoryAtURL(const FileURL& url, Intermediates intermediates,
                                                                  const DirectoryAttributes& attributes) {
    const auto way = resolver_.wayTo(url);
    if (!way)
        return posixError(ZOR_HERE, way.error(), "Failed to determine if %s exists: %s", url.c_str(),
                          way.error().text());
    return openOrCreate({.directory = way->base, .mounts = way->mounts}, way->path, url, intermediates, attributes);
}

Result<FileDescriptor> ZORFileManager::openOrCreateDirectoryBelow(int base, const FileURL& baseUrl,
                                                                  const std::string& relativePath,
                                                                  Intermediates intermediates,
                                                                  const DirectoryAttributes& attributes) {
    return openOrCreate({.directory = base, .mounts = Mounts::left, .isUsers = true}, relativePath,
                        baseUrl.appendingDirectory(relativePath), intermediates, attributes);
}

Result<FileDescriptor> ZORFileManager::openOrCreate(const Base& base, const std::string& relativePath,
                                                    const FileURL& url, Intermediates intermediates,
                                                    const DirectoryAttributes& attributes) {
    // A class can be set on a descriptor only that was opened for reading.
    const int access = attributes.protectionClass == protectionClassUnchanged ? O_PATH : O_RDONLY;
    auto existing = fs::openBelow(base.directory, relativePath.c_str(), access | O_DIRECTORY | O_NOFOLLOW, base.mounts);
    if (!existing && existing.error() == ENOENT)
        return makeNewDirectory(base, relativePath, url, intermediates, attributes);
    if (!existing) {
        constexpr Here here{"createDirectoryAtURL", __LINE__};
        struct stat status{};
        const bool misshapen = existing.error() == ELOOP || existing.error() == ENOTDIR;
        const Errno failure =
            misshapen ? statusBelow(base.directory, relativePath, base.mounts, status) : existing.error();
        if (failure)
            return posixError(here, failure, "Failed to determine if %s exists: %s", url.c_str(), failure.text());
        // It is there: a link, or a file.
        const Errno number(S_ISLNK(status.st_mode) ? ELOOP : ENOTDIR);
        return posixError(here, number, "%s of %s failed: %s", makingVerb(intermediates), url.c_str(), number.text());
    }
    TRY(mendDirectory(existing->get(), url, attributes));
    return std::move(*existing);
}

Result<void> ZORFileManager::judgeOwner(int directory, const FileURL& url, std::uint32_t owner) const {
    struct stat status{};
    if (::fstat(directory, &status) != 0)
        return posixError(ZOR_HERE, Errno::last(), "Failed to determine if %s exists: %s", url.c_str(),
                          Errno::last().text());
    return judgeOwner(status, url, owner);
}

Result<void> ZORFileManager::judgeOwner(const struct stat& status, const FileURL& url, std::uint32_t owner) const {
    if (status.st_uid != ownerToBe(owner))
        return posixError(ZOR_HERE, Errno(EPERM),
                          "%s belongs to user %u instead of user %u, so it stays as it is; move it away, and it is "
                          "made anew",
                          url.c_str(), status.st_uid, ownerToBe(owner));
    return {};
}

Result<FileDescriptor> ZORFileManager::openDirectoryOf(std::uint32_t owner, const FileURL& url) const {
    auto opened = resolver_.openDirectory(url);
    if (!opened)
        return posixError(ZOR_HERE, opened.error(), "open of %s failed: %s", url.c_str(), opened.error().text());
    TRY(judgeOwner(opened->get(), url, owner));
    return std::move(*opened);
}

uid_t ZORFileManager::ownerToBe(std::uint32_t owner) const {
    return owner == ownerUnchanged || daemon_ != 0 ? daemon_ : owner;
}

Result<void> ZORFileManager::mendDirectory(int directory, const FileURL& url, const DirectoryAttributes& attributes) {
    struct stat status{};
    if (::fstat(directory, &status) != 0)
        return posixError(ZOR_HERE, Errno::last(), "Failed to determine if %s exists: %s", url.c_str(),
                          Errno::last().text());
    if (attributes.otherOwner != ownerUnchanged && status.st_uid == attributes.otherOwner)
        return {};
    TRY(judgeOwner(status, url, attributes.owner));
    const int protectionClass = attributes.protectionClass;
    if (protectionClass != protectionClassUnchanged)
        TRY(classSet(setClassAtCreation(directory, protectionClass), url.path(), protectionClass));
    struct stat parent{};
    const bool groupFits = attributes.owner == ownerUnchanged || status.st_gid == attributes.owner;
    const mode_t mode = status.st_mode & platform::permissionBits;
    if (groupFits && mode == attributes.mode)
        return {};
    // Any user who can write the parent can have given its name to another directory of this owner's, one that is
    // closed for a reason. Only who may write the directory itself can move it to another parent meanwhile.
    if (::fstatat(directory, "..", &parent, 0) != 0)
        return posixError(ZOR_HERE, Errno::last(), "opendir of %s failed: %s", url.c_str(), Errno::last().text());
    const bool othersCanName = (parent.st_mode & (S_IWGRP | S_IWOTH)) != 0 ||
                               (parent.st_uid != status.st_uid && parent.st_uid != daemon_ && parent.st_uid != 0);
    if (!groupFits && !othersCanName)
        (void)disk_.changeOwner(directory, attributes.owner, attributes.owner);
    const mode_t mended = othersCanName ? mode & attributes.mode : attributes.mode;
    if (mended != mode)
        (void)disk_.changeMode(directory, mended);
    return {};
}

Result<FileDescriptor> ZORFileManager::makeNewDirectory(const Base& base, std::string_view relativePath,
                                                        const FileURL& url, Intermediates intermediates,
                                                        const DirectoryAttributes& attributes) {
    const FileURL parentUrl = url.deletingLastPathComponent();
    const std::size_t slash = relativePath.rfind('/');
    const std::string way(slash == relativePath.npos ? "." : relativePath.substr(0, slash));
    const auto parent = intermediates == Intermediates::yes
                            ? fs::makeDirectories(disk_, base.directory, way, attributes.intermediateMode, base.mounts)
                            : fs::openBelow(base.directory, way.c_str(), O_PATH | O_DIRECTORY, base.mounts);
    // Below a user's directory the daemon's own levels are open to all; what is closed, or another's, was named so.
    struct stat above{};
    if (parent && base.isUsers && ::fstat(parent->get(), &above) == 0 && above.st_uid != ownerToBe(attributes.owner) &&
        (above.st_uid != daemon_ || (above.st_mode & S_IXOTH) == 0))
        return posixError(ZOR_HERE, Errno(EPERM), "%s belongs to user %u, so nothing is made in it; move it away",
                          parentUrl.c_str(), above.st_uid);
    const std::string finalName(url.lastPathComponent());
    std::string name;
    Errno made = parent ? Errno(EEXIST) : parent.error();
    for (int tried = 0; parent && made == EEXIST && tried < namesTriedMax; ++tried) {
        name = uniqueName(finalName + ".");
        made = disk_.makeDirectory(parent->get(), name.c_str(), platform::closedMode);
    }
    const std::string temporaryPath = parent ? parentUrl.appendingDirectory(name).path() : url.path();
    if (made == EEXIST)
        return posixError(ZOR_HERE, Errno(EEXIST), "Failed to create temp dir at path %s : %s", temporaryPath.c_str(),
                          Errno(EEXIST).text());
    if (made)
        return posixError(ZOR_HERE, made, "%s of %s failed: %s", makingVerb(intermediates), temporaryPath.c_str(),
                          made.text());
    auto directory = openBeneathOnMount(parent->get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return posixError(ZOR_HERE, directory.error(), "opendir of %s failed: %s", temporaryPath.c_str(),
                          directory.error().text());
    // A user who can write the parent can have put another directory there.
    if (!fs::isFreshDirectory(directory->get()))
        return posixError(ZOR_HERE, Errno(EPERM), "%s was exchanged while it was made; it stays as it is",
                          temporaryPath.c_str());
    Result<void> placed = giveNewDirectory(directory->get(), temporaryPath, attributes);
    if (placed)
        if (const Errno renamed = disk_.rename(parent->get(), name.c_str(), parent->get(), finalName.c_str(), 0))
            placed = posixError(ZOR_HERE, renamed, "failed to rename from %s to %s : %s", temporaryPath.c_str(),
                                url.c_str(), renamed.text());
    if (!placed) {
        (void)disk_.removeDirectory(parent->get(), name.c_str());
        return std::move(placed).error();
    }
    return std::move(*directory);
}

Result<void> ZORFileManager::giveNewDirectory(int directory, const std::string& path,
                                              const DirectoryAttributes& attributes) {
    const int protectionClass = attributes.protectionClass;
    if (protectionClass != protectionClassUnchanged)
        TRY(classSet(setClassOfNew(directory, protectionClass), path, protectionClass));
    // One that could not be given would be another's for ever once it had its name.
    Errno error = disk_.changeMode(directory, attributes.mode);
    const char* verb = "chmod";
    if (!error && attributes.owner != ownerUnchanged) {
        error = disk_.changeOwner(directory, attributes.owner, attributes.owner);
        verb = "chown";
    }
    if (error)
        return posixError(ZOR_HERE, error, "%s of %s failed: %s", verb, path.c_str(), error.text());
    return {};
}

Result<void> ZORFileManager::classSet(Errno failure, const std::string& path, int protectionClass) {
    if (failure)
        return posixError(ZOR_HERE, failure, "Failed to setclass(%d) on directory %s: %s", protectionClass,
                          path.c_str(), failure.text());
    return {};
}

Errno ZORFileManager::setClassAtCreation(int directory, int protectionClass) {
    const auto current = protection_.classOf(directory);
    return current && *current == protectionClass ? Errno() : setClass(directory, protectionClass);
}

Errno ZORFileManager::setClassOfNew(int fd, int protectionClass) {
    return protectionClass == platform::defaultProtectionClass ? Errno() : setClass(fd, protectionClass);
}

Errno ZORFileManager::setClass(int fd, int protectionClass) {
    const Errno failure = protection_.setClass(fd, protectionClass);
    if (failure != ENOTSUP)
        return failure;
    if (!saidClassesUnsupported_.exchange(true))
        log_.write(logLevelNotice, "setClassAtCreation",
                   "The file system keeps no extended attributes; new directories have no protection class");
    return Errno();
}

Result<FileURL> ZORFileManager::createTemporaryDirectoryInDirectoryURL(const FileURL& directory) {
    const auto parent = resolver_.openDirectoryPath(directory);
    std::string name;
    Errno made = parent ? Errno(EEXIST) : parent.error();
    for (int tried = 0; parent && made == EEXIST && tried < namesTriedMax; ++tried) {
        name = uniqueName("temp.");
        made = disk_.makeDirectory(parent->get(), name.c_str(), platform::closedMode);
    }
    FileURL url = directory.appendingDirectory(name);
    if (made)
        return posixError(ZOR_HERE, made, "Failed to create temp dir at path %s : %s",
                          directory.appendingDirectory("temp.XXXXXX").c_str(), made.text());
    return url;
}

bool ZORFileManager::itemExistsAtURL(const FileURL& url) {
    struct stat status{};
    const Errno failure = resolver_.status(url, status);
    if (failure && failure != ENOENT)
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(), failure.text());
    return !failure;
}

bool ZORFileManager::itemDoesNotExistAtURL(const FileURL& url) {
    struct stat status{};
    const Errno failure = resolver_.status(url, status);
    const bool hidden = failure == ENOENT && fs::hiddenBy(resolver_, disk_, url);
    if (failure && (failure != ENOENT || hidden))
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(),
                   (hidden ? Errno(ENOKEY) : failure).text());
    return failure == ENOENT && !hidden;
}

bool ZORFileManager::itemIsGone(const FileURL& url) const {
    struct stat status{};
    const Errno failure = resolver_.status(url, status);
    return failure == ENOTDIR || (failure == ENOENT && !fs::hiddenBy(resolver_, disk_, url));
}

bool ZORFileManager::itemDoesNotExistBelow(int directory, const char* relativePath, const FileURL& url) {
    const auto item = openBeneathOnMount(directory, relativePath, O_PATH | O_NOFOLLOW);
    Errno failure = item ? Errno() : item.error();
    const std::string_view path = relativePath;
    if (failure == ENOENT &&
        fs::hidesNamesBelow(disk_, directory, path.contains('/') ? std::string(path, 0, path.rfind('/')).c_str() : "."))
        failure = Errno(ENOKEY);
    if (failure && failure != ENOENT)
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(), failure.text());
    return failure == ENOENT;
}

Result<ZORFileManager::Moved> ZORFileManager::moveItem(int fromDirectory, const FileURL& source, int toDirectory,
                                                       const FileURL& destination, const GoOn& goOn) {
    auto renamed = renameItem(fromDirectory, source, toDirectory, destination);
    if (renamed)
        return Moved::byName;
    if (!renamed.error().isPosix(EXDEV))
        return std::move(renamed).error();
    TRY(moveAcrossFileSystems(fromDirectory, source, toDirectory, destination, goOn));
    return Moved::byCopy;
}

Result<void> ZORFileManager::renameItem(int fromDirectory, const FileURL& source, int toDirectory,
                                        const FileURL& destination) {
    const Errno status = disk_.rename(fromDirectory, std::string(source.lastPathComponent()).c_str(), toDirectory,
                                      std::string(destination.lastPathComponent()).c_str(), 0);
    if (!status)
        return {};
    return posixError({"moveItem", __LINE__}, status, "rename of %s to %s failed: %s", source.c_str(),
                      destination.c_str(), status.text());
}

Result<int> ZORFileManager::dataProtectionClassOfItemAtURL(const FileURL& url) {
    const auto item = resolver_.openItem(url, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!item)
        return posixError(ZOR_HERE, item.error(), "Failed to open %s : %s", url.c_str(), item.error().text());
    const auto current = protection_.classOf(item->get());
    if (!current)
        return posixError(ZOR_HERE, current.error(), "Failed to getclass of file %s: %s", url.c_str(),
                          current.error().text());
    return *current;
}

Result<void> ZORFileManager::setDataProtectionClassOfItemAtURL(const FileURL& url, int protectionClass,
                                                               const std::function<bool(int)>& predicate) {
    const auto item = resolver_.openItem(url, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!item)
        return posixError(ZOR_HERE, item.error(), "Failed to open %s : %s", url.c_str(), item.error().text());
    return setClassOf(item->get(), url.path(), protectionClass, predicate);
}

Result<std::optional<FileDescriptor>> ZORFileManager::openForDataProtection(const fs::WalkEntry& entry,
                                                                            const std::string& path) const {
    auto item = openBeneathOnMount(entry.parent, entry.name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    // Its class is beside its content, which alone is encrypted, or under a lease of its owner's that an open would
    // wait for: it needs no open.
    if (!item && (item.error() == ENOKEY || item.error() == EWOULDBLOCK))
        item = openBeneathOnMount(entry.parent, entry.name, O_PATH | O_NOFOLLOW);
    if (item)
        return std::optional(std::move(*item));
    // Gone, a link, something without a reader, or the place of a mount.
    if (item.error() == ENOENT || item.error() == ELOOP || item.error() == ENXIO || item.error() == EXDEV)
        return std::optional<FileDescriptor>();
    const Errno number = platform::neverLocked(item.error());
    return posixError(ZOR_HERE, number, "Failed to open %s : %s", ZOR_SHOWN(path), number.text());
}

Result<void> ZORFileManager::setDataProtectionClassOfOpenItem(
    int item, mode_t kind, const std::string& path, int protectionClass,
    const std::function<bool(const struct stat& status, int current)>& predicate) {
    struct stat status{};
    if (::fstat(item, &status) != 0) {
        const Errno number = platform::neverLocked(Errno::last());
        return posixError(ZOR_HERE, number, "Failed to open %s : %s", ZOR_SHOWN(path), number.text());
    }
    if ((status.st_mode & S_IFMT) != kind)
        return {};
    return setClassOf(item, path, protectionClass, [&](int current) { return predicate(status, current); });
}

Result<void> ZORFileManager::setClassOf(int fd, const std::string& path, int protectionClass,
                                        const std::function<bool(int)>& predicate) {
    constexpr Here here{"setDataProtectionClassOfItemAtURL", __LINE__};
    if (predicate) {
        const auto current = protection_.classOf(fd);
        if (!current)
            return posixError(here, current.error(), "Failed to getclass of file %s: %s", ZOR_SHOWN(path),
                              current.error().text());
        if (!predicate(*current))
            return {};
    }
    if (const Errno failure = protection_.setClass(fd, protectionClass))
        return posixError(here, failure, "Failed to setclass(%d) on file %s: %s", protectionClass, ZOR_SHOWN(path),
                          failure.text());
    return {};
}

} // namespace zor
