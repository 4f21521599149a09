// SPDX-License-Identifier: Apache-2.0
#include "device/XattrProtectionClass.h"

#include "base/Try.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <string>
#include <sys/mman.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::platform {

namespace {

bool keysGoWithLock(int protectionClass) {
    return protectionClass == 1 || protectionClass == 2;
}

/// Root inside a container often lacks the right that the trusted namespace asks for. The right is the process's, not
/// the file system's, so a file in memory tells, and the disk stays as it is.
const char* chooseAttribute() {
    if (::geteuid() != 0)
        return names::protectionAttributeUser;
    const FileDescriptor probe(::memfd_create("zorvane", MFD_CLOEXEC));
    const bool refused =
        probe.valid() && ::fsetxattr(probe.get(), names::protectionAttribute, "0", 1, 0) != 0 && errno == EPERM;
    return refused ? names::protectionAttributeUser : names::protectionAttribute;
}

} // namespace

XattrProtectionClass::XattrProtectionClass(Disk& disk, const DeviceLockState& lockState)
    : attribute_(chooseAttribute()), disk_(disk), lockState_(lockState) {}

ErrnoOr<int> XattrProtectionClass::classOf(int fd) const {
    return TRY(classIn(fd, attribute_)).value_or(defaultProtectionClass);
}

ErrnoOr<std::optional<int>> XattrProtectionClass::classIn(int fd, const char* attribute) {
    char text[16];
    ssize_t bytes = ::fgetxattr(fd, attribute, text, sizeof text);
    // One that was opened for its path alone is reached by the kernel's link to it.
    if (bytes < 0 && errno == EBADF && fd >= 0)
        bytes = ::getxattr(("/proc/self/fd/" + std::to_string(fd)).c_str(), attribute, text, sizeof text);
    if (bytes < 0) {
        if (errno == ENODATA || errno == EOPNOTSUPP)
            return std::nullopt;
        if (errno == ERANGE) // a longer value is no number of ours
            return defaultProtectionClass;
        return neverLocked(Errno::last());
    }
    int protectionClass = 0;
    const auto [end, error] = std::from_chars(text, text + bytes, protectionClass);
    if (error != std::errc() || end != text + bytes || protectionClass < 0)
        return defaultProtectionClass;
    return protectionClass;
}

Errno XattrProtectionClass::setClass(int fd, int protectionClass) {
    if (protectionClass < 0)
        return Errno(EINVAL);
    if (lockState_.currentState() == DeviceLockState::locked) {
        const int current = TRY(classOf(fd));
        if (keysGoWithLock(protectionClass) || keysGoWithLock(current))
            return Errno(EPERM);
    }
    const std::string text = std::to_string(protectionClass);
    const Errno set =
        disk_.setAttribute(fd, attribute_, {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    if (set == EOPNOTSUPP)
        supported_.store(false, std::memory_order_relaxed);
    return neverLocked(set);
}

} // namespace zor::platform
