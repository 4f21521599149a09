// SPDX-License-Identifier: Apache-2.0
// A Disk over a real directory tree that keeps a log of what each successful call did, in terms of inodes.
//
// The log and the tree at its start are all that PowerCut needs. The recorder keeps the tree in memory too: at the end
// it must equal the one on disk, so a call that changes the disk without going through Disk is found as well. Items
// outside the tree or below an excluded path (sockets, logs, the run directory) pass through unrecorded. Calls are
// made one at a time, so that the log's order is the disk's. Any thread.
#pragma once

#include "base/Mutex.h"
#include "platform/Errno.h"
#include "support/FileTree.h"
#include "support/InterceptedDisk.h"

namespace zor::support {

/// A write that fails after some bytes is logged with those; copyData is logged as a write of what it brought. setTimes
/// and setInodeFlags are not modelled and not logged; neither are clones, which no recorded operation makes
/// and complaint() would tell.
struct LoggedOperation {
    DiskCall call = DiskCall::sync;
    /// Made, linked, moved, removed, changed, written or synced; 0 for syncFileSystem.
    InodeId inode = 0;
    /// The file system that it happens on.
    dev_t device = 0;
    /// The directory that holds the inode's name, or held it before a rename.
    InodeId directory = 0;
    std::string name;
    /// A rename's destination.
    InodeId toDirectory = 0;
    std::string toName;
    /// The item that a rename replaced, or exchanged.
    InodeId replaced = 0;
    bool exchanges = false;
    /// The state given to a new inode; the mode or the owner that a change sets; the bytes of a write.
    Inode value;
    std::uint64_t offset = 0;
    std::string attribute;

    [[nodiscard]] bool changesNames() const;
    [[nodiscard]] bool makesInode() const;
    [[nodiscard]] bool changesInode() const;
    [[nodiscard]] bool writes() const { return call == DiskCall::write; }
    /// Whether `id` is one of the inodes that this operation changes.
    [[nodiscard]] bool touches(InodeId id) const;
    [[nodiscard]] std::string describe() const;
};

struct DiskLog {
    FileTree start;
    std::vector<LoggedOperation> operations;
    /// Each mark as the count of operations before it, ascending.
    std::vector<std::size_t> marks;
};

/// Brings a tree that holds each inode of the operation from before to after it. An operation on names is taken as what
/// the names stand for afterwards, so it can be applied where an earlier one was left out.
void apply(const LoggedOperation& operation, FileTree& tree);

class RecordingDisk final : public InterceptedDisk {
public:
    /// `excluded` are paths relative to `root`. Records nothing until start.
    RecordingDisk(platform::Disk& inner, std::string root, std::set<std::string> excluded = {});

    /// Takes the tree as it is now for durable, with an empty log.
    void start();
    /// Notes that what was done so far is acknowledged.
    void mark();
    [[nodiscard]] DiskLog log() const;
    /// The complaints about the log: calls that could not be followed, and differences between the recorded tree and
    /// the one on disk. Empty when there are none.
    [[nodiscard]] std::string complaint() const;

    Errno makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) override;
    Errno rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override;
    Errno setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) override;
    Errno write(int fd, std::span<const std::uint8_t> bytes) override;
    ErrnoOr<std::size_t> copyData(int from, int to, std::size_t bytesMax) override;

protected:
    Errno intercept(const DiskCallInfo& info, const Make& make) override;

private:
    /// 0 when the inode is not recorded.
    InodeId find(int fd) ZOR_REQUIRES(mutex_);
    [[nodiscard]] InodeId findEntry(InodeId directory, const std::string& name) const ZOR_REQUIRES(mutex_);
    /// The place of a name that was given as a path below an open directory.
    struct Place {
        InodeId directory = 0;
        std::string name;
    };
    [[nodiscard]] Place place(int directory, std::string_view path) ZOR_REQUIRES(mutex_);
    void add(LoggedOperation operation) ZOR_REQUIRES(mutex_);
    void addNew(const DiskCallInfo& info) ZOR_REQUIRES(mutex_);
    void addRemoval(const DiskCallInfo& info) ZOR_REQUIRES(mutex_);
    void addOnDescriptor(const DiskCallInfo& info) ZOR_REQUIRES(mutex_);
    void addData(int to, std::uint64_t offset, Bytes bytes) ZOR_REQUIRES(mutex_);

    const std::string root_;
    const std::set<std::string> excluded_;
    mutable platform::Mutex mutex_;
    bool recording_ ZOR_GUARDED_BY(mutex_) = false;
    std::map<DeviceInode, InodeId> known_ ZOR_GUARDED_BY(mutex_);
    InodeId nextId_ ZOR_GUARDED_BY(mutex_) = 0;
    FileTree current_ ZOR_GUARDED_BY(mutex_);
    DiskLog log_ ZOR_GUARDED_BY(mutex_);
    std::string complaint_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::support
