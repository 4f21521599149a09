// SPDX-License-Identifier: Apache-2.0
// The one place where the daemon creates, moves, copies, removes, lists, re-owns and measures directories.
//
// It keeps nothing but which warnings it has logged; any thread may call any operation. Each call resolves its paths
// anew without following a link (PathResolver), and acts on descriptors from there on: a path may lead elsewhere at any
// moment, a descriptor may not. Failures are POSIX-domain errors that name the item, and are not logged here; the
// operation that returns one to a client logs it.
//
// A stop in the middle leaves: of a new directory, a sibling named "NAME.XXXXXX"; of a move across file systems, a
// hidden ".zorvaned-copy-XXXXXX" beside the destination or where the source was. Neither is ever taken for the real
// thing.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/TreeWalker.h"
#include "fs/Trees.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"
#include "plist/Value.h"

#include <atomic>
#include <functional>
#include <set>
#include <string>
#include <string_view>
#include <unistd.h>
#include <vector>

namespace zor {

namespace fs {
class NamesMet;
}

enum class Intermediates { no, yes };

/// A protection-class argument that leaves the class alone.
inline constexpr int protectionClassUnchanged = -1;
/// An owner argument that leaves the ownership as it comes: the daemon's.
inline constexpr std::uint32_t ownerUnchanged = 0;

struct DirectoryAttributes {
    mode_t mode = 0755;
    std::uint32_t owner = ownerUnchanged; // user id and group id alike
    int protectionClass = protectionClassUnchanged;
    /// Attributes of missing levels that are made on the way.
    mode_t intermediateMode = 0755;
    /// A second user to whom an existing directory may belong; it is left to that user as it is.
    std::uint32_t otherOwner = ownerUnchanged;
};

class ZORFileManager {
public:
    ZORFileManager(const Log& log, const platform::SystemRoot& root, platform::Disk& disk,
                   platform::FileProtectionClass& protection)
        : log_(log), disk_(disk), protection_(protection),
          resolver_(root, [this](const FileURL& url, Errno error) { sayLeft(url.path(), error); }),
          daemon_(::geteuid()) {}
    ZORFileManager(const ZORFileManager&) = delete;
    ZORFileManager& operator=(const ZORFileManager&) = delete;

    // Creation. A new directory comes into existence under its final name only with its attributes. An existing one
    // that belongs to the wanted owner gets them again and counts as created, but nobody is let in by that where others
    // could have put it there: they can write its parent. Anybody else's stays as it is and is EPERM, for its name
    // alone makes no directory the wanted one.
    Result<void> createDirectoryAtURL(const FileURL& url, Intermediates intermediates,
                                      const DirectoryAttributes& attributes);
    /// The same, and the directory that was judged or made: for naming items in it.
    Result<platform::FileDescriptor> openOrCreateDirectoryAtURL(const FileURL& url, Intermediates intermediates,
                                                                const DirectoryAttributes& attributes);
    /// The same below a directory that is open, whose name `baseUrl` is in messages.
    Result<platform::FileDescriptor> openOrCreateDirectoryBelow(int base, const FileURL& baseUrl,
                                                                const std::string& relativePath,
                                                                Intermediates intermediates,
                                                                const DirectoryAttributes& attributes);
    /// Whether an open directory belongs to the user (the daemon, for ownerUnchanged); EPERM else. A daemon that is not
    /// root gives nothing away: there it has to be the daemon's own.
    Result<void> judgeOwner(int directory, const FileURL& url, std::uint32_t owner) const;
    Result<void> judgeOwner(const struct stat& directory, const FileURL& url, std::uint32_t owner) const;
    /// Opens a directory for reading its entries and acting on it, and judges its owner.
    Result<platform::FileDescriptor> openDirectoryOf(std::uint32_t owner, const FileURL& url) const;
    /// A new directory "temp." and six characters, mode 0700 and the daemon's own.
    Result<FileURL> createTemporaryDirectoryInDirectoryURL(const FileURL& directory);

    // Removal, copy, move.
    /// Asked often by calls that may take long. After the answer false the call ends with ECANCELED, as soon as all
    /// that it leaves is whole or hidden: the source of a copy stays, and what was copied is a leftover. A copy that
    /// has its name is a success, and what is left of its source a leftover.
    using GoOn = std::function<bool()>;
    /// Removes a tree; what is missing is not missed. An item that cannot be removed lets the rest go and is the error.
    /// An immutable or append-only item is made mutable and removed. Absent URL: EFAULT.
    Result<void> removeItemAtURL(const std::optional<FileURL>& url);
    /// The same of an item in a directory that is open; `url` is its name there, and in messages. A directory of which
    /// `isMeant` says no stays, with everything in it: ESTALE.
    Result<void> removeItemIn(int directory, const FileURL& url,
                              const std::function<bool(int directory)>& isMeant = nullptr);
    Result<void> copyItemAtURL(const FileURL& source, const FileURL& destination);
    Result<void> copyItemIfExistsAtURL(const FileURL& source, const FileURL& destination);
    Result<void> moveItemAtURL(const FileURL& source, const FileURL& destination, const GoOn& goOn = {});
    /// The same from and to directories that are open: it needs no descriptor then, unless it has to copy.
    enum class Moved { byName, byCopy };
    Result<Moved> moveItem(int fromDirectory, const FileURL& source, int toDirectory, const FileURL& destination,
                           const GoOn& goOn = {});
    /// The same by name alone: to another file system it fails with EXDEV.
    Result<void> renameItem(int fromDirectory, const FileURL& source, int toDirectory, const FileURL& destination);
    Result<void> moveItemIfExistsAtURL(const FileURL& source, const FileURL& destination);

    // Walking and listing.
    /// Every entry of the tree to the visitor, directories before and after what they hold.
    Result<void> _traverseDirectory(const FileURL& url,
                                    const std::function<Result<void>(const fs::WalkEntry&)>& visitor);
    /// Gives everything that belonged to `formerOwner` to the new one, but metadata files and files with a name outside
    /// the tree; that and what is the new one's becomes 0755, for directories and what has an execute bit, else 0644.
    /// Anybody else's keeps owner and mode, and is said.
    Result<void> standardizeOwnershipAtURL(const FileURL& url, uid_t uid, gid_t gid, uid_t formerOwner,
                                           const GoOn& goOn = {});
    /// The entries whose names do not begin with ".", in the directory's order. ENOKEY where an encryption hides them.
    Result<std::vector<FileURL>> urlsForItemsInDirectoryAtURL(const FileURL& directory);
    /// The same, each to the visitor as it is read, so that no directory is too large for the memory; with a false
    /// answer it is the last. The visitor gets the open directory too, and may remove the entry. The items that copies
    /// across file systems left hidden are shown where they are asked for.
    enum class Leftovers { hidden, shown };
    using ItemVisitor = std::function<bool(int directory, const FileURL& item)>;
    Result<void> forEachItemInDirectoryAtURL(const FileURL& directory, Leftovers leftovers, const ItemVisitor& visitor);
    /// The same of a directory that is open; `url` is its name in messages.
    Result<void> forEachItemIn(int directory, const FileURL& url, Leftovers leftovers, const ItemVisitor& visitor);
    /// The leftovers in a directory of moves across file systems that were cut short. Empty when it cannot be read.
    std::vector<FileURL> copyLeftoversInDirectoryAtURL(const FileURL& directory);
    /// The same for files whose atomic writing was cut short.
    std::vector<FileURL> writeLeftoversInDirectoryAtURL(const FileURL& directory);
    /// To the log, one line an entry.
    void printDirectoryStructureAtURL(const FileURL& url);
    /// Allocated bytes of everything below that is no directory, hard links once.
    [[nodiscard]] std::uint64_t diskUsageForURL(const FileURL& url);
    /// The same of a directory that was opened before; `url` is its name in messages.
    [[nodiscard]] fs::Usage diskUsageOfDirectory(const fs::OpenResult& directory, const FileURL& url);

    // Existence. An item that cannot be examined, or that an encryption hides, neither exists nor does not exist.
    [[nodiscard]] bool itemExistsAtURL(const FileURL& url);
    [[nodiscard]] bool itemDoesNotExistAtURL(const FileURL& url);
    /// Whether nothing is there, or no directory on the way, and nothing hides it. Silent.
    [[nodiscard]] bool itemIsGone(const FileURL& url) const;
    /// Whether nothing is there; of an item below a directory that is open, for callers that ask about very many; `url`
    /// names it in messages.
    [[nodiscard]] bool itemDoesNotExistBelow(int directory, const char* relativePath, const FileURL& url);

    // Data protection.
    Result<int> dataProtectionClassOfItemAtURL(const FileURL& url);
    /// `predicate` gets the current class and says whether to set; without one, always.
    Result<void> setDataProtectionClassOfItemAtURL(const FileURL& url, int protectionClass,
                                                   const std::function<bool(int)>& predicate = nullptr);
    // The same for what a walk has met. The item that is opened counts, and the predicate gets its status too. `path`
    // names it in messages. EPERM means that the device is locked, and nothing else.
    /// The descriptor of a regular file whose class is to be set, O_PATH where it cannot be opened otherwise. None:
    /// what lies there cannot be such a file, or has gone.
    Result<std::optional<platform::FileDescriptor>> openForDataProtection(const fs::WalkEntry& entry,
                                                                          const std::string& path) const;
    /// `kind` of st_mode; an item of another is left alone.
    Result<void>
    setDataProtectionClassOfOpenItem(int item, mode_t kind, const std::string& path, int protectionClass,
                                     const std::function<bool(const struct stat& status, int current)>& predicate);

    [[nodiscard]] const fs::PathResolver& resolver() const { return resolver_; }
    /// See PathResolver::fence. Before the first use of what lies there.
    void fence(const FileURL& url, fs::MountFence::Kind kind) { resolver_.fence(url, kind); }
    /// Says, once for a path, that it was left alone: a mount point (EXDEV), or below a home that does not answer.
    void sayLeft(const std::string& path, Errno error);
    [[nodiscard]] platform::Disk& disk() { return disk_; }
    /// Sets a class at the creation of a directory; a file system without classes is said once and is no failure.
    Errno setClassAtCreation(int directory, int protectionClass);
    /// The same for what this process has just made, which has no recorded class.
    Errno setClassOfNew(int fd, int protectionClass);

private:
    enum class MissingSource { fails, isFine };
    Result<void> _copyItemAtURL(const FileURL& source, const FileURL& destination, MissingSource missing);
    Result<void> _moveItemAtURL(const FileURL& source, const FileURL& destination, MissingSource missing,
                                const GoOn& goOn);
    Result<void> moveAcrossFileSystems(int fromDirectory, const FileURL& source, int toDirectory,
                                       const FileURL& destination, const GoOn& goOn);
    /// After an error the source has its name still, or is a hidden leftover.
    Errno removeMovedSource(int fromDirectory, const FileURL& source, int toDirectory, const GoOn& goOn);
    Result<bool> sourceIsMissing(const FileURL& source);
    /// Copies beside the destination and renames, so that a partial copy never has the final name.
    Result<void> copyTree(int fromDirectory, const FileURL& source, int toDirectory, const FileURL& destination,
                          const GoOn& goOn);

    std::vector<FileURL> itemsNamed(const FileURL& directory, bool (*belongs)(std::string_view name)) const;

    Result<void> setClassOf(int fd, const std::string& path, int protectionClass,
                            const std::function<bool(int)>& predicate);
    struct Base {
        int directory;
        fs::Mounts mounts;
        bool isUsers = false; ///< a user's own directory
    };
    Result<platform::FileDescriptor> openOrCreate(const Base& base, const std::string& relativePath, const FileURL& url,
                                                  Intermediates intermediates, const DirectoryAttributes& attributes);
    Result<platform::FileDescriptor> makeNewDirectory(const Base& base, std::string_view relativePath,
                                                      const FileURL& url, Intermediates intermediates,
                                                      const DirectoryAttributes& attributes);
    /// To a directory that this process has just made and that nobody has exchanged.
    Result<void> giveNewDirectory(int directory, const std::string& path, const DirectoryAttributes& attributes);
    /// To one that was there: judges it first.
    Result<void> mendDirectory(int directory, const FileURL& url, const DirectoryAttributes& attributes);
    Errno setClass(int fd, int protectionClass);
    /// The error for which a class could not be set.
    static Result<void> classSet(Errno failure, const std::string& path, int protectionClass);
    /// The user to whom a directory for `owner` belongs in the end.
    [[nodiscard]] uid_t ownerToBe(std::uint32_t owner) const;
    struct Standard {
        uid_t uid;
        gid_t gid;
        uid_t formerOwner;
        std::uint64_t others = 0; // items that are anybody else's
    };
    /// `directory` is the entry's own descriptor where it is a directory that is open, else negative.
    void standardizeEntry(int parent, const char* name, int directory, const std::string& path, Standard& standard,
                          fs::NamesMet& namesMet);

    const Log& log_;
    platform::Disk& disk_;
    platform::FileProtectionClass& protection_;
    fs::PathResolver resolver_;
    const uid_t daemon_;
    std::atomic<bool> saidClassesUnsupported_{false};
    platform::Mutex saidMutex_;
    std::set<std::string> saidLeft_ ZOR_GUARDED_BY(saidMutex_);
};

} // namespace zor
