// SPDX-License-Identifier: Apache-2.0
// Opening beneath an open directory, and what is read or named there.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <sys/types.h>
#include <vector>

namespace zor::platform {

// Opening below a directory that others may write to: no link is followed and no step leads out, whatever the tree does
// meanwhile. Any thread.

/// Opens `relativePath` below `directory` (RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS; O_CLOEXEC is
/// added). A link anywhere gives ELOOP (with O_PATH | O_NOFOLLOW a link in the last place too), a step out EXDEV.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneath(int directory, const char* relativePath, int flags, mode_t mode = 0);

/// The same, and no mount point is crossed, not even one of the same file system: EXDEV. The file system that is
/// mounted there is not asked. A ".." is refused even where it stays inside.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneathOnMount(int directory, const char* relativePath, int flags);

/// The same as openBeneath with O_PATH, out of the kernel's memory of names alone: no file system is asked, so none can
/// make it wait. EAGAIN, as often as it likes, where one would have to be asked, or where the kernel has no such call.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneathRemembered(int directory, const char* relativePath, int flags);

/// The same for a whole path, whose links are followed.
[[nodiscard]] ErrnoOr<FileDescriptor> openRemembered(const char* path);

/// The same as openBeneath for trees that only root writes to, such as DIR/etc: links are followed, as if `directory`
/// were "/".
[[nodiscard]] ErrnoOr<FileDescriptor> openInRoot(int directory, const char* relativePath, int flags);

/// The number of the mount that an open file lies on. Asks its file system nothing; errno on failure.
[[nodiscard]] ErrnoOr<std::uint64_t> mountIdOf(int fd);

// Reading a file of bounded size whole. Any thread.

/// Everything from the descriptor's offset on. EFBIG when that is more than `bytesMax`, EINVAL when it is no regular
/// file.
[[nodiscard]] ErrnoOr<std::string> readSmallFile(int fd, std::size_t bytesMax);
/// read(2) that no signal ends: the count.
[[nodiscard]] ErrnoOr<std::size_t> readOnce(int fd, std::span<std::uint8_t> bytes);

// The names in a directory that only root writes to. Any thread.

/// All names but "." and "..", sorted by their bytes; `directory` is a real descriptor, its offset is not used. An
/// errno when not all could be read.
[[nodiscard]] ErrnoOr<std::vector<std::string>> directoryNames(int directory);
/// The same for who can do without: none when it cannot be read.
[[nodiscard]] std::vector<std::string> directoryNamesIfAny(int directory);

// Whether a directory shows what is in it. One that is encrypted by its file system, while its key is away, does not:
// it lists names that are none, and a name that is there is answered as missing. Any thread.

/// False also where that cannot be told. `directory` is open, O_PATH will do.
[[nodiscard]] bool hidesNames(int directory);

} // namespace zor::platform
