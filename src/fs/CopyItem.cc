// SPDX-License-Identifier: Apache-2.0
// One item copied, out of a copy of a tree.
#include "fs/Trees.h"

#include "os/FileModes.h"
#include "platform/Errno.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <linux/limits.h>
#include <linux/posix_acl.h>
#include <linux/posix_acl_xattr.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::fs {

namespace {

constexpr const char* accessAcl = "system.posix_acl_access";
constexpr const char* defaultAcl = "system.posix_acl_default";
/// A list or a value that grew between the question for it and the answer is asked for again.
constexpr int attemptsMax = 8;

bool isAcl(std::string_view name) {
    return name == accessAcl || name == defaultAcl;
}

} // namespace

CopyAttributes::CopyAttributes(platform::Disk& disk) : disk_(disk), isRoot_(::geteuid() == 0) {}

/// Powers that come from the content of the source, or sums over its inode.
bool CopyAttributes::skips(std::string_view name) const {
    return name == "security.capability" || name == "security.ima" || name == "security.evm";
}

/// Whether the copy may go without an attribute: the destination's file system does not have its kind, or only root may
/// set it.
bool CopyAttributes::mayLack(std::string_view name, Errno error) const {
    if (error == EOPNOTSUPP)
        return true;
    const bool isUser = name.starts_with("user.") || isAcl(name);
    return !isRoot_ && !isUser && (error == EPERM || error == EACCES);
}

Errno CopyAttributes::list(int file) {
    // Nearly every file answers with nothing, which needs no buffer.
    ssize_t length = ::flistxattr(file, nullptr, 0);
    for (int attempt = 0; length > 0 && attempt < attemptsMax; ++attempt) {
        names_.resize(XATTR_LIST_MAX);
        length = ::flistxattr(file, names_.data(), names_.size());
        if (length >= 0 || errno != ERANGE)
            break;
    }
    names_.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
    return length < 0 && errno != EOPNOTSUPP ? Errno::last() : Errno();
}

Errno CopyAttributes::copyAttribute(int from, int to, const char* name) {
    value_.resize(XATTR_SIZE_MAX);
    const ssize_t length = ::fgetxattr(from, name, value_.data(), value_.size());
    if (length < 0)
        return errno == ENODATA || mayLack(name, Errno::last()) ? Errno() : Errno::last();
    const Errno set = disk_.setAttribute(to, name, std::span(value_).first(static_cast<std::size_t>(length)));
    return mayLack(name, set) ? Errno() : set;
}

Errno CopyAttributes::copy(int from, int to, const struct stat& status, mode_t mode) {
    TRY(list(from));
    // Attributes while the file is still writable for us, then the owner (which takes bits from the mode), then the
    // mode, then the lists that refine it.
    bool hasAcl = false;
    for (std::size_t at = 0; at < names_.size(); at += std::strlen(&names_[at]) + 1) {
        const char* const name = &names_[at];
        hasAcl = hasAcl || isAcl(name);
        if (isAcl(name) || skips(name))
            continue;
        TRY(copyAttribute(from, to, name));
    }
    TRY(disk_.changeOwner(to, status.st_uid, status.st_gid));
    TRY(disk_.changeMode(to, mode));
    if (hasAcl)
        for (const char* name : {accessAcl, defaultAcl})
            TRY(copyAttribute(from, to, name));
    TRY(dropInheritedAcl(from, to, mode));
    return disk_.setTimes(to, status.st_atim, status.st_mtim);
}

Errno CopyAttributes::giveBasic(int to, const struct stat& status, mode_t mode) {
    TRY(disk_.changeOwner(to, status.st_uid, status.st_gid));
    TRY(disk_.changeMode(to, mode));
    return disk_.setTimes(to, status.st_atim, status.st_mtim);
}

/// Takes an access control list away that the copy inherited and the source does not have.
Errno CopyAttributes::dropInheritedAcl(int from, int to, mode_t mode) {
    if (::fgetxattr(to, accessAcl, nullptr, 0) <= 0 || ::fgetxattr(from, accessAcl, nullptr, 0) > 0)
        return Errno();
    // A list that says no more than the mode is kept as the mode alone.
    struct MinimalAcl {
        posix_acl_xattr_header header;
        std::array<posix_acl_xattr_entry, 3> entries;
    };
    constexpr auto undefinedId = static_cast<__u32>(ACL_UNDEFINED_ID);
    const auto permissions = [mode](unsigned shift) { return static_cast<__u16>((mode >> shift) & 7U); };
    const MinimalAcl acl{.header = {.a_version = POSIX_ACL_XATTR_VERSION},
                         .entries = {{{.e_tag = ACL_USER_OBJ, .e_perm = permissions(6), .e_id = undefinedId},
                                      {.e_tag = ACL_GROUP_OBJ, .e_perm = permissions(3), .e_id = undefinedId},
                                      {.e_tag = ACL_OTHER, .e_perm = permissions(0), .e_id = undefinedId}}}};
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(&acl);
    return disk_.setAttribute(to, accessAcl, {bytes, sizeof acl});
}

Errno CopyAttributes::dropInheritedDefaultAcl(int directory) {
    if (::fgetxattr(directory, defaultAcl, nullptr, 0) <= 0)
        return Errno();
    const posix_acl_xattr_header none{.a_version = POSIX_ACL_XATTR_VERSION};
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(&none);
    return disk_.setAttribute(directory, defaultAcl, {bytes, sizeof none});
}

namespace {

constexpr std::size_t bufferBytes = 128 * 1024;
/// A call of the kernel's copy cannot be interrupted, so it is not asked for more than this at once.
constexpr off_t kernelCopyBytesMax = 64 * 1024 * 1024;

/// The call is not for this file or this pair of file systems; there is another way.
bool refused(Errno error) {
    return error == EOPNOTSUPP || error == EXDEV || error == EINVAL || error == ENOSYS || error == ENOTTY;
}

} // namespace

Errno CopyData::copy(int from, int to, const struct stat& status) {
    if (status.st_size == 0)
        return Errno();
    if (!cloneRefused_) {
        const Errno cloned = disk_.cloneData(from, to);
        if (!cloned)
            return tell(status.st_size);
        if (!refused(cloned))
            return cloned;
        // EINVAL may be about this one file.
        cloneRefused_ = cloned != EINVAL;
    }
    if (status.st_blocks * platform::blockBytes < status.st_size)
        return copyRuns(from, to, status.st_size);
    (void)TRY(copyRun(from, to, status.st_size));
    return Errno();
}

Errno CopyData::copyRuns(int from, int to, off_t size) {
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
            return Errno::last();
        if (TRY(copyRun(from, to, hole - data)) < hole - data)
            return Errno();
        end = hole;
    }
    return end < size ? extend(from, to, size) : Errno();
}

ErrnoOr<off_t> CopyData::copyRun(int from, int to, off_t bytes) {
    off_t copied = 0;
    while (copied < bytes) {
        if (!kernelCopyRefused_) {
            const auto count =
                disk_.copyData(from, to, static_cast<std::size_t>(std::min(bytes - copied, kernelCopyBytesMax)));
            if (count && *count > 0) {
                copied += static_cast<off_t>(*count);
                TRY(tell(static_cast<off_t>(*count)));
                continue;
            }
            if (!count && !refused(count.error()))
                return count.error();
            // 0 is the end of the file, or a file system whose files have a content but no such call: reading tells.
            kernelCopyRefused_ = !count;
        }
        buffer_.resize(bufferBytes);
        const std::size_t wanted = static_cast<std::size_t>(std::min<off_t>(bytes - copied, bufferBytes));
        const ssize_t count = ::read(from, buffer_.data(), wanted);
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return Errno::last();
        if (count == 0)
            return copied;
        TRY(disk_.write(to, std::span(buffer_).first(static_cast<std::size_t>(count))));
        copied += count;
        TRY(tell(count));
    }
    return copied;
}

/// The file ends with a hole: a last byte gives the copy its length.
Errno CopyData::extend(int from, int to, off_t size) {
    struct stat now{};
    if (::fstat(from, &now) != 0)
        return Errno::last();
    size = std::min(size, now.st_size);
    const off_t length = ::lseek(to, 0, SEEK_END);
    if (length < 0)
        return Errno::last();
    if (size <= length)
        return Errno();
    if (::lseek(to, size - 1, SEEK_SET) < 0)
        return Errno::last();
    const std::array<std::uint8_t, 1> zero{};
    return disk_.write(to, zero);
}

} // namespace zor::fs
