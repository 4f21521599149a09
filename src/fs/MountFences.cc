// SPDX-License-Identifier: Apache-2.0
#include "fs/MountFences.h"

#include "os/FileDescriptor.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>
#include <utility>

namespace zor::fs {

namespace {

/// Newer than the headers; a kernel that does not know it says so in the answer's mask.
constexpr unsigned uniqueMountWanted = 0x4000;
constexpr int remembered = AT_STATX_DONT_SYNC | AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT;

timespec timeOf(const statx_timestamp& time) {
    return {.tv_sec = time.tv_sec, .tv_nsec = time.tv_nsec};
}

struct stat statusIn(const struct statx& found) {
    struct stat status{};
    status.st_dev = ::makedev(found.stx_dev_major, found.stx_dev_minor);
    status.st_ino = found.stx_ino;
    status.st_mode = found.stx_mode;
    status.st_nlink = found.stx_nlink;
    status.st_uid = found.stx_uid;
    status.st_gid = found.stx_gid;
    status.st_rdev = ::makedev(found.stx_rdev_major, found.stx_rdev_minor);
    status.st_size = static_cast<off_t>(found.stx_size);
    status.st_blksize = static_cast<blksize_t>(found.stx_blksize);
    status.st_blocks = static_cast<blkcnt_t>(found.stx_blocks);
    status.st_atim = timeOf(found.stx_atime);
    status.st_mtim = timeOf(found.stx_mtime);
    status.st_ctim = timeOf(found.stx_ctime);
    return status;
}

} // namespace

Errno statusOfName(int directory, const char* name, struct stat& status) {
    struct statx found{};
    if (::statx(directory, name, remembered, STATX_BASIC_STATS, &found) != 0)
        return Errno::last();
    status = statusIn(found);
    // A directory that is open may be the root of a mount itself: "." leads nowhere else.
    const bool crossed = (found.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0 && std::strcmp(name, ".") != 0;
    return crossed ? Errno(EXDEV) : Errno();
}

Errno statusOfDescriptor(int descriptor, struct stat& status, MountIdentity& mount) {
    struct statx found{};
    if (::statx(descriptor, "", AT_EMPTY_PATH | remembered, STATX_BASIC_STATS | STATX_MNT_ID | uniqueMountWanted,
                &found) != 0)
        return Errno::last();
    status = statusIn(found);
    mount = {.mount = found.stx_mnt_id, .device = status.st_dev};
    return Errno();
}

std::uint64_t mountNumber(int descriptor) {
    struct statx found{};
    if (::statx(descriptor, "", AT_EMPTY_PATH | remembered, STATX_MNT_ID, &found) != 0)
        return 0;
    return found.stx_mnt_id;
}

using platform::FileDescriptor;
using platform::MutexLock;
using platform::openBeneath;
using platform::openBeneathOnMount;

namespace {

constexpr int pathFlags = O_PATH | O_DIRECTORY | O_NOFOLLOW;
/// The path of a class below the place of its containers, such as "Data/System".
constexpr std::size_t classLevels = 2;

/// File systems that nobody but the kernel serves, from what lies in this machine.
constexpr std::array<std::string_view, 16> localTypes = {"bcachefs", "btrfs", "ecryptfs", "erofs", "exfat", "ext2",
                                                         "ext3",     "ext4",  "f2fs",     "jfs",   "ntfs3", "overlay",
                                                         "ramfs",    "tmpfs", "vfat",     "xfs"};

struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
};
struct Freed {
    void operator()(char* memory) const { std::free(memory); }
};

/// The type and the options behind the " - " of a line.
MountKind kindOf(std::string_view type, std::string_view options) {
    if (std::ranges::find(localTypes, type) != localTypes.end())
        return MountKind::local;
    constexpr std::string_view server = "user_id=";
    const std::size_t at = options.find(server);
    if (!type.starts_with("fuse") || at == options.npos)
        return MountKind::mayHang;
    const auto user = std::strtoul(options.data() + at + server.size(), nullptr, 10);
    return user == 0 || user == ::geteuid() ? MountKind::mayHang : MountKind::usersOwn;
}

const char* behindSlashes(const char* text) {
    while (*text == '/')
        ++text;
    return text;
}

} // namespace

MountKind kindOfMount(std::uint64_t number) {
    const std::unique_ptr<std::FILE, FileCloser> mounts(std::fopen("/proc/self/mountinfo", "re"));
    char* line = nullptr;
    std::size_t lineBytes = 0;
    MountKind kind = MountKind::mayHang; // also one that is not to be seen from here
    while (mounts && ::getline(&line, &lineBytes, mounts.get()) > 0) {
        if (std::strtoull(line, nullptr, 10) != number)
            continue;
        const char* const separator = std::strstr(line, " - ");
        if (!separator)
            continue;
        const std::string_view rest(separator + 3);
        kind = kindOf(rest.substr(0, rest.find(' ')), rest);
        break;
    }
    const std::unique_ptr<char, Freed> memory(line);
    return kind;
}

MountFence::MountFence(int root, std::string_view path, Kind kind)
    : kind_(kind), judgement_(std::make_shared<Judgement>()) {
    judgement_->path = path;
    judgement_->root = root;
}

bool MountFence::holds(std::string_view path) const {
    const std::string& own = judgement_->path;
    // The end first: it tells most fences from a path that they do not hold, without a look at the names.
    return path.size() >= own.size() && (path.size() == own.size() || path[own.size()] == '/') && path.starts_with(own);
}

std::size_t MountFence::ownBytes(std::string_view path) const {
    std::size_t end = judgement_->path.size();
    for (std::size_t level = 0; kind_ == Kind::systemPlace && level < classLevels && end < path.size(); ++level)
        end = std::min(path.find('/', end + 1), path.size());
    return end;
}

MountKind MountFence::Judgement::judge(int home) {
    struct stat status{};
    MountIdentity found;
    if (statusOfDescriptor(home, status, found))
        return MountKind::mayHang;
    {
        const MutexLock held(mutex);
        if (kind != MountKind::unknown && mount == found)
            return kind;
    }
    const MountKind judged = kindOfMount(mountNumber(home));
    const MutexLock held(mutex);
    mount = found;
    kind = judged;
    answeredAt = {}; // another one did
    return judged;
}

MountFence::Answered MountFence::Judgement::ask() {
    const auto home = openBeneath(ownRoot.get(), path.c_str(), pathFlags);
    struct statx answer{};
    if (home && judge(home->get()) == MountKind::mayHang)
        (void)::statx(home->get(), "", AT_EMPTY_PATH | AT_STATX_FORCE_SYNC, STATX_BASIC_STATS, &answer);
    const MutexLock held(mutex);
    answeredAt = std::chrono::steady_clock::now();
    return {};
}

bool MountFence::answers(Asked asked) {
    if (kind_ != Kind::home)
        return true;
    bool isJudged = false;
    {
        const MutexLock held(judgement_->mutex);
        if (judgement_->kind == MountKind::local || judgement_->kind == MountKind::usersOwn ||
            (asked == Asked::lately && std::chrono::steady_clock::now() - judgement_->answeredAt < homeAnswerHolds))
            return true;
        isJudged = judgement_->kind != MountKind::unknown;
    }
    // A home that the kernel remembers is judged without a question to anybody; most are of this machine.
    if (!isJudged) {
        const auto home = platform::openBeneathRemembered(judgement_->root, judgement_->path.c_str(), pathFlags);
        if (home && judgement_->judge(home->get()) == MountKind::local)
            return true;
    }
    {
        const MutexLock held(judgement_->mutex);
        // The question may outlive this object, and whoever made it. A descriptor that is there is not changed any
        // more: the question reads it without the mutex.
        if (!judgement_->ownRoot.valid())
            judgement_->ownRoot.reset(::fcntl(judgement_->root, F_DUPFD_CLOEXEC, 0));
        if (!judgement_->ownRoot.valid())
            return false; // nobody can be asked
    }
    if (question_.ask([judgement = judgement_] { return judgement->ask(); }, homePatience))
        return true;
    const MutexLock held(judgement_->mutex);
    judgement_->answeredAt = {}; // what it answered before holds no more
    return false;
}

OpenResult MountFence::openOwn(const char* path, std::size_t ownBytes) {
    if (!answers())
        return Errno(EHOSTDOWN);
    auto opened = openBeneath(judgement_->root, std::string(path, ownBytes).c_str(), pathFlags);
    if (!opened || kind_ != Kind::home)
        return opened;
    const MountKind kind = judgement_->judge(opened->get());
    if (kind == MountKind::usersOwn)
        return Errno(EXDEV);
    // It may have been mounted a moment ago, over one that needed no question.
    if (kind == MountKind::mayHang && !answers())
        return Errno(EHOSTDOWN);
    return opened;
}

OpenResult MountFence::open(const char* path, int flags) {
    const std::size_t own = ownBytes(path);
    const char* const rest = behindSlashes(path + own);
    if (*rest == '\0' && kind_ == Kind::systemPlace)
        return openBeneath(judgement_->root, path, flags);
    auto fence = openOwn(path, own);
    if (!fence || (*rest == '\0' && (flags & O_PATH) != 0))
        return fence;
    return openBeneathOnMount(fence->get(), *rest == '\0' ? "." : rest, flags);
}

bool MountFence::rememberedStatus(const char* path, struct stat& status) {
    {
        const MutexLock held(judgement_->mutex);
        if (judgement_->kind != MountKind::local)
            return false;
    }
    const auto item = platform::openBeneathRemembered(judgement_->root, path, O_NOFOLLOW);
    MountIdentity mount;
    if (!item || statusOfDescriptor(item->get(), status, mount))
        return false;
    const MutexLock held(judgement_->mutex);
    return judgement_->kind == MountKind::local && judgement_->mount == mount;
}

Errno MountFence::status(const char* path, struct stat& status) {
    // A name that the kernel remembers on the judged mount is found without a question to any file system.
    if (rememberedStatus(path, status))
        return Errno();
    const std::size_t own = ownBytes(path);
    const bool isOwn = *behindSlashes(path + own) == '\0';
    if (isOwn && kind_ == Kind::home) {
        const auto fence = openOwn(path, own);
        MountIdentity mount;
        return fence ? statusOfDescriptor(fence->get(), status, mount) : fence.error();
    }
    const std::string whole(path);
    const std::size_t slash = whole.rfind('/');
    const std::string name = whole.substr(slash + 1);
    const std::string parent = slash == whole.npos ? "." : whole.substr(0, slash);
    const auto directory =
        isOwn ? openBeneath(judgement_->root, parent.c_str(), pathFlags) : open(parent.c_str(), pathFlags);
    if (!directory)
        return directory.error();
    const Errno error = statusOfName(directory->get(), name.c_str(), status);
    if (isOwn)
        return error == EXDEV ? Errno() : error;
    if (kind_ == Kind::systemPlace) {
        struct stat ignored{};
        MountIdentity mount;
        if (!statusOfDescriptor(directory->get(), ignored, mount)) {
            const MutexLock held(judgement_->mutex);
            judgement_->mount = mount;
            judgement_->kind = MountKind::local;
        }
    }
    return error;
}

MountFences::~MountFences() {
    for (const Link* link = first_; link;)
        delete std::exchange(link, link->next);
}

void MountFences::add(std::string_view path, MountFence::Kind kind) {
    const MutexLock held(adding_);
    for (const Link* link = first_; link; link = link->next)
        if (link->fence.isHome() == (kind == MountFence::Kind::home) && link->fence.path() == path)
            return;
    first_ = new Link{.fence = {root_, path, kind}, .next = first_};
}

MountFence* MountFences::around(std::string_view path) const {
    MountFence* outermost = nullptr;
    for (Link* link = first_; link; link = link->next)
        if (link->fence.holds(path) && (!outermost || link->fence.path().size() < outermost->path().size()))
            outermost = &link->fence;
    return outermost;
}

} // namespace zor::fs
