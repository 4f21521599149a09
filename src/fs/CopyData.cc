// SPDX-License-Identifier: Apache-2.0
#include "fs/CopyData.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <unistd.h>

namespace zor::fs {

namespace {

constexpr std::size_t bufferBytes = 128 * 1024;
/// A call of the kernel's copy cannot be interrupted, so it is not asked for more than this at once.
constexpr off_t kernelCopyBytesMax = 64 * 1024 * 1024;
constexpr off_t blockBytes = 512;

/// The call is not for this file or this pair of file systems; there is another way.
bool refused(ssize_t result) {
    return result == -EOPNOTSUPP || result == -EXDEV || result == -EINVAL || result == -ENOSYS || result == -ENOTTY;
}

} // namespace

int CopyData::copy(int from, int to, const struct stat& status) {
    if (status.st_size == 0)
        return 0;
    if (!cloneRefused_) {
        const int cloned = disk_.cloneData(from, to);
        if (cloned == 0)
            return tell(status.st_size);
        if (!refused(cloned))
            return cloned;
        // EINVAL may be about this one file.
        cloneRefused_ = cloned != -EINVAL;
    }
    if (status.st_blocks * blockBytes < status.st_size)
        return copyRuns(from, to, status.st_size);
    return static_cast<int>(std::min<off_t>(copyRun(from, to, status.st_size), 0));
}

int CopyData::copyRuns(int from, int to, off_t size) {
    off_t end = 0;
    while (end < size) {
        off_t data = ::lseek(from, end, SEEK_DATA);
        if (data < 0 && errno == ENXIO)
            break;
        // A file system that does not tell holes: all is data.
        off_t hole = data < 0 ? size : ::lseek(from, data, SEEK_HOLE);
        data = std::max(data, end);
        if (data >= size)
            break;
        hole = hole < 0 ? size : std::min(hole, size);
        if (::lseek(from, data, SEEK_SET) < 0 || ::lseek(to, data, SEEK_SET) < 0)
            return -errno;
        const off_t copied = copyRun(from, to, hole - data);
        if (copied < 0)
            return static_cast<int>(copied);
        if (copied < hole - data)
            return 0;
        end = hole;
    }
    return end < size ? extend(from, to, size) : 0;
}

off_t CopyData::copyRun(int from, int to, off_t bytes) {
    off_t copied = 0;
    while (copied < bytes) {
        if (!kernelCopyRefused_) {
            const ssize_t count =
                disk_.copyData(from, to, static_cast<std::size_t>(std::min(bytes - copied, kernelCopyBytesMax)));
            if (count > 0) {
                copied += count;
                if (const int told = tell(count); told < 0)
                    return told;
                continue;
            }
            if (count < 0 && !refused(count))
                return count;
            // 0 is the end of the file, or a file system whose files have a content but no such call: reading tells.
            kernelCopyRefused_ = count < 0;
        }
        buffer_.resize(bufferBytes);
        const std::size_t wanted = static_cast<std::size_t>(std::min<off_t>(bytes - copied, bufferBytes));
        const ssize_t count = ::read(from, buffer_.data(), wanted);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return count < 0 ? -errno : copied;
        if (const int written = disk_.write(to, std::span(buffer_).first(static_cast<std::size_t>(count))); written < 0)
            return written;
        copied += count;
        if (const int told = tell(count); told < 0)
            return told;
    }
    return copied;
}

/// The file ends with a hole: a last byte gives the copy its length.
int CopyData::extend(int from, int to, off_t size) {
    struct stat now{};
    if (::fstat(from, &now) != 0)
        return -errno;
    size = std::min(size, now.st_size);
    const off_t length = ::lseek(to, 0, SEEK_END);
    if (length < 0)
        return -errno;
    if (size <= length)
        return 0;
    if (::lseek(to, size - 1, SEEK_SET) < 0)
        return -errno;
    const std::array<std::uint8_t, 1> zero{};
    return disk_.write(to, zero);
}

} // namespace zor::fs
