// SPDX-License-Identifier: Apache-2.0
#include "fs/Durability.h"

#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "platform/Errno.h"
#include "plist/Codec.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <linux/magic.h>
#include <string>
#include <string_view>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

constexpr std::size_t randomCharacters = 6;
constexpr int namesTriedMax = 16;

constexpr std::string_view temporaryMark = ".new-";
/// The one name that a target's writes use, so that the next one finds what a stop left of the last: looking for it
/// would be a walk of a directory that its owner may have filled.
constexpr std::string_view usualSuffix = "000000";
static_assert(usualSuffix.size() == randomCharacters);

} // namespace

bool isWriteLeftover(std::string_view name) {
    const std::size_t suffix = temporaryMark.size() + randomCharacters;
    return name.starts_with('.') && name.size() > suffix &&
           name.substr(name.size() - suffix).starts_with(temporaryMark);
}

std::string uniqueName(std::string prefix) {
    static constexpr char alphabet[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_-";
    static_assert(sizeof alphabet - 1 == 64);
    std::uint8_t random[randomCharacters] = {};
    // Uniqueness comes from O_EXCL and mkdir; without entropy the callers' retries end with EEXIST.
    if (::getrandom(random, sizeof random, GRND_NONBLOCK) < 0)
        random[0] = 0;
    for (const std::uint8_t byte : random)
        prefix += alphabet[byte & 63];
    return prefix;
}

ErrnoOr<FileDescriptor> writeNewFile(platform::Disk& disk, int directory, const char* name, mode_t mode,
                                     std::span<const std::uint8_t> bytes) {
    FileDescriptor file = TRY(disk.createFile(directory, name, mode));
    // The process's umask, or what the directory hands down, may have changed it.
    struct stat made{};
    if (::fstat(file.get(), &made) != 0)
        return Errno::last();
    if ((made.st_mode & platform::permissionBits) != mode)
        TRY(disk.changeMode(file.get(), mode));
    TRY(disk.write(file.get(), bytes));
    return file;
}

Errno replaceFileDurably(platform::Disk& disk, int directory, const std::string& name, mode_t mode,
                         std::span<const std::uint8_t> bytes, const std::function<Errno(int file)>& prepare) {
    ZOR_ASSERT(!name.empty() && name.find('/') == std::string::npos);
    const std::string prefix = "." + name + std::string(temporaryMark);
    std::string temporary = prefix + std::string(usualSuffix);
    const auto write = [&] { return writeNewFile(disk, directory, temporary.c_str(), mode, bytes); };
    auto file = write();
    const auto isTaken = [&] { return !file && file.error() == EEXIST; };
    if (isTaken() && !disk.unlinkFile(directory, temporary.c_str()))
        file = write();
    // The directory's owner holds that name.
    for (int tried = 0; isTaken() && tried < namesTriedMax; ++tried) {
        temporary = uniqueName(prefix);
        file = write();
    }
    Errno error = file ? Errno() : file.error();
    if (!error && prepare)
        error = prepare(file->get());
    if (!error)
        error = disk.sync(file->get());
    if (!error)
        error = disk.rename(directory, temporary.c_str(), directory, name.c_str(), 0);
    if (error) {
        if (!isTaken())
            (void)disk.unlinkFile(directory, temporary.c_str());
        return error;
    }
    // The directory descriptor may be O_PATH, which cannot be synced.
    return disk.sync(TRY(platform::openBeneath(directory, ".", O_RDONLY | O_DIRECTORY)).get());
}

namespace {

/// EPERM for a file that somebody else may have written.
Errno judge(const struct stat& status, std::size_t bytesMax, std::optional<uid_t> formerOwner) {
    const bool trustedOwner = status.st_uid == 0 || status.st_uid == ::geteuid() || status.st_uid == formerOwner;
    if (!S_ISREG(status.st_mode) || status.st_nlink != 1 || !trustedOwner || (status.st_mode & (S_IWGRP | S_IWOTH)))
        return Errno(EPERM);
    return static_cast<std::size_t>(status.st_size) > bytesMax ? Errno(EFBIG) : Errno();
}

} // namespace

ErrnoOr<plist::Data> readOwnedFile(platform::Disk& disk, int directory, const char* path, std::size_t bytesMax,
                                   std::optional<uid_t> formerOwner) {
    const FileDescriptor file =
        TRY(platform::openBeneathOnMount(directory, path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
    struct stat status{};
    if (::fstat(file.get(), &status) != 0)
        return Errno::last();
    TRY(judge(status, bytesMax, formerOwner));
    // One that grows meanwhile is read to its old size.
    plist::Data bytes(static_cast<std::size_t>(status.st_size));
    std::size_t length = 0;
    while (length < bytes.size()) {
        const std::size_t count = TRY(disk.read(file.get(), std::span(bytes).subspan(length)));
        if (count == 0)
            break;
        length += count;
    }
    bytes.resize(length);
    return bytes;
}

} // namespace zor::fs

namespace zor {

Result<plist::Data> serialisedFor(const FileURL& url, const plist::Dictionary& dictionary, std::size_t bytesMax) {
    plist::Data bytes;
    if (const auto done = plist::appendBinary(dictionary, bytes); !done)
        return posixError(ZOR_HERE, Errno(EINVAL), "serialisation for %s failed: %s", url.c_str(), done.error().reason);
    if (bytes.size() > bytesMax)
        return posixError(ZOR_HERE, Errno(EFBIG),
                          "write of %s failed: %zu bytes are more than the %zu that it may have", url.c_str(),
                          bytes.size(), bytesMax);
    return bytes;
}

Result<void> writeToURL(const plist::Dictionary& dictionary, const FileURL& url, std::uint32_t options,
                        std::size_t bytesMax, ZORFileManager& fileManager) {
    if (options != (writeAtomically | writeWithoutProtection))
        return posixError(ZOR_HERE, Errno(EINVAL), "write of %s failed: options 0x%x are not offered", url.c_str(),
                          options);
    const plist::Data bytes = TRY(serialisedFor(url, dictionary, bytesMax));
    const auto parent = fileManager.resolver().openParent(url);
    const Errno error =
        parent ? fs::replaceFileDurably(
                     fileManager.disk(), parent->directory.get(), parent->name, 0644, bytes,
                     [&](int file) { return fileManager.setClassAtCreation(file, classWithoutProtection); })
               : parent.error();
    if (error)
        return posixError(ZOR_HERE, error, "write of %s failed: %s", url.c_str(), error.text());
    return {};
}

Result<plist::Dictionary> readDictionaryAtURL(const FileURL& url, std::size_t bytesMax, ZORFileManager& fileManager) {
    const auto parent = fileManager.resolver().openParent(url);
    const auto bytes =
        parent ? fs::readOwnedFile(fileManager.disk(), parent->directory.get(), parent->name.c_str(), bytesMax)
               : parent.error();
    if (!bytes)
        return posixError(ZOR_HERE, bytes.error(), "read of %s failed: %s", url.c_str(), bytes.error().text());
    auto value = plist::readPropertyList(*bytes);
    if (!value)
        return posixError(ZOR_HERE, Errno(EINVAL), "read of %s failed: %s", url.c_str(), value.error().text().c_str());
    plist::Dictionary* dictionary = value->asMutableDictionary();
    if (!dictionary)
        return posixError(ZOR_HERE, Errno(EINVAL), "read of %s failed: it is no dictionary", url.c_str());
    return std::move(*dictionary);
}

std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length) {
    return {bytes, length};
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
    return {bytes, std::strlen(bytes)};
}

bool containsDotDotPathComponents(std::string_view path) {
    while (!path.empty()) {
        const auto slash = path.find('/');
        if (path.substr(0, slash) == "..")
            return true;
        if (slash == std::string_view::npos)
            break;
        path.remove_prefix(slash + 1);
    }
    return false;
}

} // namespace zor

namespace zor::fs {

namespace {

/// The options in force of a mounted ext4, one a line, as its driver tells them; empty when it tells none.
std::string ext4Options(dev_t device) {
    char link[64];
    std::snprintf(link, sizeof link, "/sys/dev/block/%u:%u", major(device), minor(device));
    char target[256];
    const ssize_t length = ::readlink(link, target, sizeof target);
    if (length <= 0 || static_cast<std::size_t>(length) == sizeof target)
        return {};
    const std::string_view whole(target, static_cast<std::size_t>(length));
    const std::string path = "/proc/fs/ext4/" + std::string(whole.substr(whole.rfind('/') + 1)) + "/options";
    std::string options = "\n";
    if (std::FILE* file = std::fopen(path.c_str(), "re")) {
        char buffer[4096];
        options.append(buffer, std::fread(buffer, 1, sizeof buffer, file));
        std::fclose(file);
    }
    return options;
}

/// Only what the driver says counts: without a journal it names no data mode, and without barriers the device's cache
/// is not flushed. ext2 and ext3 disks come out right too, since it is the same driver that speaks.
bool hasOrderedJournal(dev_t device) {
    const std::string options = ext4Options(device);
    const auto has = [&](const char* option) { return options.find(option) != std::string::npos; };
    return (has("\ndata=ordered\n") || has("\ndata=journal\n")) && has("\nbarrier\n") &&
           !has("\njournal_async_commit\n");
}

bool onOneFileSystem(int one, int other) {
    struct stat status{};
    struct stat otherStatus{};
    return ::fstat(one, &status) == 0 && ::fstat(other, &otherStatus) == 0 && status.st_dev == otherStatus.st_dev;
}

} // namespace

Ordering orderingOfFileSystem(int fd) {
    struct statfs fileSystem{};
    struct stat status{};
    if (::fstatfs(fd, &fileSystem) != 0 || ::fstat(fd, &status) != 0)
        return Ordering::none;
    if (fileSystem.f_type == XFS_SUPER_MAGIC)
        return Ordering::journal;
    if (fileSystem.f_type == EXT4_SUPER_MAGIC && hasOrderedJournal(status.st_dev))
        return Ordering::journal;
    return Ordering::none;
}

Ordering Durability::ordering(int fd) const {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return Ordering::none;
    const platform::MutexLock held(mutex_);
    const auto known = orderings_.find(status.st_dev);
    if (known != orderings_.end())
        return known->second;
    return orderings_.emplace(status.st_dev, probe_(fd)).first->second;
}

Errno Durability::beforeMove(int file) const {
    return ordering(file) == Ordering::journal ? disk_.orderData(file) : disk_.syncFileSystem(file);
}

Errno Durability::beforeRemoval(int directory) const {
    return ordering(directory) == Ordering::journal ? Errno() : disk_.syncFileSystem(directory);
}

bool Durability::keepsOrder(int changed, int next) const {
    // A journal keeps the order of its own file system alone.
    return onOneFileSystem(changed, next) && ordering(changed) == Ordering::journal;
}

Errno Durability::between(int changed, int next) const {
    return keepsOrder(changed, next) ? Errno() : afterMove(changed);
}

Errno Durability::afterMove(int directory) const {
    return ordering(directory) == Ordering::journal ? disk_.sync(directory) : disk_.syncFileSystem(directory);
}

Errno Durability::afterMoves(int directory, int other) const {
    if (!onOneFileSystem(directory, other))
        TRY(afterMove(other));
    return afterMove(directory);
}

} // namespace zor::fs
