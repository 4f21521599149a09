// SPDX-License-Identifier: Apache-2.0
// Private to the copy: the hidden directory ".links-…" in the destination's root. It holds one more link to each copied
// file whose source has several, named after the source's inode, so that the next name of that file becomes a link and
// nothing has to be kept in memory. It goes before the root gets its attributes.
#include "fs/RecursiveCopy.h"

#include "fs/CopyItem.h"
#include "fs/ItemStatus.h"
#include "fs/RecursiveRemove.h"
#include "fs/TreeWalker.h"
#include "os/Openat2.h"

#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <fcntl.h>
#include <string>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

constexpr mode_t permissionBits = 07777;
/// The bits of its mode that a copied file keeps: set-user-ID and set-group-ID are not copied.
constexpr mode_t filePermissionBits = 01777;
/// The bits that content keeps.
constexpr mode_t accessBits = 0777;

/// The ways in which a file system, or a limit of it, says that a second link cannot be.
bool linkImpossible(int result) {
    return result == -EMLINK || result == -EPERM || result == -EOPNOTSUPP;
}

/// Names a file of the source for the time of the copy. The birth time tells an inode number from its next owner's.
std::string linkKey(int file, const struct stat& status) {
    struct statx extended{};
    if (::statx(file, "", AT_EMPTY_PATH, STATX_BTIME, &extended) != 0 || (extended.stx_mask & STATX_BTIME) == 0)
        extended.stx_btime = {};
    std::array<char, 96> key{};
    std::snprintf(key.data(), key.size(), "%llu-%lld-%u", static_cast<unsigned long long>(status.st_ino),
                  static_cast<long long>(extended.stx_btime.tv_sec), extended.stx_btime.tv_nsec);
    return key.data();
}

class Copier {
public:
    Copier(platform::Disk& disk, int toDirectory, const char* to, const std::function<bool()>& goOn)
        : disk_(disk), attributes_(disk), data_(disk, goOn ? [goOn](std::uint64_t) { return goOn() ? 0 : -ECANCELED; }
                                                           : std::function<int(std::uint64_t)>()),
          toDirectory_(toDirectory), to_(to), goOn_(goOn) {}
    /// The copy of content, into `toDirectory` itself.
    Copier(platform::Disk& disk, int toDirectory, const ContentRules& rules)
        : disk_(disk), attributes_(disk), data_(disk, rules.copied), toDirectory_(toDirectory), to_("."),
          rules_(&rules) {}

    int copy(int fromDirectory, const char* from);

private:
    int visit(const WalkEntry& entry);
    int beginDirectory(const WalkEntry& entry);
    int enter(FileDescriptor directory, const WalkEntry& entry);
    int endDirectory(const WalkEntry& entry);
    int copyFile(const WalkEntry& entry);
    int copyFileAs(const FileDescriptor& source, const struct stat& status, const WalkEntry& entry);
    int copyLink(const WalkEntry& entry);
    int copyOther(const WalkEntry& entry);
    int finishUnopened(const WalkEntry& entry, mode_t type);
    int openLinks();
    int finish(int from, int to, struct stat status, mode_t permissions);
    [[nodiscard]] int destinationParent() const { return destination_.empty() ? toDirectory_ : destination_.top(); }
    [[nodiscard]] const char* destinationName(const WalkEntry& entry) const {
        return entry.depth == 0 ? to_ : entry.name;
    }

    platform::Disk& disk_;
    CopyAttributes attributes_;
    CopyData data_;
    const int toDirectory_;
    const char* const to_;
    const std::function<bool()> goOn_;
    /// nullptr: everything comes along.
    const ContentRules* const rules_ = nullptr;
    DirectoryStack destination_;
    /// The status of the source's directory of each level, from before it was read.
    std::vector<timespec> accessTimes_;
    FileDescriptor links_;
    std::string linksName_;
};

int Copier::copy(int fromDirectory, const char* from) {
    int firstError = 0;
    TreeWalker walker(WalkStatus::full);
    const int result = walker.walk(fromDirectory, from, [&](const WalkEntry& entry) {
        firstError = visit(entry);
        if (firstError != 0 && rules_)
            rules_->failed(entry, firstError);
        return firstError == 0 ? WalkStep::proceed : WalkStep::stop;
    });
    if (firstError != 0)
        return firstError;
    if (result != 0)
        return result;
    return walker.vanishedDirectories() == 0 ? 0 : -ESTALE;
}

int Copier::visit(const WalkEntry& entry) {
    if (goOn_ && !goOn_())
        return -ECANCELED;
    if (entry.onOtherFileSystem)
        return -EXDEV;
    const bool leaving = entry.kind == WalkEntryKind::directoryEnd;
    if (entry.kind == WalkEntryKind::unreadableDirectory || entry.kind == WalkEntryKind::noStatus)
        return -entry.error;
    // The walk dropped levels that were moved away: what was copied of them is not whole.
    if (destination_.depth() != entry.depth + (leaving ? 1 : 0))
        return -ESTALE;
    // A link is asked about once its target is known, and a file once it is open: it may be another one by then.
    const bool askedLater = entry.kind == WalkEntryKind::symbolicLink || entry.kind == WalkEntryKind::file;
    if (rules_ && entry.depth > 0 && !leaving && !askedLater)
        if (const int refused = rules_->admit(entry, entry.directory, nullptr); refused < 0)
            return refused;
    switch (entry.kind) {
    case WalkEntryKind::directory:
        // One that could not be opened is told as unreadable next.
        return entry.directory < 0 ? 0 : beginDirectory(entry);
    case WalkEntryKind::directoryEnd:
        return endDirectory(entry);
    case WalkEntryKind::file:
        return copyFile(entry);
    case WalkEntryKind::symbolicLink:
        return copyLink(entry);
    default:
        return copyOther(entry);
    }
}

int Copier::beginDirectory(const WalkEntry& entry) {
    if (entry.depth == 0 && rules_)
        return enter(FileDescriptor(::fcntl(toDirectory_, F_DUPFD_CLOEXEC, 0)), entry);
    const char* const name = destinationName(entry);
    const int parent = destinationParent();
    if (const int made = disk_.makeDirectory(parent, name, 0700); made < 0)
        return made;
    auto directory = platform::openBeneathOnMount(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return -directory.error().number();
    return enter(std::move(*directory), entry);
}

int Copier::enter(FileDescriptor directory, const WalkEntry& entry) {
    if (entry.depth == 0) {
        if (!isFreshDirectory(directory.get()))
            return -ESTALE;
        if (const int result = attributes_.dropInheritedDefaultAcl(directory.get()); result < 0)
            return result;
    }
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0)
        return -errno;
    destination_.push(std::move(directory), status.st_dev, status.st_ino, destinationName(entry));
    accessTimes_.push_back(entry.status.st_atim);
    return 0;
}

int Copier::endDirectory(const WalkEntry& entry) {
    if (entry.depth == 0 && links_.valid()) {
        links_.reset();
        if (const int removed = removeTree(disk_, destination_.root(), linksName_.c_str()); removed < 0)
            return removed;
    }
    // Before the modes change: a directory that its owner may not search has no ".." for him.
    std::size_t levelsLost = 0;
    if (!destination_.ensureParent(levelsLost))
        return -ESTALE;
    struct stat status = entry.status;
    status.st_atim = accessTimes_.back();
    // The root of a content's copy is the caller's.
    const int result = rules_ && entry.depth == 0
                           ? 0
                           : finish(entry.directory, destination_.top(), status,
                                    rules_ ? (status.st_mode & accessBits) | S_IRWXU : status.st_mode & permissionBits);
    if (result == 0) {
        destination_.pop();
        accessTimes_.pop_back();
    }
    return result;
}

int Copier::copyFile(const WalkEntry& entry) {
    constexpr int flags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW;
    const auto source = platform::openBeneathOnMount(entry.parent, entry.name, flags);
    if (!source)
        return source.error() == ENOENT && entry.depth > 0 ? 0 : -source.error().number();
    struct stat status{};
    if (::fstat(source->get(), &status) != 0)
        return -errno;
    if (!S_ISREG(status.st_mode))
        return -ESTALE;
    if (rules_) {
        WalkEntry opened = entry;
        opened.status = status;
        if (const int refused = rules_->admit(opened, source->get(), nullptr); refused < 0)
            return refused;
    }
    if (status.st_nlink < 2 || entry.depth == 0)
        return copyFileAs(*source, status, entry);
    if (const int opened = openLinks(); opened < 0)
        return opened;
    const std::string key = linkKey(source->get(), status);
    const int linked = disk_.makeHardLink(links_.get(), key.c_str(), destinationParent(), entry.name);
    if (linked != -ENOENT && !linkImpossible(linked))
        return linked;
    if (const int copied = copyFileAs(*source, status, entry); copied < 0)
        return copied;
    if (linked != -ENOENT)
        return 0;
    const int kept = disk_.makeHardLink(destinationParent(), entry.name, links_.get(), key.c_str());
    return linkImpossible(kept) ? 0 : kept;
}

int Copier::copyFileAs(const FileDescriptor& source, const struct stat& status, const WalkEntry& entry) {
    const FileDescriptor file(disk_.createFile(destinationParent(), destinationName(entry), 0600));
    if (!file.valid())
        return file.get();
    if (const int copied = data_.copy(source.get(), file.get(), status); copied < 0)
        return copied;
    return finish(source.get(), file.get(), status, status.st_mode & (rules_ ? accessBits : filePermissionBits));
}

int Copier::finish(int from, int to, struct stat status, mode_t permissions) {
    if (!rules_)
        return attributes_.copy(from, to, status, permissions);
    status.st_uid = rules_->owner;
    status.st_gid = rules_->group;
    return attributes_.giveBasic(to, status, permissions);
}

int Copier::copyLink(const WalkEntry& entry) {
    std::array<char, PATH_MAX + 1> target;
    const ssize_t length = ::readlinkat(entry.parent, entry.name, target.data(), target.size());
    if (length < 0 && errno == ENOENT && entry.depth > 0)
        return 0;
    if (length < 0)
        return errno == EINVAL ? -ESTALE : -errno;
    if (static_cast<std::size_t>(length) == target.size())
        return -ENAMETOOLONG;
    target[static_cast<std::size_t>(length)] = '\0';
    if (rules_)
        if (const int refused = rules_->admit(entry, -1, target.data()); refused < 0)
            return refused;
    const int made = disk_.makeSymbolicLink(target.data(), destinationParent(), destinationName(entry));
    return made < 0 ? made : finishUnopened(entry, S_IFLNK);
}

int Copier::copyOther(const WalkEntry& entry) {
    // Skipped in a tree; as the whole of what was to be copied it cannot be a success.
    if (S_ISSOCK(entry.status.st_mode))
        return entry.depth == 0 ? -EOPNOTSUPP : 0;
    if (!S_ISFIFO(entry.status.st_mode))
        return -EPERM;
    const int made = disk_.makeFifo(destinationParent(), destinationName(entry), 0600);
    return made < 0 ? made : finishUnopened(entry, S_IFIFO);
}

/// Owner, mode and times of what is not opened for reading.
int Copier::finishUnopened(const WalkEntry& entry, mode_t type) {
    const FileDescriptor item(::openat(destinationParent(), destinationName(entry), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat status{};
    if (!item.valid() || ::fstat(item.get(), &status) != 0)
        return -errno;
    if ((status.st_mode & S_IFMT) != type || status.st_uid != ::geteuid())
        return -ESTALE;
    const int owned = rules_ ? disk_.changeOwner(item.get(), rules_->owner, rules_->group)
                             : disk_.changeOwner(item.get(), entry.status.st_uid, entry.status.st_gid);
    if (owned < 0)
        return owned;
    if (type != S_IFLNK)
        if (const int moded = disk_.changeMode(item.get(), entry.status.st_mode & filePermissionBits); moded < 0)
            return moded;
    return disk_.setTimes(item.get(), entry.status.st_atim, entry.status.st_mtim);
}

int Copier::openLinks() {
    if (links_.valid())
        return 0;
    // Not to be guessed, so that no name of the source can stand in its way.
    std::uint64_t random = 0;
    if (::getrandom(&random, sizeof random, 0) != static_cast<ssize_t>(sizeof random))
        return -EIO;
    std::array<char, 32> name{};
    std::snprintf(name.data(), name.size(), ".links-%016llx", static_cast<unsigned long long>(random));
    linksName_ = name.data();
    if (const int made = disk_.makeDirectory(destination_.root(), linksName_.c_str(), 0700); made < 0)
        return made;
    auto directory =
        platform::openBeneathOnMount(destination_.root(), linksName_.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return -directory.error().number();
    links_ = std::move(*directory);
    return 0;
}

} // namespace

int copyTree(platform::Disk& disk, int fromDirectory, const char* from, int toDirectory, const char* to,
             const std::function<bool()>& goOn) {
    return Copier(disk, toDirectory, to, goOn).copy(fromDirectory, from);
}

int copyContent(platform::Disk& disk, int from, int to, const ContentRules& rules) {
    return Copier(disk, to, rules).copy(from, ".");
}

} // namespace zor::fs
