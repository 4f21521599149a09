// SPDX-License-Identifier: Apache-2.0
// Creating directories, asking what exists, and protection classes.
#include "fs/ZORFileManager.h"

#include "fs/AtomicFile.h"
#include "platform/linux/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace zor {

using fs::uniqueName;
using platform::FileDescriptor;
using platform::openBeneath;

namespace {
constexpr int namesTriedMax = 16;
}

Result<void> ZORFileManager::createDirectoryAtURL(const FileURL& url, Intermediates intermediates,
                                                  const DirectoryAttributes& attributes) {
    struct stat status{};
    const int failure = resolver_.status(url, status);
    if (failure != 0 && failure != ENOENT)
        return posixError(ZOR_HERE, failure, "Failed to determine if %s exists: %s", url.c_str(), errorText(failure));
    if (failure == ENOENT)
        return makeNewDirectory(url, intermediates, attributes);
    if (!S_ISDIR(status.st_mode)) {
        // Changing the attributes of whatever stands there instead, perhaps through a link, would be acting on
        // another's file.
        const int number = S_ISLNK(status.st_mode) ? ELOOP : ENOTDIR;
        return posixError(ZOR_HERE, number, "%s of %s failed: %s",
                          intermediates == Intermediates::yes ? "dirchain" : "mkdir", url.c_str(), errorText(number));
    }
    const bool ownerFits =
        attributes.owner == ownerUnchanged || (status.st_uid == attributes.owner && status.st_gid == attributes.owner);
    if (attributes.protectionClass == protectionClassUnchanged && ownerFits &&
        (status.st_mode & 07777) == attributes.mode)
        return {};
    auto parent = resolver_.openParent(url);
    if (!parent)
        return posixError(ZOR_HERE, parent.error(), "Failed to determine if %s exists: %s", url.c_str(),
                          errorText(parent.error()));
    return applyAttributes(parent->directory.get(), parent->name, url.path(), attributes);
}

Result<void> ZORFileManager::makeNewDirectory(const FileURL& url, Intermediates intermediates,
                                              const DirectoryAttributes& attributes) {
    const char* const verb = intermediates == Intermediates::yes ? "dirchain" : "mkdir";
    const FileURL parentUrl = url.deletingLastPathComponent();
    const auto parent = intermediates == Intermediates::yes ? resolver_.makeDirectories(disk_, parentUrl)
                                                            : resolver_.openDirectoryPath(parentUrl);
    const std::string finalName(url.lastPathComponent());
    std::string name;
    int made = parent ? -EEXIST : -parent.error();
    for (int tried = 0; parent && made == -EEXIST && tried < namesTriedMax; ++tried) {
        name = uniqueName(finalName + ".");
        made = disk_.makeDirectory(parent->get(), name.c_str(), attributes.mode);
    }
    const std::string temporaryPath = parent ? parentUrl.appendingDirectory(name).path() : url.path();
    if (made == -EEXIST)
        return posixError(ZOR_HERE, EEXIST, "Failed to create temp dir at path %s : %s", temporaryPath.c_str(),
                          errorText(EEXIST));
    if (made < 0)
        return posixError(ZOR_HERE, -made, "%s of %s failed: %s", verb, temporaryPath.c_str(), errorText(-made));
    Result<void> placed = applyAttributes(parent->get(), name, temporaryPath, attributes);
    if (placed)
        if (const int renamed = disk_.rename(parent->get(), name.c_str(), parent->get(), finalName.c_str(), 0);
            renamed < 0)
            placed = posixError(ZOR_HERE, -renamed, "failed to rename from %s to %s : %s", temporaryPath.c_str(),
                                url.c_str(), errorText(-renamed));
    if (!placed)
        (void)disk_.removeDirectory(parent->get(), name.c_str());
    return placed;
}

Result<void> ZORFileManager::applyAttributes(int parent, const std::string& name, const std::string& path,
                                             const DirectoryAttributes& attributes) {
    const auto directory = openBeneath(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return posixError(ZOR_HERE, directory.error(), "opendir of %s failed: %s", path.c_str(),
                          errorText(directory.error()));
    if (attributes.protectionClass != protectionClassUnchanged) {
        const int failure = setClassAtCreation(directory->get(), attributes.protectionClass);
        if (failure != 0)
            return posixError(ZOR_HERE, failure, "Failed to setclass(%d) on directory %s: %s",
                              attributes.protectionClass, path.c_str(), errorText(failure));
    }
    struct stat status{};
    if (::fstat(directory->get(), &status) != 0)
        return posixError(ZOR_HERE, errno, "opendir of %s failed: %s", path.c_str(), errorText(errno));
    if ((status.st_mode & 07777) != attributes.mode)
        disk_.changeMode(directory->get(), attributes.mode);
    if (attributes.owner != ownerUnchanged && (status.st_uid != attributes.owner || status.st_gid != attributes.owner))
        disk_.changeOwner(directory->get(), attributes.owner, attributes.owner);
    return {};
}

int ZORFileManager::setClassAtCreation(int directory, int protectionClass) {
    const auto current = protection_.classOf(directory);
    if (current && *current == protectionClass)
        return 0;
    const int failure = protection_.setClass(directory, protectionClass);
    if (failure != ENOTSUP)
        return failure;
    if (!saidClassesUnsupported_.exchange(true))
        log_.write(logLevelNotice, __func__,
                   "The file system keeps no extended attributes; new directories have no protection class");
    return 0;
}

Result<FileURL> ZORFileManager::createTemporaryDirectoryInDirectoryURL(const FileURL& directory, std::uint32_t owner) {
    const auto parent = resolver_.openDirectoryPath(directory);
    std::string name;
    int made = parent ? -EEXIST : -parent.error();
    for (int tried = 0; parent && made == -EEXIST && tried < namesTriedMax; ++tried) {
        name = uniqueName("temp.");
        made = disk_.makeDirectory(parent->get(), name.c_str(), 0700);
    }
    FileURL url = directory.appendingDirectory(name);
    if (made < 0)
        return posixError(ZOR_HERE, -made, "Failed to create temp dir at path %s : %s",
                          directory.appendingDirectory("temp.XXXXXX").c_str(), errorText(-made));
    if (owner != ownerUnchanged)
        if (const auto own = openBeneath(parent->get(), name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW))
            disk_.changeOwner(own->get(), owner, owner);
    return url;
}

bool ZORFileManager::itemExistsAtURL(const FileURL& url) {
    struct stat status{};
    const int failure = resolver_.status(url, status);
    if (failure != 0 && failure != ENOENT)
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(), errorText(failure));
    return failure == 0;
}

bool ZORFileManager::itemDoesNotExistAtURL(const FileURL& url) {
    struct stat status{};
    const int failure = resolver_.status(url, status);
    if (failure != 0 && failure != ENOENT)
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(), errorText(failure));
    return failure == ENOENT;
}

bool ZORFileManager::itemDoesNotExistBelow(int directory, const char* relativePath, const FileURL& url) {
    const auto item = openBeneath(directory, relativePath, O_PATH | O_NOFOLLOW);
    if (!item && item.error() != ENOENT)
        log_.write(logLevelError, __func__, "Failed to determine if %s exists: %s", url.c_str(),
                   errorText(item.error()));
    return !item && item.error() == ENOENT;
}

Result<int> ZORFileManager::dataProtectionClassOfItemAtURL(const FileURL& url) {
    const auto item = resolver_.openItem(url, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!item)
        return posixError(ZOR_HERE, item.error(), "Failed to open %s : %s", url.c_str(), errorText(item.error()));
    const auto current = protection_.classOf(item->get());
    if (!current)
        return posixError(ZOR_HERE, current.error(), "Failed to getclass of file %s: %s", url.c_str(),
                          errorText(current.error()));
    return *current;
}

Result<void> ZORFileManager::setDataProtectionClassOfItemAtURL(const FileURL& url, int protectionClass,
                                                               const std::function<bool(int)>& predicate) {
    const auto item = resolver_.openItem(url, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!item)
        return posixError(ZOR_HERE, item.error(), "Failed to open %s : %s", url.c_str(), errorText(item.error()));
    return setClassOf(item->get(), url.path(), protectionClass, predicate);
}

Result<void> ZORFileManager::setDataProtectionClassOfEntry(
    const fs::WalkEntry& entry, const std::string& path, int protectionClass,
    const std::function<bool(const struct stat& status, int current)>& predicate) {
    if (entry.directory >= 0)
        return setClassOf(entry.directory, path, protectionClass,
                          [&](int current) { return predicate(entry.status, current); });
    const auto item =
        platform::openBeneathOnMount(entry.parent, entry.name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    // Gone, a link, something without a reader, or the place of a mount.
    if (!item && (item.error() == ENOENT || item.error() == ELOOP || item.error() == ENXIO || item.error() == EXDEV))
        return {};
    struct stat status{};
    if (!item || ::fstat(item->get(), &status) != 0) {
        const int number = platform::neverLocked(item ? errno : item.error());
        return posixError(ZOR_HERE, number, "Failed to open %s : %s", ZOR_SHOWN(path), errorText(number));
    }
    if (!S_ISREG(status.st_mode))
        return {};
    return setClassOf(item->get(), path, protectionClass, [&](int current) { return predicate(status, current); });
}

Result<void> ZORFileManager::setClassOf(int fd, const std::string& path, int protectionClass,
                                        const std::function<bool(int)>& predicate) {
    constexpr Here here{"setDataProtectionClassOfItemAtURL", __LINE__};
    if (predicate) {
        const auto current = protection_.classOf(fd);
        if (!current)
            return posixError(here, current.error(), "Failed to getclass of file %s: %s", ZOR_SHOWN(path),
                              errorText(current.error()));
        if (!predicate(*current))
            return {};
    }
    if (const int failure = protection_.setClass(fd, protectionClass))
        return posixError(here, failure, "Failed to setclass(%d) on file %s: %s", protectionClass, ZOR_SHOWN(path),
                          errorText(failure));
    return {};
}

} // namespace zor
