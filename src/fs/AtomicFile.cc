// SPDX-License-Identifier: Apache-2.0
#include "fs/AtomicFile.h"

#include "base/Assert.h"
#include "os/FileDescriptor.h"
#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <string_view>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

constexpr std::size_t randomCharacters = 6;
constexpr int namesTriedMax = 16;
constexpr mode_t permissionBits = 07777;

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

int writeNewFile(platform::Disk& disk, int directory, const char* name, mode_t mode,
                 std::span<const std::uint8_t> bytes) {
    FileDescriptor file(disk.createFile(directory, name, mode));
    if (!file.valid())
        return file.get();
    // The process's umask, or what the directory hands down, may have changed it.
    struct stat made{};
    int status = ::fstat(file.get(), &made) != 0 ? -errno : 0;
    if (status == 0 && (made.st_mode & permissionBits) != mode)
        status = disk.changeMode(file.get(), mode);
    if (status == 0)
        status = disk.write(file.get(), bytes);
    return status < 0 ? status : file.release();
}

int replaceFileDurably(platform::Disk& disk, int directory, const std::string& name, mode_t mode,
                       std::span<const std::uint8_t> bytes, const std::function<int(int file)>& prepare) {
    ZOR_ASSERT(!name.empty() && name.find('/') == std::string::npos);
    const std::string prefix = "." + name + std::string(temporaryMark);
    std::string temporary = prefix + std::string(usualSuffix);
    int descriptor = writeNewFile(disk, directory, temporary.c_str(), mode, bytes);
    if (descriptor == -EEXIST && disk.unlinkFile(directory, temporary.c_str()) == 0)
        descriptor = writeNewFile(disk, directory, temporary.c_str(), mode, bytes);
    // The directory's owner holds that name.
    for (int tried = 0; descriptor == -EEXIST && tried < namesTriedMax; ++tried) {
        temporary = uniqueName(prefix);
        descriptor = writeNewFile(disk, directory, temporary.c_str(), mode, bytes);
    }
    const FileDescriptor file(descriptor < 0 ? -1 : descriptor);
    int status = descriptor < 0 ? descriptor : 0;
    if (status == 0 && prepare)
        status = prepare(file.get());
    if (status == 0)
        status = disk.sync(file.get());
    if (status == 0)
        status = disk.rename(directory, temporary.c_str(), directory, name.c_str(), 0);
    if (status < 0) {
        if (descriptor != -EEXIST)
            disk.unlinkFile(directory, temporary.c_str());
        return status;
    }
    // The directory descriptor may be O_PATH, which cannot be synced.
    const auto listing = platform::openBeneath(directory, ".", O_RDONLY | O_DIRECTORY);
    return listing ? disk.sync(listing->get()) : -listing.error().number();
}

namespace {

/// EPERM for a file that somebody else may have written.
int judge(const struct stat& status, std::size_t bytesMax, std::optional<uid_t> formerOwner) {
    const bool trustedOwner = status.st_uid == 0 || status.st_uid == ::geteuid() || status.st_uid == formerOwner;
    if (!S_ISREG(status.st_mode) || status.st_nlink != 1 || !trustedOwner || (status.st_mode & (S_IWGRP | S_IWOTH)))
        return EPERM;
    return static_cast<std::size_t>(status.st_size) > bytesMax ? EFBIG : 0;
}

} // namespace

ErrnoOr<plist::Data> readOwnedFile(platform::Disk& disk, int directory, const char* path, std::size_t bytesMax,
                                   std::optional<uid_t> formerOwner) {
    const auto file = platform::openBeneathOnMount(directory, path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    if (!file)
        return file.error();
    struct stat status{};
    if (::fstat(file->get(), &status) != 0)
        return Errno::last();
    if (const int refused = judge(status, bytesMax, formerOwner))
        return std::unexpected(refused);
    // One that grows meanwhile is read to its old size.
    plist::Data bytes(static_cast<std::size_t>(status.st_size));
    std::size_t length = 0;
    while (length < bytes.size()) {
        const ssize_t count = disk.read(file->get(), std::span(bytes).subspan(length));
        if (count < 0)
            return std::unexpected(static_cast<int>(-count));
        if (count == 0)
            break;
        length += static_cast<std::size_t>(count);
    }
    bytes.resize(length);
    return bytes;
}

} // namespace zor::fs
