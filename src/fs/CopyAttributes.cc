// SPDX-License-Identifier: Apache-2.0
#include "fs/CopyAttributes.h"

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
bool CopyAttributes::mayLack(std::string_view name, int error) const {
    if (error == EOPNOTSUPP)
        return true;
    const bool isUser = name.starts_with("user.") || isAcl(name);
    return !isRoot_ && !isUser && (error == EPERM || error == EACCES);
}

int CopyAttributes::list(int file) {
    // Nearly every file answers with nothing, which needs no buffer.
    ssize_t length = ::flistxattr(file, nullptr, 0);
    for (int attempt = 0; length > 0 && attempt < attemptsMax; ++attempt) {
        names_.resize(XATTR_LIST_MAX);
        length = ::flistxattr(file, names_.data(), names_.size());
        if (length >= 0 || errno != ERANGE)
            break;
    }
    names_.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
    return length < 0 && errno != EOPNOTSUPP ? -errno : 0;
}

int CopyAttributes::copyAttribute(int from, int to, const char* name) {
    value_.resize(XATTR_SIZE_MAX);
    const ssize_t length = ::fgetxattr(from, name, value_.data(), value_.size());
    if (length < 0)
        return errno == ENODATA || mayLack(name, errno) ? 0 : -errno;
    const int result = disk_.setAttribute(to, name, std::span(value_).first(static_cast<std::size_t>(length)));
    return result < 0 && mayLack(name, -result) ? 0 : result;
}

int CopyAttributes::copy(int from, int to, const struct stat& status, mode_t mode) {
    if (const int listed = list(from); listed < 0)
        return listed;
    // Attributes while the file is still writable for us, then the owner (which takes bits from the mode), then the
    // mode, then the lists that refine it.
    bool hasAcl = false;
    for (std::size_t at = 0; at < names_.size(); at += std::strlen(&names_[at]) + 1) {
        const char* const name = &names_[at];
        hasAcl = hasAcl || isAcl(name);
        if (isAcl(name) || skips(name))
            continue;
        if (const int result = copyAttribute(from, to, name); result < 0)
            return result;
    }
    if (const int result = disk_.changeOwner(to, status.st_uid, status.st_gid); result < 0)
        return result;
    if (const int result = disk_.changeMode(to, mode); result < 0)
        return result;
    if (hasAcl)
        for (const char* name : {accessAcl, defaultAcl})
            if (const int result = copyAttribute(from, to, name); result < 0)
                return result;
    if (const int result = dropInheritedAcl(from, to, mode); result < 0)
        return result;
    return disk_.setTimes(to, status.st_atim, status.st_mtim);
}

int CopyAttributes::giveBasic(int to, const struct stat& status, mode_t mode) {
    if (const int result = disk_.changeOwner(to, status.st_uid, status.st_gid); result < 0)
        return result;
    if (const int result = disk_.changeMode(to, mode); result < 0)
        return result;
    return disk_.setTimes(to, status.st_atim, status.st_mtim);
}

/// Takes an access control list away that the copy inherited and the source does not have.
int CopyAttributes::dropInheritedAcl(int from, int to, mode_t mode) {
    if (::fgetxattr(to, accessAcl, nullptr, 0) <= 0 || ::fgetxattr(from, accessAcl, nullptr, 0) > 0)
        return 0;
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

int CopyAttributes::dropInheritedDefaultAcl(int directory) {
    if (::fgetxattr(directory, defaultAcl, nullptr, 0) <= 0)
        return 0;
    const posix_acl_xattr_header none{.a_version = POSIX_ACL_XATTR_VERSION};
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(&none);
    return disk_.setAttribute(directory, defaultAcl, {bytes, sizeof none});
}

} // namespace zor::fs
