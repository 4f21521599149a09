// SPDX-License-Identifier: Apache-2.0
#include "device/DeviceQueries.h"

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <fcntl.h>
#include <semaphore.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr std::size_t releaseBytesMax = 64 * 1024;

/// Undoes the quoting of a shell assignment: '...' stands as it is, "..." has backslashes before " $ ` and itself.
std::string unquoted(std::string_view text) {
    while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r'))
        text.remove_suffix(1);
    if (text.size() < 2 || text.front() != text.back() || (text.front() != '"' && text.front() != '\''))
        return std::string(text);
    const char quote = text.front();
    text = text.substr(1, text.size() - 2);
    if (quote == '\'')
        return std::string(text);
    std::string value;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const bool escapes = text[i] == '\\' && i + 1 < text.size() &&
                             std::string_view("\"$`\\").find(text[i + 1]) != std::string_view::npos;
        value += text[escapes ? ++i : i];
    }
    return value;
}

} // namespace

std::string valueInRelease(std::string_view text, std::string_view key) {
    std::string value;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        std::string_view line = text.substr(0, end);
        text = end == std::string_view::npos ? std::string_view() : text.substr(end + 1);
        line.remove_prefix(std::min(line.find_first_not_of(" \t"), line.size()));
        if (line.starts_with(key) && line.substr(key.size()).starts_with('='))
            value = unquoted(line.substr(key.size() + 1));
    }
    return value;
}

bool LinuxInternalBuildQuery::isInternalBuild() const {
    return openInRoot(root_.descriptor(), names::internalBuildMark, O_PATH).has_value();
}

std::string LinuxSystemVersionQuery::buildVersion() const {
    const auto file = openInRoot(root_.descriptor(), names::operatingSystemRelease, O_RDONLY | O_NONBLOCK);
    if (!file)
        return {};
    const auto text = readSmallFile(file->get(), releaseBytesMax);
    if (!text)
        return {};
    std::string build = valueInRelease(*text, "BUILD_ID");
    return build.empty() ? valueInRelease(*text, "VERSION_ID") : build;
}

namespace {

constexpr mode_t markerMode = 0400;
/// A UUID and a line's end.
constexpr std::size_t bootIdentifierBytesMax = 64;

/// FNV-1a, 64 bits. It only keeps roots apart; nothing relies on its being hard to invert.
std::uint64_t hashOf(std::string_view text) {
    std::uint64_t hash = 0xCBF2'9CE4'8422'2325;
    for (const char c : text) {
        hash ^= static_cast<unsigned char>(c);
        hash *= 0x0000'0100'0000'01B3;
    }
    return hash;
}

std::string nameFor(const SystemRoot& root) {
    if (root.isDeviceRoot())
        return names::bootMarker;
    char suffix[24];
    std::snprintf(suffix, sizeof suffix, ".%016" PRIx64, hashOf(root.canonicalPath()));
    return std::string(names::bootMarker) + suffix;
}

std::string semaphoreFile(const std::string& name) {
    return std::string(names::semaphoreDirectory) + "/" + names::semaphoreFilePrefix + name;
}

/// Empty where the kernel tells none.
std::string thisBoot() {
    const FileDescriptor file(::open(names::bootIdentifier, O_RDONLY | O_CLOEXEC));
    return file.valid() ? readSmallFile(file.get(), bootIdentifierBytesMax).value_or("") : "";
}

/// Somebody could give a second name to another file of ours, if that one is open to all.
bool isOurs(const struct stat& status) {
    return S_ISREG(status.st_mode) && status.st_uid == ::geteuid() && status.st_nlink == 1 &&
           (status.st_mode & ALLPERMS & ~markerMode) == 0;
}

} // namespace

SemaphoreBootMarker::SemaphoreBootMarker(const SystemRoot& root) : root_(root), name_(nameFor(root)) {}

BootMarker::State SemaphoreBootMarker::look() const {
    struct stat status{};
    const bool exists = ::fstatat(AT_FDCWD, semaphoreFile(name_).c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0;
    const bool ours = exists && isOurs(status);
    return {.present = ours || fileNamesThisBoot(), .foreign = exists && !ours};
}

Errno SemaphoreBootMarker::make() {
    const Errno failure = makeSemaphore(look().foreign);
    return writeFile() ? failure : Errno();
}

void SemaphoreBootMarker::forget() {
    (void)::sem_unlink(name_.c_str());
    if (const auto directory = openBeneath(root_.descriptor(), names::runtimeDirectory, O_PATH | O_DIRECTORY))
        (void)::unlinkat(directory->get(), names::bootMarkerFile, 0);
}

Errno SemaphoreBootMarker::makeSemaphore(bool foreign) const {
    if (foreign && ::sem_unlink(name_.c_str()) != 0)
        (void)::rmdir(semaphoreFile(name_).c_str());
    sem_t* const made = ::sem_open(name_.c_str(), O_CREAT | O_EXCL, markerMode, 0U);
    if (made == SEM_FAILED)
        return Errno::last();
    ::sem_close(made);
    return Errno();
}

bool SemaphoreBootMarker::fileNamesThisBoot() const {
    const auto directory = openBeneath(root_.descriptor(), names::runtimeDirectory, O_PATH | O_DIRECTORY);
    if (!directory)
        return false;
    const auto file = openBeneath(directory->get(), names::bootMarkerFile, O_RDONLY | O_NOFOLLOW | O_NONBLOCK);
    struct stat status{};
    if (!file || ::fstat(file->get(), &status) != 0 || !isOurs(status))
        return false;
    const auto named = readSmallFile(file->get(), bootIdentifierBytesMax);
    return named && !named->empty() && *named == thisBoot();
}

Errno SemaphoreBootMarker::writeFile() const {
    const std::string boot = thisBoot();
    if (boot.empty())
        return Errno(ENOENT);
    const FileDescriptor directory =
        TRY(openBeneath(root_.descriptor(), names::runtimeDirectory, O_PATH | O_DIRECTORY));
    (void)::unlinkat(directory.get(), names::bootMarkerFile, 0);
    const FileDescriptor file =
        TRY(openBeneath(directory.get(), names::bootMarkerFile, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, markerMode));
    const ssize_t written = ::write(file.get(), boot.data(), boot.size());
    if (written < 0)
        return Errno::last();
    return written == static_cast<ssize_t>(boot.size()) ? Errno() : Errno(EIO);
}

} // namespace zor::platform
