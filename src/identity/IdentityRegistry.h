// SPDX-License-Identifier: Apache-2.0
// The identity registry: which executables the daemon knows, from the files in DIR/etc/zorvane/identities.d.
//
// The registry as read is an immutable snapshot with a number, its generation. Peers remember which generation they
// were judged by; as long as it is the current one their judgement holds, and to ask costs one atomic read: no lock, no
// call.
//
// Changes are found in two ways, and either alone is enough. Notices (inotify) of the directory and of those that the
// executables lie in wake the main loop, and are looked at before a peer is judged anew. And once a second, when
// somebody asks, everything is looked at again whatever the main loop is doing; that also finds what no notice tells.
//
// A look for which there was no descriptor or no memory changes nothing: what was known holds, and the next one who
// asks looks again.
//
// A file that does not count (RegistryDirectory judges) is told in the log, once for each change. Any thread.
// `reading_` is held while files are read, `publishing_` only to hand out the snapshot.
#pragma once

#include "base/Mutex.h"
#include "identity/RegistryFiles.h"
#include "identity/RegistryWatches.h"
#include "platform/Process.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zor::platform {

class RunLoop;

class IdentityRegistry {
public:
    struct Registered {
        std::string fileName;
        std::shared_ptr<const RegistryEntry> entry;
        /// The file that the entry's path named when it was looked at last; absent when that was no file, or when its
        /// file system did not answer.
        std::optional<FileId> executable;
        bool operator==(const Registered&) const = default;
    };
    struct Snapshot {
        std::uint64_t generation = 0;
        /// In the order in which they count.
        std::vector<Registered> entries;
    };

    /// Files may belong to root and to `daemonUserId`. Nothing is read until somebody asks, so that what is wrong with
    /// a file is said when the log is open.
    IdentityRegistry(const SystemRoot& root, PlatformLog& log, uid_t daemonUserId);
    IdentityRegistry(const IdentityRegistry&) = delete;
    IdentityRegistry& operator=(const IdentityRegistry&) = delete;

    /// Has the loop take up changes as they happen. False when it cannot: changes then are found up to a second late.
    /// The loop has to end, or unfollow be called, before the registry goes.
    bool follow(RunLoop& loop);
    void unfollow(RunLoop& loop);

    /// The generation of the current snapshot; never 0.
    [[nodiscard]] std::uint64_t generation() const { return generation_.load(std::memory_order_acquire); }
    [[nodiscard]] std::shared_ptr<const Snapshot> snapshot() const ZOR_EXCLUDES(publishing_);

    /// For every message: looks at everything again when the last look is a second old. `now` is coarseMilliseconds().
    void lookIfDue(std::int64_t now) ZOR_EXCLUDES(reading_);
    /// For every judgement: takes up pending notices.
    void takeNotices() ZOR_EXCLUDES(reading_);
    /// For a peer that no entry names: looks at everything again, unless that was done a moment ago. Whether it did.
    bool lookAgain() ZOR_EXCLUDES(reading_);

    /// The regular file that an entry's path names now.
    [[nodiscard]] std::optional<FileId> executableAt(const std::string& path) const {
        return executables_.fileAt(path);
    }

private:
    /// `changed`: what looks as it did is not read again. `all`: everything is, because a notice said that it changed.
    enum class Read { changed, all };

    void look(Read read) ZOR_REQUIRES(reading_);
    void lookAtNotices() ZOR_REQUIRES(reading_);
    [[nodiscard]] bool looksUnchanged(const Snapshot& old) const ZOR_REQUIRES(reading_);
    [[nodiscard]] std::vector<Registered> readEntries(const RegistryListing& listing, Read read,
                                                      std::vector<RegistryProblem>& problems) ZOR_REQUIRES(reading_);
    [[nodiscard]] bool isBeingWritten(const std::string& name, const FileStamp& stamp) const ZOR_REQUIRES(reading_);
    /// Tells each entry what all entries of its identifier grant together. One that knows it keeps its objects.
    static void uniteIdentifiers(std::vector<Registered>& entries);
    void publish(std::vector<Registered> entries) ZOR_REQUIRES(reading_);
    void sayProblems(std::vector<RegistryProblem> problems) ZOR_REQUIRES(reading_);

    PlatformLog& log_;
    const RegistryDirectory directory_;
    std::atomic<std::uint64_t> generation_{0};
    /// Milliseconds of the coarse monotonic clock.
    std::atomic<std::int64_t> dueMilliseconds_{0};

    mutable RegisteredExecutables executables_;

    Mutex reading_;
    RegistryWatches watches_ ZOR_GUARDED_BY(reading_);
    RegistryListing listing_ ZOR_GUARDED_BY(reading_);
    std::vector<RegistryProblem> problemsSaid_ ZOR_GUARDED_BY(reading_);
    std::int64_t lookedMilliseconds_ ZOR_GUARDED_BY(reading_) = 0;
    /// The last look was at everything that is published.
    bool hasLooked_ ZOR_GUARDED_BY(reading_) = false;
    /// A file is wrong and was not spoken of: the next look reads it again.
    bool holdsBack_ ZOR_GUARDED_BY(reading_) = false;
    const int noticeDescriptor_;

    mutable Mutex publishing_;
    std::shared_ptr<const Snapshot> snapshot_ ZOR_GUARDED_BY(publishing_);
};

} // namespace zor::platform
