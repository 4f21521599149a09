// SPDX-License-Identifier: Apache-2.0
// Private to the copy: the hidden directory ".links-…" in the destination's root. It holds one more link to each copied
// file whose source has several, named after the source's inode, so that the next name of that file becomes a link and
// nothing has to be kept in memory. It goes before the root gets its attributes.
#include "fs/Trees.h"

#include "fs/TreeWalker.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "platform/Errno.h"

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

/// The bits of its mode that a copied file keeps: set-user-ID and set-group-ID are not copied.
constexpr mode_t filePermissionBits = 01777;
/// The bits that content keeps.
constexpr mode_t accessBits = 0777;

/// The ways in which a file system, or a limit of it, says that a second link cannot be.
bool linkImpossible(Errno error) {
    return error == EMLINK || error == EPERM || error == EOPNOTSUPP;
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
        : disk_(disk), attributes_(disk),
          data_(disk, goOn ? [goOn](std::uint64_t) { return goOn() ? Errno() : Errno(ECANCELED); }
                           : std::function<Errno(std::uint64_t)>()),
          toDirectory_(toDirectory), to_(to), goOn_(goOn) {}
    /// The copy of content, into `toDirectory` itself.
    Copier(platform::Disk& disk, int toDirectory, const ContentRules& rules)
        : disk_(disk), attributes_(disk), data_(disk, rules.copied), toDirectory_(toDirectory), to_("."),
          rules_(&rules) {}

    Errno copy(int fromDirectory, const char* from);

private:
    Errno visit(const WalkEntry& entry);
    Errno beginDirectory(const WalkEntry& entry);
    Errno enter(FileDescriptor directory, const WalkEntry& entry);
    Errno endDirectory(const WalkEntry& entry);
    Errno copyFile(const WalkEntry& entry);
    Errno copyFileAs(const FileDescriptor& source, const struct stat& status, const WalkEntry& entry);
    Errno copyLink(const WalkEntry& entry);
    Errno copyOther(const WalkEntry& entry);
    Errno finishUnopened(const WalkEntry& entry, mode_t type);
    Errno openLinks();
    Errno finish(int from, int to, struct stat status, mode_t permissions);
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

Errno Copier::copy(int fromDirectory, const char* from) {
    Errno firstError;
    TreeWalker walker(WalkStatus::full);
    const Errno result = walker.walk(fromDirectory, from, [&](const WalkEntry& entry) {
        firstError = visit(entry);
        if (firstError && rules_)
            rules_->failed(entry, firstError);
        return firstError ? WalkStep::stop : WalkStep::proceed;
    });
    if (firstError)
        return firstError;
    TRY(result);
    return walker.vanishedDirectories() == 0 ? Errno() : Errno(ESTALE);
}

Errno Copier::visit(const WalkEntry& entry) {
    if (goOn_ && !goOn_())
        return Errno(ECANCELED);
    if (entry.onOtherFileSystem)
        return Errno(EXDEV);
    const bool leaving = entry.kind == WalkEntryKind::directoryEnd;
    if (entry.kind == WalkEntryKind::unreadableDirectory || entry.kind == WalkEntryKind::noStatus)
        return entry.error;
    // The walk dropped levels that were moved away: what was copied of them is not whole.
    if (destination_.depth() != entry.depth + (leaving ? 1 : 0))
        return Errno(ESTALE);
    // A link is asked about once its target is known, and a file once it is open: it may be another one by then.
    const bool askedLater = entry.kind == WalkEntryKind::symbolicLink || entry.kind == WalkEntryKind::file;
    if (rules_ && entry.depth > 0 && !leaving && !askedLater)
        TRY(rules_->admit(entry, entry.directory, nullptr));
    switch (entry.kind) {
    case WalkEntryKind::directory:
        // One that could not be opened is told as unreadable next.
        return entry.directory < 0 ? Errno() : beginDirectory(entry);
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

Errno Copier::beginDirectory(const WalkEntry& entry) {
    if (entry.depth == 0 && rules_)
        return enter(FileDescriptor(::fcntl(toDirectory_, F_DUPFD_CLOEXEC, 0)), entry);
    const char* const name = destinationName(entry);
    const int parent = destinationParent();
    TRY(disk_.makeDirectory(parent, name, 0700));
    return enter(TRY(platform::openBeneathOnMount(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW)), entry);
}

Errno Copier::enter(FileDescriptor directory, const WalkEntry& entry) {
    if (entry.depth == 0) {
        if (!isFreshDirectory(directory.get()))
            return Errno(ESTALE);
        TRY(attributes_.dropInheritedDefaultAcl(directory.get()));
    }
    struct stat status{};
    if (::fstat(directory.get(), &status) != 0)
        return Errno::last();
    destination_.push(std::move(directory), status.st_dev, status.st_ino, destinationName(entry));
    accessTimes_.push_back(entry.status.st_atim);
    return Errno();
}

Errno Copier::endDirectory(const WalkEntry& entry) {
    if (entry.depth == 0 && links_.valid()) {
        links_.reset();
        TRY(removeTree(disk_, destination_.root(), linksName_.c_str()));
    }
    // Before the modes change: a directory that its owner may not search has no ".." for him.
    std::size_t levelsLost = 0;
    if (!destination_.ensureParent(levelsLost))
        return Errno(ESTALE);
    struct stat status = entry.status;
    status.st_atim = accessTimes_.back();
    // The root of a content's copy is the caller's.
    const Errno result = rules_ && entry.depth == 0 ? Errno()
                                                    : finish(entry.directory, destination_.top(), status,
                                                             rules_ ? (status.st_mode & accessBits) | S_IRWXU
                                                                    : status.st_mode & platform::permissionBits);
    if (!result) {
        destination_.pop();
        accessTimes_.pop_back();
    }
    return result;
}

Errno Copier::copyFile(const WalkEntry& entry) {
    constexpr int flags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW;
    const auto source = platform::openBeneathOnMount(entry.parent, entry.name, flags);
    if (!source)
        return source.error() == ENOENT && entry.depth > 0 ? Errno() : source.error();
    struct stat status{};
    if (::fstat(source->get(), &status) != 0)
        return Errno::last();
    if (!S_ISREG(status.st_mode))
        return Errno(ESTALE);
    if (rules_) {
        WalkEntry opened = entry;
        opened.status = status;
        TRY(rules_->admit(opened, source->get(), nullptr));
    }
    if (status.st_nlink < 2 || entry.depth == 0)
        return copyFileAs(*source, status, entry);
    TRY(openLinks());
    const std::string key = linkKey(source->get(), status);
    const Errno linked = disk_.makeHardLink(links_.get(), key.c_str(), destinationParent(), entry.name);
    if (linked != ENOENT && !linkImpossible(linked))
        return linked;
    TRY(copyFileAs(*source, status, entry));
    if (linked != ENOENT)
        return Errno();
    const Errno kept = disk_.makeHardLink(destinationParent(), entry.name, links_.get(), key.c_str());
    return linkImpossible(kept) ? Errno() : kept;
}

Errno Copier::copyFileAs(const FileDescriptor& source, const struct stat& status, const WalkEntry& entry) {
    const FileDescriptor file = TRY(disk_.createFile(destinationParent(), destinationName(entry), 0600));
    TRY(data_.copy(source.get(), file.get(), status));
    return finish(source.get(), file.get(), status, status.st_mode & (rules_ ? accessBits : filePermissionBits));
}

Errno Copier::finish(int from, int to, struct stat status, mode_t permissions) {
    if (!rules_)
        return attributes_.copy(from, to, status, permissions);
    status.st_uid = rules_->owner;
    status.st_gid = rules_->group;
    return attributes_.giveBasic(to, status, permissions);
}

Errno Copier::copyLink(const WalkEntry& entry) {
    std::array<char, PATH_MAX + 1> target;
    const ssize_t length = ::readlinkat(entry.parent, entry.name, target.data(), target.size());
    if (length < 0 && errno == ENOENT && entry.depth > 0)
        return Errno();
    if (length < 0)
        return errno == EINVAL ? Errno(ESTALE) : Errno::last();
    if (static_cast<std::size_t>(length) == target.size())
        return Errno(ENAMETOOLONG);
    target[static_cast<std::size_t>(length)] = '\0';
    if (rules_)
        TRY(rules_->admit(entry, -1, target.data()));
    TRY(disk_.makeSymbolicLink(target.data(), destinationParent(), destinationName(entry)));
    return finishUnopened(entry, S_IFLNK);
}

Errno Copier::copyOther(const WalkEntry& entry) {
    // Skipped in a tree; as the whole of what was to be copied it cannot be a success.
    if (S_ISSOCK(entry.status.st_mode))
        return entry.depth == 0 ? Errno(EOPNOTSUPP) : Errno();
    if (!S_ISFIFO(entry.status.st_mode))
        return Errno(EPERM);
    TRY(disk_.makeFifo(destinationParent(), destinationName(entry), 0600));
    return finishUnopened(entry, S_IFIFO);
}

/// Owner, mode and times of what is not opened for reading.
Errno Copier::finishUnopened(const WalkEntry& entry, mode_t type) {
    const FileDescriptor item(::openat(destinationParent(), destinationName(entry), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    struct stat status{};
    if (!item.valid() || ::fstat(item.get(), &status) != 0)
        return Errno::last();
    if ((status.st_mode & S_IFMT) != type || status.st_uid != ::geteuid())
        return Errno(ESTALE);
    TRY(rules_ ? disk_.changeOwner(item.get(), rules_->owner, rules_->group)
               : disk_.changeOwner(item.get(), entry.status.st_uid, entry.status.st_gid));
    if (type != S_IFLNK)
        TRY(disk_.changeMode(item.get(), entry.status.st_mode & filePermissionBits));
    return disk_.setTimes(item.get(), entry.status.st_atim, entry.status.st_mtim);
}

Errno Copier::openLinks() {
    if (links_.valid())
        return Errno();
    // Not to be guessed, so that no name of the source can stand in its way.
    std::uint64_t random = 0;
    if (::getrandom(&random, sizeof random, 0) != static_cast<ssize_t>(sizeof random))
        return Errno(EIO);
    std::array<char, 32> name{};
    std::snprintf(name.data(), name.size(), ".links-%016llx", static_cast<unsigned long long>(random));
    linksName_ = name.data();
    TRY(disk_.makeDirectory(destination_.root(), linksName_.c_str(), 0700));
    links_ =
        TRY(platform::openBeneathOnMount(destination_.root(), linksName_.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW));
    return Errno();
}

} // namespace

Errno copyTree(platform::Disk& disk, int fromDirectory, const char* from, int toDirectory, const char* to,
               const std::function<bool()>& goOn) {
    return Copier(disk, toDirectory, to, goOn).copy(fromDirectory, from);
}

Errno copyContent(platform::Disk& disk, int from, int to, const ContentRules& rules) {
    return Copier(disk, to, rules).copy(from, ".");
}

} // namespace zor::fs
