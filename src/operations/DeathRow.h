// SPDX-License-Identifier: Apache-2.0
// Death row: where everything goes that is to be deleted.
//
// A move here is one rename on the caller's thread, usually under the locks of its operation; the item gets a name of
// its own, so names never collide. An item on another file system than root's death row goes to a death row there
// (fs/FileSystemDeathRow.h): nothing is ever copied to get out of the way. Passes delete it later, on
// the death-row queue; what is on death row belongs to no container. A stop at any point leaves items, or empty
// directories of theirs, for the next pass; the launch queues one.
//
// The owner of the directory that holds a container can put a directory of another user's in its place. So it is asked
// before the move whose the directory is, and again when it has come to death row, where nobody can change it any more:
// another's goes back. A pass waits for that: it takes no item while one is being moved.
//
// An item for which no death row can be had, since its name on that file system is taken or nothing can be made there,
// is hidden beside itself in one rename, under a name that nobody can guess. A pass removes it from there, and asks the
// directory that it has opened whose it is. After a stop the next boot finds it by its name (OrphanCleanUp).
//
// Any thread; takes no identifier lock.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/Durability.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "store/Configuration.h"

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor {

enum class StartDeletionThread { no, yes };

class DeathRow {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        ZORFileManager& fileManager;
        const fs::Durability& durability;
        ZORGlobalConfiguration& configuration;
        Background background;
    };
    explicit DeathRow(const Needs& needs) : needs_(needs) {}
    DeathRow(const DeathRow&) = delete;
    DeathRow& operator=(const DeathRow&) = delete;

    /// POSIX code of an item that lies in a container's place and is not that container.
    static constexpr int notTheContainer = ESTALE;

    /// Moves an item away, never by a copy; a missing one is no failure. With `owner`, a directory of another
    /// user's stays, and the cause of the error is notTheContainer. Error 41.
    Result<void> _moveItemAtURLToDeathRow(const FileURL& url, StartDeletionThread startDeletionThread,
                                          std::optional<std::uint32_t> owner = std::nullopt);

    enum class Row : std::uint8_t { ofRoot, ofFileSystem, besideItself };
    /// Moves an item to `destination` on root's death row; from another file system to the row of that one; when
    /// neither can take it, out of sight beside itself, with a pass queued. The value says which. Errors are of the
    /// system, or notTheContainer, and not logged.
    Result<Row> condemn(const FileURL& url, const FileURL& destination, std::optional<std::uint32_t> owner);

    /// Queues one deletion pass; the completion runs on the death-row queue with success or the pass's last error code.
    void deleteContainersOnDeathRowWithCompletion(std::function<void(ErrorCode)> completion);
    /// Removes an item, or moves it to the system's directory for temporary files. Error 4. On the death-row queue.
    Result<void> _removeItemOrMoveToTempAtURL(const FileURL& url);

    /// The items that passes could not remove, for the status.
    struct Left {
        /// So many paths are kept; the rest is counted.
        static constexpr std::size_t pathsMax = 64;
        std::uint64_t count = 0;
        std::vector<std::string> paths;

        void add(std::string path) {
            ++count;
            if (paths.size() < pathsMax)
                paths.push_back(std::move(path));
        }
    };
    /// The items that the last pass left.
    [[nodiscard]] Left left() const ZOR_EXCLUDES(leftMutex_) {
        const platform::MutexLock held(leftMutex_);
        return left_;
    }

private:
    /// `moving` is the lock of moves to death row.
    Result<Row> condemn(const FileURL& url, const FileURL& destination, std::optional<std::uint32_t> owner,
                        const platform::MutexLock& moving);
    /// `from` is open and holds the item.
    Result<void> condemnOnItsFileSystem(int from, const FileURL& url, std::optional<std::uint32_t> owner);
    /// The same beside the item itself, when it can be moved nowhere else.
    Result<void> hideBesideItself(int from, const FileURL& url, std::optional<std::uint32_t> owner);
    /// Whether an open directory may be what `owner` gave away.
    [[nodiscard]] static bool isOf(int directory, std::uint32_t owner);
    /// Error notTheContainer for a directory of another's.
    Result<void> judgeOwner(int directory, const FileURL& url, std::uint32_t owner);
    /// The same of `destination` in `to`, with the item again where it was, or beside that.
    Result<void> putBackIfAnothers(int from, const FileURL& url, int to, const FileURL& destination,
                                   std::uint32_t owner);

    struct Pass;
    void runDeletionPass(const std::function<void(ErrorCode)>& completion);
    void deleteEverythingOnDeathRow(Pass& pass);
    void deleteEverythingHidden(Pass& pass);
    /// The row of the file system that `place` lies on.
    void deleteEverythingOnDeathRowOf(const FileURL& place, Pass& pass);
    /// Each item of an open row to `remove`; the error says that not all could be read.
    Result<void> forEachCondemned(int directory, const FileURL& row,
                                  const std::function<Result<void>(const FileURL&)>& remove, Pass& pass);
    Result<void> moveToTemporary(const FileURL& url, const FileURL& destination);
    void findInTemporary(int directory, const FileURL& temporary);
    void deleteWhatIsInTemporary();

    const Needs needs_;
    /// Held while something is moved to a death row, from the making of its directory there until it has been judged. A
    /// pass takes it for a moment between the reading of an item and its removal.
    platform::Mutex moving_;
    /// A pass that nobody is told of is queued and has not begun.
    std::atomic<bool> passWaits_{false};
    /// Names in the directory for temporary files that passes closed and moved there; absent until a pass has looked
    /// for those of earlier daemons. On the death-row queue alone.
    std::optional<std::set<std::string>> inTemporary_;
    struct Hidden {
        FileURL url;
        std::optional<std::uint32_t> owner;
    };
    platform::Mutex hiddenMutex_;
    std::vector<Hidden> hidden_ ZOR_GUARDED_BY(hiddenMutex_);
    mutable platform::Mutex leftMutex_;
    Left left_ ZOR_GUARDED_BY(leftMutex_);
};

} // namespace zor
