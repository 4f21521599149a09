// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/XattrProtectionClass.h"

#include "platform/linux/Names.h"

#include <cerrno>
#include <charconv>
#include <string>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr int stateLocked = 1;

bool keysGoWithLock(int protectionClass) {
    return protectionClass == 1 || protectionClass == 2;
}

/// Root inside a container often lacks the right that the trusted namespace asks for.
const char* chooseAttribute(const SystemRoot& root) {
    if (::geteuid() != 0)
        return names::protectionAttributeUser;
    if (::fsetxattr(root.runtimeDirectory(), names::protectionAttribute, "0", 1, 0) != 0)
        return errno == EPERM ? names::protectionAttributeUser : names::protectionAttribute;
    (void)::fremovexattr(root.runtimeDirectory(), names::protectionAttribute);
    return names::protectionAttribute;
}

} // namespace

XattrProtectionClass::XattrProtectionClass(const SystemRoot& root, Disk& disk, const DeviceLockState& lockState)
    : attribute_(chooseAttribute(root)), disk_(disk), lockState_(lockState) {}

std::expected<int, int> XattrProtectionClass::classOf(int fd) const {
    const auto found = classIn(fd, attribute_);
    if (!found)
        return std::unexpected(found.error());
    return found->value_or(defaultProtectionClass);
}

std::expected<std::optional<int>, int> XattrProtectionClass::classIn(int fd, const char* attribute) {
    char text[16];
    const ssize_t bytes = ::fgetxattr(fd, attribute, text, sizeof text);
    if (bytes < 0) {
        if (errno == ENODATA || errno == EOPNOTSUPP)
            return std::nullopt;
        if (errno == ERANGE) // a longer value is no number of ours
            return defaultProtectionClass;
        return std::unexpected(errno == EPERM ? EACCES : errno);
    }
    int protectionClass = 0;
    const auto [end, error] = std::from_chars(text, text + bytes, protectionClass);
    if (error != std::errc() || end != text + bytes || protectionClass < 0)
        return defaultProtectionClass;
    return protectionClass;
}

int XattrProtectionClass::setClass(int fd, int protectionClass) {
    if (protectionClass < 0)
        return EINVAL;
    if (lockState_.currentState() == stateLocked) {
        const auto current = classOf(fd);
        if (!current)
            return current.error();
        if (keysGoWithLock(protectionClass) || keysGoWithLock(*current))
            return EPERM;
    }
    const std::string text = std::to_string(protectionClass);
    const int set =
        disk_.setAttribute(fd, attribute_, {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    if (set == -EOPNOTSUPP)
        supported_.store(false, std::memory_order_relaxed);
    return set == -EPERM ? EACCES : -set;
}

} // namespace zor::platform
