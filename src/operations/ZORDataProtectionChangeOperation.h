// SPDX-License-Identifier: Apache-2.0
// One change of the data-protection class of what a user keeps in a container: a pass over its files, again after each
// unlock for as long as a lock gets in the way.
//
// The tree belongs to a client, who may change it during the walk. Classes are set on descriptors of what the walk met,
// never by a name; nothing outside the container is touched. A file that has names outside is left as it is, and so is
// one with several names that does not belong to the container's owner: he can make its names seem to be all inside.
//
// A pass holds the container's lock while it looks the container up and opens it, and again afterwards to see that the
// directory which it walked lies in the container's place still, and to record the change; not in between, since
// creations and deletions of all clients wait for such locks. A wipe keeps path and UUID: only the directory itself
// shows that there was one.
//
// A stop in the middle leaves some files changed, the directories of others not yet, and nothing recorded; the same
// request, sent again, does the rest.
//
// Held by shared_ptr: a retry that waits on the lock-state queue keeps it. It runs on one thread at a time, but for the
// files of a large tree: a second thread sets the class of some that the walk has opened.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/SharedWork.h"
#include "fs/TreeWalker.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "store/ZORMetadata.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace zor {

/// The work of a change, as bits.
namespace protectionChange {
inline constexpr std::int32_t directories = 1;
inline constexpr std::int32_t files = 2;
/// Leave a file alone when the number of its class is lower than the new one.
inline constexpr std::int32_t keepLower = 4;
} // namespace protectionChange

/// Tells a directory from one that has its name, or its inode's number, later.
struct DirectoryIdentity {
    dev_t device = 0;
    std::uint64_t inode = 0;
    std::int64_t birthSeconds = 0; // 0 where the file system does not say
    std::uint32_t birthNanoseconds = 0;
    bool operator==(const DirectoryIdentity&) const = default;
};

class ZORDataProtectionChangeOperation : public std::enable_shared_from_this<ZORDataProtectionChangeOperation> {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        /// The lock-state queue.
        Background retries;
    };
    enum class RetryIfLocked : bool { no, yes };
    /// `wasLocked`: a pass met a locked device, and no retry was wanted.
    using CompletionBlock = std::function<void(bool wasLocked, const std::optional<ZORError>& error)>;

    /// `dataContainerMetadata` is the operation's own: the container as it was when the change was asked for.
    /// `operationType`: bits of protectionChange.
    ZORDataProtectionChangeOperation(const Needs& needs, std::shared_ptr<const ZORMetadata> dataContainerMetadata,
                                     std::int32_t newDataProtectionClass, RetryIfLocked retryIfLocked,
                                     std::int32_t operationType)
        : needs_(needs), dataContainerMetadata_(std::move(dataContainerMetadata)),
          newDataProtectionClass_(newDataProtectionClass), retryIfLocked_(retryIfLocked),
          operationType_(operationType) {}
    ZORDataProtectionChangeOperation(const ZORDataProtectionChangeOperation&) = delete;
    ZORDataProtectionChangeOperation& operator=(const ZORDataProtectionChangeOperation&) = delete;

    /// Runs once, before the first retry.
    void setRetryStartBlock(std::function<void()> block) { retryStartBlock_ = std::move(block); }
    /// Runs once, when a pass has changed all there is, under the container's lock, held for writing. The container is
    /// the one that the change was asked for.
    void setRecordBlock(std::function<void(const IdentifierWriteLock&)> block) { recordBlock_ = std::move(block); }
    /// Runs once, when the operation ends.
    void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }

    /// One pass; then the completion, or a retry on the lock-state queue.
    void performChangeOperation();

private:
    enum class NeedRetry : bool { no, yes };
    Result<NeedRetry> _runChangeOperationNeedToRetry();
    void retry();
    void startRetry();
    /// A pass, and where it has to come again, its queueing.
    Result<NeedRetry> attempt();
    void queueRetry();
    /// Calls the completion, unless a retry is queued.
    void conclude(const Result<NeedRetry>& attempted);

    /// Errors 21, 10.
    Result<void> checkStillThere(const IdentifierLock& held);
    ZORError changedMeanwhile();
    struct Item {
        std::string name;
        std::string path;
    };
    std::vector<Item> existingItems();
    static std::string shown(const std::vector<Item>& items);
    Result<platform::FileDescriptor> openContainer(const std::vector<Item>& items);
    Result<void> walk(int container, const std::vector<Item>& items);
    /// A file or directory that the walk has met: the second thread may be the one that changes a file.
    struct OpenItem {
        platform::FileDescriptor descriptor;
        std::string path;
    };
    using OpenItems = fs::HandedOn<OpenItem>;
    /// Directories whose end was met come to `ended`.
    Result<void> visit(const fs::WalkEntry& entry, const Item& item, OpenItems& files, std::vector<OpenItem>& ended);
    Result<void> changeDirectory(const OpenItem& directory);
    Result<void> changeFile(const OpenItem& file) ZOR_EXCLUDES(sharedMutex_);
    /// `kind` of st_mode; an item of another is left alone.
    Result<void> setClass(const OpenItem& item, mode_t kind, std::int32_t target,
                          const std::function<bool(const struct stat& status, int current)>& declines);
    /// Whether a file, met under one of its names, may be somebody else's too. Either thread.
    [[nodiscard]] bool isShared(const struct stat& status) ZOR_EXCLUDES(sharedMutex_);
    void saySharedFiles() ZOR_EXCLUDES(sharedMutex_);

    const Needs needs_;
    const std::shared_ptr<const ZORMetadata> dataContainerMetadata_;
    const std::int32_t newDataProtectionClass_;
    const RetryIfLocked retryIfLocked_;
    const std::int32_t operationType_;
    bool retried_ = false;
    /// The request that asked for the change, for the log lines of retries; kept when it begins to wait.
    LogSubject::Describe request_;
    std::function<void()> retryStartBlock_;
    std::function<void(const IdentifierWriteLock&)> recordBlock_;
    CompletionBlock completionBlock_;
    std::optional<DirectoryIdentity> firstMet_;
    // The state of one pass.
    uid_t owner_ = 0; // the container's
    platform::Mutex sharedMutex_;
    fs::NamesMet namesMet_ ZOR_GUARDED_BY(sharedMutex_);
    std::uint64_t foreignFiles_ ZOR_GUARDED_BY(sharedMutex_) = 0; // of another owner than the container's
};

} // namespace zor
