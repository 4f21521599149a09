// SPDX-License-Identifier: Apache-2.0
// Changes that a power cut leaves whole or undone: the syncs that make moves last, and small files, which are replaced
// in one step and read where others may write.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"
#include "plist/Value.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace zor::fs {

// The syncs that make a change survive a power cut, on the file system that it is made on.
//
// A new container is built in staging and becomes visible with one move. Two things must hold: when the move is on the
// disk, so is all that it moved; and when the client has its answer, the move is on the disk.
//
// - ext4 with an ordered journal, and XFS, commit changes of names and inodes in the order in which they
//   were made. There it is enough to write the new file's data out before the move (beforeMove), and to sync the
//   destination directory once after it (afterMove): that one sync commits everything before it. It runs outside the
//   store's locks, and those of concurrent creators share a commit.
// - Any other file system promises no such order, so the whole file system is synced before the move and after it.
//
// Which kind a directory lies on is asked once for each device. Any thread.

/// How a file system orders what is not synced.
enum class Ordering { journal, none };

/// Asks the kernel for the file system of an open file: its type, and for ext4 the mount's options.
[[nodiscard]] Ordering orderingOfFileSystem(int fd);

class Durability {
public:
    using Probe = Ordering (*)(int fd);
    explicit Durability(platform::Disk& disk, Probe probe = orderingOfFileSystem) : disk_(disk), probe_(probe) {}

    /// Before a tree of new directories and small new files is moved into view. `file` is a new file in the tree whose
    /// data counts.
    Errno beforeMove(int file) const;
    /// After things were moved to a directory to be removed there, before they are: else a cut could leave the removal
    /// and undo the move.
    Errno beforeRemoval(int directory) const;
    /// Between a change of names in one directory and one in another that must not be durable without it.
    Errno between(int changed, int next) const;
    /// Whether the file systems see to that themselves, so that `between` has nothing to wait for.
    [[nodiscard]] bool keepsOrder(int changed, int next) const;
    /// After the move, before it is acknowledged; needs no lock. `directory` is where the name came to be.
    Errno afterMove(int directory) const;
    /// The same for changes of names in two directories, which may lie on two file systems.
    Errno afterMoves(int directory, int other) const;

private:
    [[nodiscard]] Ordering ordering(int fd) const;

    platform::Disk& disk_;
    const Probe probe_;
    mutable platform::Mutex mutex_;
    mutable std::map<dev_t, Ordering> orderings_ ZOR_GUARDED_BY(mutex_);
};

// Replacing a file in one step: the old content or the new one, whole, whenever somebody looks or the power goes.
//
// A temporary file (its name begins with ".") in the same directory is written and synced, renamed over the target, and
// the directory is synced. A stop before the rename leaves the temporary file, which no listing shows; the next write
// of the same target removes it. Any thread; writers of one target are serialised by their
// callers.

/// An error leaves the target untouched (unless only the last directory sync failed). `mode` is set whatever the
/// process's mask; the file belongs to the daemon. `prepare` does more to the new file before it is synced.
Errno replaceFileDurably(platform::Disk& disk, int directory, const std::string& name, mode_t mode,
                         std::span<const std::uint8_t> bytes, const std::function<Errno(int file)>& prepare = nullptr);

/// Whether a file of this name is what a write that was cut short left.
[[nodiscard]] bool isWriteLeftover(std::string_view name);

/// A new file with the content, not synced. An error leaves nothing behind but perhaps the file.
[[nodiscard]] ErrnoOr<platform::FileDescriptor> writeNewFile(platform::Disk& disk, int directory, const char* name,
                                                             mode_t mode, std::span<const std::uint8_t> bytes);

/// `prefix` and six random characters.
[[nodiscard]] std::string uniqueName(std::string prefix);

// Reading small files that lie where others may write: only what the daemon itself can have written is believed.

/// Largest file of one container: its info values have to fit.
inline constexpr std::size_t metadataFileBytesMax = std::size_t{1} << 20;

/// The whole of a file. `path` is relative to `directory` and resolved without following a link.
///
/// The file must be regular, have one link, belong to root or the daemon's user (or to `formerOwner`, for files of an
/// older system), not be writable by group or others, and hold at most `bytesMax`; else EPERM or EFBIG. Opening cannot
/// block, whatever is found there. Any thread.
[[nodiscard]] ErrnoOr<plist::Data> readOwnedFile(platform::Disk& disk, int directory, const char* path,
                                                 std::size_t bytesMax, std::optional<uid_t> formerOwner = std::nullopt);

} // namespace zor::fs

namespace zor {

/// How a property-list file is written. The numbers are part of the store's form.
inline constexpr std::uint32_t writeAtomically = 0x1;
inline constexpr std::uint32_t writeWithoutProtection = 0x10000000;
/// The data-protection class of what is written without protection: it can be read while the device is locked.
inline constexpr int classWithoutProtection = 4;

/// The bytes of the file that `url` is to be, in messages. EFBIG for more than `bytesMax`.
Result<plist::Data> serialisedFor(const FileURL& url, const plist::Dictionary& dictionary, std::size_t bytesMax);

/// Serialises as a binary property list and writes it, 0644 and the daemon's own; POSIX error with the previous file
/// untouched. Both options are what every caller wants; others are not offered. EFBIG, before anything is written, for
/// more than `bytesMax`: what a reader would refuse must not replace what it accepts.
Result<void> writeToURL(const plist::Dictionary& dictionary, const FileURL& url, std::uint32_t options,
                        std::size_t bytesMax, ZORFileManager& fileManager);

/// A dictionary from a file that only the daemon can have written, in either property-list form. POSIX error: ENOENT
/// when there is none, EINVAL when it is no dictionary.
Result<plist::Dictionary> readDictionaryAtURL(const FileURL& url, std::size_t bytesMax, ZORFileManager& fileManager);

/// Bytes of a path as a string: what is not UTF-8 stays as it is, for names are bytes.
std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length);
std::string stringWithFileSystemRepresentation(const char* bytes);
/// Whether a component is exactly "..".
[[nodiscard]] bool containsDotDotPathComponents(std::string_view path);

} // namespace zor
