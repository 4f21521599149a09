// SPDX-License-Identifier: Apache-2.0
#include "Holders.h"

#include "platform/Errno.h"
#include "zorvane/Text.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zorvanectl::content {

using zor::platform::FileDescriptor;

namespace {

/// As many as the kernel follows.
constexpr int linksMax = 40;

bool isTrusted(uid_t user) {
    return user == 0 || user == ::geteuid();
}

bool isReadableForAll(const struct stat& status, int item) {
    const mode_t bits = S_ISDIR(status.st_mode) ? 0055 : 0044;
    // A member of its group has the group's bits alone; a list may say something else about each.
    return (status.st_mode & bits) == bits && ::fgetxattr(item, "system.posix_acl_access", nullptr, 0) < 0;
}

/// Walks a path by descriptors, so that what was judged of each step is what the next one starts from.
class PathWalk {
public:
    PathWalk(const std::string& path, Holders& holders) : path_(path), holders_(holders) {}

    Outcome<FileDescriptor> open() {
        if (path_.empty())
            return cannotOpen(zor::Errno(ENOENT));
        rest_ = path_;
        TRY(begin());
        for (;;) {
            std::string name = takeName();
            if (name.empty()) // a path that ends with a slash, or a link to "/"
                name = ".";
            const FileDescriptor place(::openat(directory_.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
            struct stat status{};
            if (!place.valid() || ::fstat(place.get(), &status) != 0)
                return cannotOpen(zor::Errno::last());
            if (S_ISLNK(status.st_mode))
                TRY(follow(name, place, status));
            else if (rest_.empty())
                return openLast(name);
            else
                TRY(enter(name));
        }
    }

private:
    [[nodiscard]] std::unexpected<Failure> cannotOpen(zor::Errno error) const {
        return failed(zorvane::printable(path_) + " cannot be opened", error);
    }
    [[nodiscard]] std::unexpected<Failure> refused(const std::string& why) const {
        return failed(zorvane::printable(path_) + " is refused: " + why);
    }

    std::string takeName() {
        rest_.erase(0, std::min(rest_.find_first_not_of('/'), rest_.size()));
        const std::string name = rest_.substr(0, rest_.find('/'));
        rest_.erase(0, name.size());
        return name;
    }

    /// At the root, or where the path's directories begin.
    Outcome<void> begin() { return rest_.starts_with('/') ? enterAt(AT_FDCWD, "/") : enterAt(AT_FDCWD, "."); }
    Outcome<void> enter(const std::string& name) { return enterAt(directory_.get(), name.c_str()); }

    Outcome<void> enterAt(int parent, const char* name) {
        FileDescriptor next(::openat(parent, name, O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        if (!next.valid() || ::fstat(next.get(), &directoryStatus_) != 0)
            return cannotOpen(zor::Errno::last());
        directory_ = std::move(next);
        holders_.addToTheWay(directoryStatus_);
        return {};
    }

    Outcome<void> follow(const std::string& name, const FileDescriptor& link, const struct stat& status) {
        if (!isTrusted(status.st_uid))
            return refused(zorvane::printable(name) + " is a symbolic link of user " + std::to_string(status.st_uid) +
                           "'s, who can let it lead anywhere");
        char target[PATH_MAX];
        const ssize_t length = ::readlinkat(link.get(), "", target, sizeof target);
        if (length < 0 || ++links_ > linksMax)
            return cannotOpen(length < 0 ? zor::Errno::last() : zor::Errno(ELOOP));
        rest_.insert(0, target, static_cast<std::size_t>(length));
        return rest_.starts_with('/') ? begin() : Outcome<void>();
    }

    Outcome<FileDescriptor> openLast(const std::string& name) {
        // An item that is no regular file must not hold the opening.
        constexpr int flags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW | O_CLOEXEC;
        FileDescriptor last(::openat(directory_.get(), name.c_str(), flags));
        struct stat status{};
        if (!last.valid() || ::fstat(last.get(), &status) != 0)
            return cannotOpen(zor::Errno::last());
        if (!S_ISDIR(status.st_mode) && !isTrusted(status.st_uid) && status.st_uid != directoryStatus_.st_uid)
            return refused("it belongs to user " + std::to_string(status.st_uid) +
                           ", and the directory that holds it to user " + std::to_string(directoryStatus_.st_uid));
        if (const auto why = holders_.whyRefused(1, status, last.get()))
            return refused(*why);
        if (S_ISDIR(status.st_mode))
            holders_.addToTheWay(status);
        return last;
    }

    const std::string& path_;
    Holders& holders_;
    std::string rest_;
    FileDescriptor directory_;
    struct stat directoryStatus_{};
    int links_ = 0;
};

} // namespace

void Holders::addToTheWay(const struct stat& directory) {
    way_.push_back({.owner = directory.st_uid, .mode = directory.st_mode});
}

void Holders::enter(std::size_t depth, const struct stat& directory) {
    levels_.resize(depth - 1);
    levels_.push_back({.owner = directory.st_uid, .mode = directory.st_mode});
}

std::optional<std::string> Holders::whyRefused(std::size_t depth, const struct stat& status, int item) const {
    if (item < 0)
        return std::nullopt;
    const std::size_t levels = std::min(depth - 1, levels_.size());
    for (std::size_t i = 0; i < way_.size() + levels; ++i) {
        const Holder& holder = i < way_.size() ? way_[i] : levels_[i - way_.size()];
        const bool isLinked = i + 1 == way_.size() + levels && S_ISREG(status.st_mode) && status.st_nlink > 1;
        const bool isEverybodys = (holder.mode & S_IWOTH) != 0 && ((holder.mode & S_ISVTX) == 0 || isLinked);
        const bool isAnothers = !isTrusted(holder.owner) && holder.owner != status.st_uid;
        if (!isEverybodys && !isAnothers)
            continue;
        if (isReadableForAll(status, item))
            return std::nullopt;
        const std::string belongs = "it belongs to user " + std::to_string(status.st_uid) + " and lies, closed to ";
        return isAnothers
                   ? belongs + "user " + std::to_string(holder.owner) +
                         ", in a directory of that user's, who may have put it there"
                   : belongs + "others, in a directory where everybody may write, so anybody may have put it there";
    }
    return std::nullopt;
}

Outcome<FileDescriptor> openForInstallation(const std::string& path, Holders& holders) {
    return PathWalk(path, holders).open();
}

} // namespace zorvanectl::content
