// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/SemaphoreBootMarker.h"

#include "platform/linux/Names.h"

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

constexpr mode_t markerMode = 0400;

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

} // namespace

SemaphoreBootMarker::SemaphoreBootMarker(const SystemRoot& root) : name_(nameFor(root)) {}

BootMarker::State SemaphoreBootMarker::look() const {
    struct stat status{};
    const std::string file = std::string(names::semaphoreDirectory) + "/" + names::semaphoreFilePrefix + name_;
    if (::fstatat(AT_FDCWD, file.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
        return {};
    // Somebody could give a second name to another semaphore of ours, if that one is open to all.
    const bool ours = S_ISREG(status.st_mode) && status.st_uid == ::geteuid() && status.st_nlink == 1 &&
                      (status.st_mode & ALLPERMS & ~markerMode) == 0;
    return {.present = ours, .foreign = !ours};
}

int SemaphoreBootMarker::make() {
    if (look().foreign)
        (void)::sem_unlink(name_.c_str());
    sem_t* const made = ::sem_open(name_.c_str(), O_CREAT | O_EXCL, markerMode, 0U);
    if (made == SEM_FAILED)
        return errno;
    ::sem_close(made);
    return 0;
}

void SemaphoreBootMarker::forget() {
    (void)::sem_unlink(name_.c_str());
}

} // namespace zor::platform
