// SPDX-License-Identifier: Apache-2.0
// The status of items and the mounts that they lie on, without waiting for a file system that a user made or that is
// elsewhere.
#pragma once

#include "base/Mutex.h"
#include "os/BoundedQuestion.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>

namespace zor::fs {

// The status of an item as the kernel remembers it: a file system that another machine or a user serves is not asked,
// and so cannot make anybody wait. Any thread.

/// lstat of one name in an open directory. EXDEV where another file system, or another part of this one,
/// is mounted on the name; `status` is then that of its root, as far as it is remembered (the type is).
Errno statusOfName(int directory, const char* name, struct stat& status);

/// Which mount something lies on. Kernels before 6.8 give the number of a mount that is gone to another one, seldom
/// together with the number of its device.
struct MountIdentity {
    std::uint64_t mount = 0;
    dev_t device = 0;
    bool operator==(const MountIdentity&) const = default;
};
/// fstat of an open descriptor (O_PATH too), and its mount.
Errno statusOfDescriptor(int descriptor, struct stat& status, MountIdentity& mount);
/// The number of the mount in /proc/self/mountinfo; 0 when it cannot be had.
[[nodiscard]] std::uint64_t mountNumber(int descriptor);

// Below which directories users can mount, and how what lies below one is reached without waiting for what they
// mounted.
//
// A fence is a directory: a user's home, or the place of containers that belong to the system. Below it no step of a
// path crosses a mount, so the file system of a mount point there is never asked. The fence itself may lie on any
// mount. A home's mount is judged whenever it is another one than at the last look: a file system that a user serves
// (FUSE) is no home, EXDEV; one that is not of this machine may stop answering. Such a home is asked on a thread of its
// own whether it still answers, at most once in `homeAnswerHolds`, and while it does not, all that leads there fails
// with EHOSTDOWN at once. A caller that is about to take a lock that others need asks anew. Not defended: a home that
// stops answering between the question and the use holds the thread that is there.
//
// Changes nothing on the disk. Any thread; fences are added, never taken away.

using OpenResult = ErrnoOr<platform::FileDescriptor>;

/// How long a home that may stop answering is believed to answer; its requests pay one question in that time.
inline constexpr std::chrono::milliseconds homeAnswerHolds{1000};
/// How long a home is waited for. A file system over a network that takes longer stops its user's requests only.
inline constexpr std::chrono::milliseconds homePatience{2000};

/// A home's mount.
enum class MountKind {
    unknown,
    local,    ///< a disk, or memory, of this machine
    mayHang,  ///< somebody else serves it
    usersOwn, ///< a user of this machine serves it
};
/// The line of /proc/self/mountinfo for the mount with that number.
[[nodiscard]] MountKind kindOfMount(std::uint64_t number);

class MountFence {
public:
    enum class Kind { home, systemPlace };
    /// Below `path`, which is relative to the directory that is open as `root`.
    MountFence(int root, std::string_view path, Kind kind);
    MountFence(const MountFence&) = delete;
    MountFence& operator=(const MountFence&) = delete;

    [[nodiscard]] bool isHome() const { return kind_ == Kind::home; }
    [[nodiscard]] std::string_view path() const { return judgement_->path; }
    /// Whether the relative path is the fence's directory, or lies below it.
    [[nodiscard]] bool holds(std::string_view path) const;
    /// How many bytes of such a path may lie on any mount: in a system place, those up to the class directory.
    [[nodiscard]] std::size_t ownBytes(std::string_view path) const;

    /// Whether the home answers; false after `homePatience` at the latest. Costs nothing for a home on a local disk.
    enum class Asked { lately, now };
    [[nodiscard]] bool answers(Asked asked = Asked::lately);
    /// Opens what lies at a path that the fence holds. EXDEV where that is, or lies behind, a mount point; EHOSTDOWN.
    [[nodiscard]] OpenResult open(const char* path, int flags);
    /// lstat, with the errors above.
    Errno status(const char* path, struct stat& status);

private:
    struct Answered {};
    /// Shared with a question that may not come back.
    struct Judgement {
        int root = -1;
        platform::FileDescriptor ownRoot;
        std::string path;
        platform::Mutex mutex;
        MountIdentity mount ZOR_GUARDED_BY(mutex);
        MountKind kind ZOR_GUARDED_BY(mutex) = MountKind::unknown;
        std::chrono::steady_clock::time_point answeredAt ZOR_GUARDED_BY(mutex);

        /// Judges the mount of the home that is open, unless it is the one that was judged last.
        MountKind judge(int home) ZOR_EXCLUDES(mutex);
        Answered ask() ZOR_EXCLUDES(mutex);
    };
    [[nodiscard]] OpenResult openOwn(const char* path, std::size_t ownBytes);
    /// False where a file system would have to be asked.
    [[nodiscard]] bool rememberedStatus(const char* path, struct stat& status);

    const Kind kind_;
    const std::shared_ptr<Judgement> judgement_;
    platform::BoundedQuestion<Answered> question_;
};

class MountFences {
public:
    explicit MountFences(int root) : root_(root) {}
    ~MountFences();
    MountFences(const MountFences&) = delete;
    MountFences& operator=(const MountFences&) = delete;

    /// Adds a fence, unless there is that one already.
    void add(std::string_view path, MountFence::Kind kind);
    /// The outermost fence that holds the relative path; nullptr when none does.
    [[nodiscard]] MountFence* around(std::string_view path) const;

private:
    struct Link {
        MountFence fence;
        Link* next;
    };
    const int root_;
    platform::Mutex adding_;
    /// Read without a lock: links are put before the first, and stay.
    std::atomic<Link*> first_{nullptr};
};

} // namespace zor::fs
