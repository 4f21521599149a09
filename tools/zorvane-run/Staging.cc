// SPDX-License-Identifier: Apache-2.0
#include "Staging.h"

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <sched.h>
#include <set>
#include <string>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

/// Made for things that are mounted for a while; the sandbox shows nothing of it.
constexpr const char* stagingDirectory = "/mnt";

/// For /tmp and /dev/shm each; it counts as the program's memory. An inode, which `size` does not count, takes a
/// kilobyte of the kernel's: one for each page is more than files of any content need.
constexpr const char* memoryOptions = "mode=1777,size=64m,nr_inodes=16384";
constexpr unsigned long memoryFlags = MS_NOSUID | MS_NODEV;
constexpr mode_t openMode = 0755;

/// The directories that are there whatever is mounted. Programs look into the last two, and find nothing of the host's.
constexpr const char* emptyDirectories[] = {"proc", "dev", "tmp", "run", "var"};

constexpr const char* devices[] = {"null", "zero", "full", "random", "urandom", "tty"};
constexpr struct {
    const char* name;
    const char* target;
} deviceLinks[] = {{"stdin", "/proc/self/fd/0"}, {"stdout", "/proc/self/fd/1"}, {"stderr", "/proc/self/fd/2"},
                   {"fd", "/proc/self/fd"},      {"core", "/proc/kcore"},       {"ptmx", "pts/ptmx"}};
constexpr const char* terminalOptions = "newinstance,ptmxmode=0666,mode=620";

/// A copy of the tree with everything mounted in it, and with the flags that it has in the sandbox; -1, errno set.
FileDescriptor copyOf(const Mount& mount) {
    FileDescriptor tree(
        ::open_tree(mount.descriptor.get(), "", AT_EMPTY_PATH | AT_RECURSIVE | OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
    if (!tree.valid())
        return tree;
    mount_attr attributes{};
    attributes.attr_set = MOUNT_ATTR_NOSUID | MOUNT_ATTR_NODEV;
    if (!mount.isContainer())
        attributes.attr_set |= MOUNT_ATTR_RDONLY;
    if (::mount_setattr(tree.get(), "", AT_EMPTY_PATH | AT_RECURSIVE, &attributes, sizeof attributes) != 0)
        return FileDescriptor();
    return tree;
}

/// A place that is filled: names below it are resolved without following a link, for a directory that was mounted there
/// may be in others' hands.
class Tree {
public:
    explicit Tree(int root) : root_(root) {}

    /// The place for a mount at a path that begins with a slash, made with the directories above it: everybody may
    /// pass.
    [[nodiscard]] FileDescriptor place(const std::string& path, bool isFile) {
        for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
            const std::string part = path.substr(1, end == path.npos ? end : end - 1);
            if (made_.insert(part).second)
                if (const zor::Errno failed = make(part, isFile && end == path.npos); failed && failed != EEXIST) {
                    errno = failed.number();
                    return FileDescriptor();
                }
            if (end == path.npos)
                break;
        }
        auto opened = open(path.substr(1));
        if (opened)
            return std::move(*opened);
        errno = opened.error().number();
        return FileDescriptor();
    }

private:
    [[nodiscard]] zor::ErrnoOr<FileDescriptor> open(const std::string& path) const {
        return zor::platform::openBeneath(root_, path.c_str(), O_PATH | O_NOFOLLOW);
    }
    [[nodiscard]] zor::Errno make(const std::string& path, bool isFile) const {
        // In its directory: the kernel would follow links on the way to a name further down.
        const std::size_t slash = path.rfind('/');
        const FileDescriptor directory = TRY(open(slash == path.npos ? "." : path.substr(0, slash)));
        const char* const name = path.c_str() + (slash == path.npos ? 0 : slash + 1);
        const int failed =
            isFile ? ::mknodat(directory.get(), name, S_IFREG | 0444, 0) : ::mkdirat(directory.get(), name, openMode);
        return failed != 0 ? zor::Errno::last() : zor::Errno();
    }

    const int root_;
    std::set<std::string> made_;
};

/// A device of the host at a place in `directory`, /dev of the sandbox. False, errno set.
bool placeDevice(int directory, const std::string& source, const char* name) {
    const FileDescriptor made(::openat(directory, name, O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0444));
    const FileDescriptor tree(::open_tree(AT_FDCWD, source.c_str(), OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
    mount_attr attributes{};
    attributes.attr_set = MOUNT_ATTR_NOSUID;
    return made.valid() && tree.valid() &&
           ::mount_setattr(tree.get(), "", AT_EMPTY_PATH, &attributes, sizeof attributes) == 0 &&
           ::move_mount(tree.get(), "", directory, name, MOVE_MOUNT_F_EMPTY_PATH) == 0;
}

/// The simplest devices, terminals of the sandbox's own, memory to share, and the terminal that standard output is.
/// nullptr, or the call that failed.
const char* stageDevices() {
    const std::string place = std::string(stagedRoot) + "/dev";
    if (::mount("tmpfs", place.c_str(), "tmpfs", memoryFlags, "mode=0755") != 0)
        return "mount of a tmpfs for devices";
    const FileDescriptor directory(::open(place.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory.valid())
        return "open";
    for (const char* const name : devices)
        if (!placeDevice(directory.get(), std::string("/dev/") + name, name))
            return "mount of a device";
    for (const auto& link : deviceLinks)
        if (::symlinkat(link.target, directory.get(), link.name) != 0)
            return "symlinkat";
    for (const char* const name : {"pts", "shm"})
        if (::mkdirat(directory.get(), name, openMode) != 0)
            return "mkdirat";
    if (::mount("devpts", (place + "/pts").c_str(), "devpts", MS_NOSUID | MS_NOEXEC, terminalOptions) != 0)
        return "mount of terminals";
    char terminal[PATH_MAX];
    if (::ttyname_r(STDOUT_FILENO, terminal, sizeof terminal) == 0 &&
        !placeDevice(directory.get(), terminal, "console"))
        return "mount of the terminal";
    return nullptr;
}

} // namespace

const char* leaveMountNamespace() {
    if (::unshare(CLONE_NEWNS) != 0)
        return "unshare";
    // Mounts that are made here stay here.
    return ::mount(nullptr, "/", nullptr, MS_REC | MS_SLAVE, nullptr) == 0 ? nullptr : "mount of / as a slave";
}

const char* stage(const std::vector<Mount>& mounts) {
    std::vector<FileDescriptor> trees;
    for (const Mount& mount : mounts) {
        FileDescriptor& tree = trees.emplace_back();
        if (mount.linkTarget.empty() && !(tree = copyOf(mount)).valid())
            return "copy of a mount";
    }
    ::umask(0);
    if (::mount("tmpfs", stagingDirectory, "tmpfs", MS_NOSUID | MS_NODEV | MS_NOEXEC, "mode=0700") != 0)
        return "mount of a tmpfs on /mnt";
    if (::mkdir(stagedRoot, openMode) != 0)
        return "mkdir";
    const FileDescriptor root(::open(stagedRoot, O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root.valid())
        return "open";
    for (const char* const name : emptyDirectories)
        if (::mkdirat(root.get(), name, openMode) != 0)
            return "mkdirat";
    if (const char* const failed = stageDevices())
        return failed;
    for (const char* const place : {"/tmp", memoryPlace})
        if (::mount("tmpfs", (std::string(stagedRoot) + place).c_str(), "tmpfs", memoryFlags, memoryOptions) != 0)
            return "mount of a tmpfs for what is shared in memory";
    Tree tree(root.get());
    for (std::size_t i = 0; i < mounts.size(); ++i) {
        const std::string& path = mounts[i].path;
        if (!mounts[i].linkTarget.empty()) {
            if (::symlinkat(mounts[i].linkTarget.c_str(), root.get(), path.c_str() + 1) != 0)
                return "symlinkat";
            continue;
        }
        const FileDescriptor place = tree.place(path, mounts[i].isFile);
        if (!place.valid())
            return "mkdirat";
        if (::move_mount(trees[i].get(), "", place.get(), "", MOVE_MOUNT_F_EMPTY_PATH | MOVE_MOUNT_T_EMPTY_PATH) != 0)
            return "move_mount";
    }
    return nullptr;
}

} // namespace zorvanerun
