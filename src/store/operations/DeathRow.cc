// SPDX-License-Identifier: Apache-2.0
// Death row: where everything goes that is to be deleted, and the passes that delete it later.
//
// A move here is one rename on the caller's thread, usually under the locks of its operation; the item gets a unique
// directory of its own, so names never collide. Passes run one after another on the death-row queue and take no lock:
// what is on death row belongs to no container. A stop at any point leaves items, or empty unique directories, for the
// next pass; the launch queues one. What a power cut leaves is the same: nothing is removed whose move here could still
// be undone.
#include "daemon/ZORClientConnection.h"
#include "store/StoreServices.h"

#include <cerrno>

namespace zor {

namespace {

/// A pass may take the fresh directory for rubbish before the item is in it. That is rare; that often in a row it is no
/// accident.
constexpr int uniqueDirectoriesTriedMax = 16;

} // namespace

Result<void> ZORClientConnection::_moveItemAtURLToDeathRow(const FileURL& url,
                                                           StartDeletionThread startDeletionThread) {
    ZORFileManager& fileManager = services_.fileManager;
    for (int tried = 0;; ++tried) {
        const auto unique =
            fileManager.createTemporaryDirectoryInDirectoryURL(services_.configuration.deathrowDirectory());
        if (!unique)
            return makeError(services_.log, ZOR_HERE, ErrorCode::moveToDeathRowFailed, &unique.error(), LogFlag::yes,
                             "Failed to create unique directory at: %s", url.c_str());
        const FileURL destination = unique->appendingDirectory(url.lastPathComponent());
        const auto moved = fileManager.moveItemAtURL(url, destination);
        if (moved) {
            if (startDeletionThread == StartDeletionThread::yes)
                deleteContainersOnDeathRowWithCompletion(nullptr);
            return {};
        }
        // Only a missing source counts as success. When it is the unique directory that is missing, another one is
        // made.
        const bool somethingMissing = moved.error().isPosix(ENOENT);
        if (somethingMissing && fileManager.itemDoesNotExistAtURL(url))
            return {};
        if (somethingMissing && fileManager.itemDoesNotExistAtURL(*unique) && tried < uniqueDirectoriesTriedMax)
            continue;
        return makeError(services_.log, ZOR_HERE, ErrorCode::moveToDeathRowFailed, &moved.error(), LogFlag::yes,
                         "Failed to move item at: %s to: %s", url.c_str(), destination.c_str());
    }
}

void ZORClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(ErrorCode)> completion) {
    // A pass that has not begun finds what comes until then: only who wants to be told of its end needs another. Else
    // whoever sends something here over and over would queue passes without end, each of which keeps the daemon busy.
    std::atomic<bool>& waits = services_.deletionPassWaits;
    const bool isAwaited = completion != nullptr;
    if (!isAwaited && waits.exchange(true))
        return;
    try {
        ZORDispatchAsyncWithTransaction(services_.transactions, services_.deathRowQueue,
                                        [self = shared_from_this(), completion = std::move(completion), isAwaited] {
                                            if (!isAwaited)
                                                self->services_.deletionPassWaits = false;
                                            self->runDeletionPass(completion);
                                        });
    } catch (...) {
        if (!isAwaited)
            waits = false;
        throw;
    }
}

void ZORClientConnection::runDeletionPass(const std::function<void(ErrorCode)>& completion) {
    const auto passed =
        services_.boundary.run({"deleteContainersOnDeathRowWithCompletion", __LINE__}, [&]() -> Result<void> {
            if (auto error = deleteEverythingOnDeathRow())
                return std::move(*error);
            return {};
        });
    if (completion)
        completion(passed ? ErrorCode::success : passed.error().replyCode());
}

std::optional<ZORError> ZORClientConnection::deleteEverythingOnDeathRow() {
    constexpr Here here{"deleteContainersOnDeathRowWithCompletion", __LINE__};
    const FileURL deathRow = services_.configuration.deathrowDirectory();
    auto items = services_.fileManager.urlsForItemsInDirectoryAtURL(deathRow);
    if (!items && items.error().isPosix(ENOENT))
        return std::move(items).error();
    if (!items)
        return makeError(services_.log, here, ErrorCode::listForDeletionFailed, &items.error(), LogFlag::yes,
                         "Failed to get items for deletion: %s : %s", deathRow.c_str(), items.error().text().c_str());
    for (FileURL& leftover : services_.fileManager.copyLeftoversInDirectoryAtURL(deathRow))
        items->push_back(std::move(leftover));
    if (items->empty())
        return std::nullopt;
    // Where nothing keeps the order of changes, a power cut could else bring back a container that is half removed.
    const auto opened = services_.fileManager.resolver().openDirectory(deathRow);
    const int status = opened ? services_.durability.beforeRemoval(opened->get()) : -opened.error();
    if (status < 0) {
        const ZORError cause = posixError(here, -status, "sync of %s failed: %s", deathRow.c_str(), errorText(-status));
        return makeError(services_.log, here, ErrorCode::listForDeletionFailed, &cause, LogFlag::yes,
                         "Failed to get items for deletion: %s : %s", deathRow.c_str(), cause.text().c_str());
    }
    std::optional<ZORError> last;
    for (const FileURL& item : *items) {
        const auto removed = _removeItemOrMoveToTempAtURL(item);
        if (!removed)
            last = makeError(services_.log, here, ErrorCode::deathRowItemNotDestroyed, &removed.error(), LogFlag::yes,
                             "Failed to destroy item at: %s", item.c_str());
    }
    return last;
}

Result<void> ZORClientConnection::_removeItemOrMoveToTempAtURL(const FileURL& url) {
    const auto removed = services_.fileManager.removeItemAtURL(url);
    if (removed || removed.error().isPosix(ENOENT))
        return {};
    ZOR_LOG(services_.log, logLevelDebug, "Couldn't remove, so moving item to /tmp: %s : %s", url.c_str(),
            removed.error().text().c_str());
    const FileURL temporary = services_.configuration.temporaryDirectory();
    const auto moved = services_.fileManager.moveItemAtURL(url, temporary.appendingDirectory(url.lastPathComponent()));
    if (moved)
        return {};
    return makeError(services_.log, ZOR_HERE, ErrorCode::moveToTemporaryFailed, &moved.error(), LogFlag::yes,
                     "Failed to move dir: %s to: %s", url.c_str(), temporary.c_str());
}

} // namespace zor
