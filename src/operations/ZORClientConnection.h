// SPDX-License-Identifier: Apache-2.0
// The client of one message, and the container operations made in its name.
//
// One object a message, always held by a shared_ptr; the daemon's own (identifier "com.veltra.zorvaned.internal") lives
// as long as the daemon. Operations may be called from any thread; which locks they take and when is said at each.
// Errors are logged where they are made, and every operation a command calls ends exceptions at its boundary (code 40).
// Nothing is deleted in place: what goes away moves to death row, and the death-row queue removes it later.
//
// The operations are written in src/operations/, a source for each family.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Mutex.h"
#include "base/Result.h"
#include "base/UUID.h"
#include "base/ZORLocks.h"
#include "plist/Value.h"
#include "store/WaitingReplaces.h"
#include "store/ZORMetadata.h"

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor {

struct ContainerLayout;
struct ReplaceJournal;
struct StoreServices;

enum class UseLocking : std::int32_t { no, yes };
enum class StartDeletionThread { no, yes };

/// A container as an operation found or made it. What a reply needs of the record was read while the operation still
/// held its lock, so one client never sees what another's request made of the shared record meanwhile.
struct FoundContainer {
    std::shared_ptr<ZORMetadata> record;
    UUID uuid;
    std::string path;
    bool existed = false;
};

class ZORClientConnection : public std::enable_shared_from_this<ZORClientConnection> {
public:
    /// initWithBundleId:clientUserId:allowOtherIdLookup:entitledWipeIdentifiers:
    struct Client {
        std::optional<std::string> bundleIdentifier;
        std::uint32_t userId = 0;
        bool allowOtherIdLookup = false;
        std::optional<std::vector<std::string>> entitledWipeIdentifiers;
        /// The client may ask for its own identifier only, whatever its powers are.
        bool onlyOwnIdentifier = false;
    };
    ZORClientConnection(StoreServices& services, Client client)
        : services_(services), client_(std::move(client)), allowOtherIdLookup_(client_.allowOtherIdLookup) {}
    ZORClientConnection(const ZORClientConnection&) = delete;
    ZORClientConnection& operator=(const ZORClientConnection&) = delete;

    [[nodiscard]] const std::optional<std::string>& clientBundleIdentifier() const { return client_.bundleIdentifier; }
    [[nodiscard]] std::uint32_t clientUserId() const { return client_.userId; }
    [[nodiscard]] bool onlyOwnIdentifier() const { return client_.onlyOwnIdentifier; }
    /// An owner of the root, as whom root and the daemon's own user are reported.
    [[nodiscard]] bool ownsRoot() const { return client_.userId == 0; }
    // What the client may look up beyond its own; handlers widen or narrow it. Any thread: the daemon's own client is
    // used by several.
    [[nodiscard]] bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
    [[nodiscard]] bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }

    // Creation and lookup (CreateOrLookup.cc).
    struct CreateOrLookupOptions {
        bool createIfNecessary = false;
        bool transient = false;
        UseLocking useLocking = UseLocking::yes;
        /// It is made to take the place of another of the user's, so the user's share does not count.
        bool replacesAnother = false;
    };
    /// The container of (user, identifier, class), created if asked; error 38 where its user has as many as one may
    /// have and the client does not own the root. With locking it runs under the all-identifiers
    /// lock held for writing. Without, the caller holds that lock, and calls makeDurable on what it got when it has
    /// released it and before it tells anybody. `identifier` nullptr: error 11.
    Result<FoundContainer> createOrLookupContainerForUser(std::uint32_t userId, const std::string* identifier,
                                                          ContainerClass containerClass,
                                                          const CreateOrLookupOptions& options);

    /// Returns at once for a container whose place is on the disk already. Error 8.
    Result<void> makeDurable(const FoundContainer& container);

    // Deletion (Deletion.cc).
    /// Parallel lists; element i of each describes one container. An element that a client gave with another type is
    /// absent.
    struct DeletionBatch {
        std::vector<std::uint32_t> users;
        std::vector<std::optional<UUID>> uuids;
        std::vector<std::optional<std::string>> identifiers;
        /// A class number, or how an element that is no number reads.
        std::vector<std::expected<std::uint64_t, std::string>> classes;

        static DeletionBatch of(std::uint32_t userId, const UUID& uuid, const std::string& identifier,
                                ContainerClass containerClass);
    };
    /// Takes the containers out of the store; their files go with the next deletion pass. What is not there is skipped,
    /// what is malformed is logged and skipped. With locking it runs under the all-identifiers lock held for writing;
    /// without, the caller holds it. Only a live bundle's deletion releases what is registered for it. Errors 11 (lists
    /// that do not agree), 28 (not durable), 35 (another may come back in one's place), 44 (one could not be looked
    /// for), 46, 40.
    Result<void> stageForDeleteContainersWithUsers(const DeletionBatch& batch, UseLocking useLocking);
    /// Stages the one container of an identifier. Errors as the lookup's and the staging's.
    Result<void> deleteContainerForUser(std::uint32_t userId, const std::string* identifier,
                                        ContainerClass containerClass, bool transient);

    // Replace (Replace.cc).
    enum class PreserveOldUUID { no, yes };
    struct ReplaceRequest {
        std::optional<UUID> oldUuid; // absent: the new container becomes the live one of its identifier
        std::optional<UUID> newUuid;
        std::uint32_t userIdOld = 0;
        std::uint32_t userIdNew = 0;
        std::optional<std::string> identifierOld;
        std::optional<std::string> identifierNew;
        ContainerClass classOld = ContainerClass::undefined;
        ContainerClass classNew = ContainerClass::undefined;
        PreserveOldUUID preserveOldUuid = PreserveOldUUID::no;
    };
    /// Puts the new container in the place of the old one, under the all-identifiers lock held for writing. Errors 10,
    /// 11, 14, 15, 21 to 23, 27, 33 to 36, 40, 45, 46, 56. From error 15 on the old container is gone: it waits on
    /// death row. With error 35 it waits in staging for the next request that asks for it, or the next launch.
    Result<void> replaceContainer(const ReplaceRequest& request, StartDeletionThread startDeletionThread);
    /// Undoes or finishes what a stop interrupted. At the launch, without locks. Errors 35, 36.
    Result<void> _recoverFromReplaceOperationsWithError();

    // One container that is known by its UUID (InfoValues.cc, Structure.cc, DiskUsage.cc). Each takes the lock of the
    // UUID's string. An absent UUID or identifier is an error: 11, 21.
    struct ContainerAddress {
        std::uint32_t userId = 0;
        std::optional<UUID> uuid;
        std::optional<std::string> identifier;
        ContainerClass containerClass = ContainerClass::undefined;
    };
    /// `value` nullptr removes the key. Errors 11, 21, 34, 38 (no key), 40, 45. Unless the info would be more than the
    /// file can hold, the record keeps the new info when the file cannot be written.
    Result<void> setInfoValue(const plist::Value* value, const std::string* key, const ContainerAddress& address,
                              UseLocking useLocking);
    /// Errors 11, 21, 24 (no such key; not logged), 38, 40.
    Result<plist::Value> infoValueForKey(const std::string* key, const ContainerAddress& address,
                                         UseLocking useLocking);
    struct ContainerMetadata {
        std::string path;
        bool transient = false;
        ZORMetadata::Info info; // nullptr: none
    };
    Result<ContainerMetadata> metadataForUser(const ContainerAddress& address);
    /// Makes missing standard subdirectories, and sets mode and owner of those that are there. Error 6.
    Result<void> recreateDefaultStructureForUser(const ContainerAddress& address);
    /// Gives the container's directory a new random name. Errors 45, 48.
    Result<void> regenerateDirectoryUUIDForUser(const ContainerAddress& address);
    /// Allocated bytes; of bundles measured once. `error` is the code. Walks without any lock.
    struct DiskUsageAnswer {
        std::uint64_t bytes = 0;
        ErrorCode error = ErrorCode::success;
    };
    DiskUsageAnswer diskUsageForUserId(const ContainerAddress& address);

    // Wipe (Wipe.cc).
    /// Replaces all content of a data container by that of a fresh one; path and UUID stay. Errors 11, 18, 55, and
    /// those of creation and replace.
    Result<void> deleteDataContainerContentForUser(std::uint32_t userId, const std::string* identifier,
                                                   ContainerClass containerClass);

    // Retry test (RetryTest.cc).
    /// Ends the process until it has done so often enough. For internal builds.
    Result<void> retryTestForUser(std::uint32_t userId, std::uint64_t numCrashes);

    // Listing (Listing.cc).
    struct ListedContainer {
        std::string identifier;
        UUID uuid;
    };
    /// Under the all-identifiers lock held for reading.
    Result<std::vector<ListedContainer>> containersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                           bool transient);
    struct ListedPage {
        std::vector<ListedContainer> containers;
        /// The `after` of the next page; absent when there is none.
        std::optional<std::string> next;
    };
    /// The same, limits.listPageMax at a time, in the order of the identifiers' bytes: those behind `after`, which is
    /// empty for the first page. What is made or goes between two pages may be listed or not; all else is, once.
    Result<ListedPage> containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient,
                                         const std::string& after);

    // Death row (DeathRow.cc, DeletionPass.cc).
    /// Moves an item away, never by a copy; a missing one is no failure. With `owner`, a directory of another
    /// user's stays, and the cause of the error is notTheContainer. Error 41.
    Result<void> _moveItemAtURLToDeathRow(const FileURL& url, StartDeletionThread startDeletionThread,
                                          std::optional<std::uint32_t> owner = std::nullopt);
    /// Queues one deletion pass; the completion runs on the death-row queue with success or the pass's last error code.
    void deleteContainersOnDeathRowWithCompletion(std::function<void(ErrorCode)> completion);
    /// Removes an item, or moves it to the system's directory for temporary files. Error 4.
    Result<void> _removeItemOrMoveToTempAtURL(const FileURL& url);

    // Setup (Setup.cc): before clients are served, on the thread that starts the daemon, which holds no identifier
    // lock.
    void rebootContainerManagerSetup();
    void containerManagerSetup();
    /// How many entries went.
    std::uint64_t _cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass);

    // Sandbox mapping (SandboxMapping.cc).
    /// Removes the mapping, then sets it when there is a URL. False, logged, on failure.
    bool _setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                            ContainerClass containerClass, const std::optional<FileURL>& url);

private:
    Result<void> checkListedClass(std::uint32_t userId, ContainerClass containerClass);
    Result<FoundContainer> createOrLookup(std::uint32_t userId, const std::string& identifier,
                                          ContainerClass containerClass, const CreateOrLookupOptions& options);
    /// Error 38 when the user of the container has as many as one may have.
    Result<void> checkShare(std::uint32_t userId, const std::string& identifier);
    Result<void> discardTransient(const ZORMetadata& record, const std::string& identifier);
    /// `homeGeneration`: of the home in which the container was looked for and not found.
    Result<FoundContainer> create(std::uint32_t userId, const std::string& identifier, ContainerClass containerClass,
                                  bool transient, std::uint64_t homeGeneration);
    Result<void> checkRequest(std::uint32_t userId, const std::string* identifier, ContainerClass containerClass);
    ZORError cleanUpStaging(const FileURL& staging, ZORError error);

    /// One element; `changed` gets the directories to be synced.
    Result<void> stageForDelete(const DeletionBatch& batch, std::size_t index, std::vector<FileURL>& changed);
    /// False, logged, when the container stays where it is. `owner` as _moveItemAtURLToDeathRow has it.
    bool takeAwayForDelete(const FileURL& container, std::optional<std::uint32_t> owner, std::vector<FileURL>& changed);
    /// The standard subdirectories of the container that `changed` begins with; each is added to it. New ones get the
    /// protection class.
    Result<void> makeSubdirectories(const ContainerLayout& layout, int protectionClass, std::vector<FileURL>& changed);
    /// The error of a container whose move into its place could not be synced. The record says so until one
    /// is.
    ZORError notLasting(const char* function, ErrorCode code, const FileURL& container, const ZORError& cause);
    /// Makes what was moved into or out of these directories durable; the error is not logged.
    std::optional<ZORError> syncDirectories(std::vector<FileURL> changed);

    /// A container that is about to be made, or taken from its place.
    struct ContainerAtStake {
        std::uint32_t userId = 0;
        ContainerClass containerClass = ContainerClass::undefined;
        const std::string& identifier;
        FileURL place; // empty when it has none
    };
    /// Tries the replaces that wait and that could bring back a container of this identifier, or one to this place.
    /// Whether there were any; error 35 while one is left. The caller holds the all-identifiers lock for writing.
    Result<bool> settleReplaces(const ContainerAtStake& atStake);
    /// For journals that could not be listed. Error 35 while they cannot and staging may hold a container at stake.
    Result<void> listReplacesAgain(const ContainerAtStake& atStake);
    /// Whether what waits at `staged` may be one of this identifier, or come back to this place.
    bool mayComeBack(const FileURL& staged, const WaitingReplaces::Waiting& waiting, const ContainerAtStake& atStake);
    /// The cache's record, or nullptr, when no replace that waits has to do with it. Error 35.
    Result<std::shared_ptr<ZORMetadata>> settledContainer(std::uint32_t userId, ContainerClass containerClass,
                                                          const std::string* identifier, const UUID& uuid);

    Result<void> checkReplace(const ReplaceRequest& request);
    Result<void> checkedReplace(const ReplaceRequest& request, StartDeletionThread startDeletionThread);
    struct ReplaceProgress;
    Result<void> swapContainers(const ReplaceRequest& request, ReplaceProgress& progress);
    Result<void> prepareReplace(const ReplaceRequest& request, ReplaceProgress& progress);
    Result<void> moveOldAway(const ReplaceRequest& request, ReplaceProgress& progress);
    Result<void> putNewInPlace(const ReplaceRequest& request, ReplaceProgress& progress);
    Result<void> refuseSecondOfIdentifier(const ReplaceProgress& progress);
    /// What was changed in one directory is on the disk before what comes in the other can be. 0 or a negative errno.
    int orderBetween(const FileURL& changed, const FileURL& next);
    void recoverFromException(const ReplaceProgress& progress);
    /// Error 14, or 35 when the old one waits in staging.
    ZORError undoFirstMove(ReplaceProgress& progress, const ZORError& cause);
    std::optional<ZORError> cleanUpReplace(ReplaceProgress& progress, StartDeletionThread startDeletionThread);
    Result<void> openDirectories(ReplaceProgress& progress, const FileURL& stagingUrl);
    ZORError notInPlace(const ReplaceProgress& progress, const ZORError& cause);
    /// `journal` is nullptr for a file that is none.
    Result<void> recoverReplace(const FileURL& journalUrl, ReplaceJournal* journal);
    Result<void> applyReplaceJournal(const ReplaceJournal& journal);

    Result<std::shared_ptr<ZORMetadata>> knownContainer(const char* function, const ContainerAddress& address);
    /// Error 34 when the info values of the user's containers would take more than one user's may.
    Result<void> checkInfoShare(const ZORMetadata& record, const plist::Dictionary& info);
    Result<void> checkAddress(const char* function, const ContainerAddress& address);
    Result<std::uint64_t> diskUsage(const ContainerAddress& address);
    /// What an earlier measurement left; the caller holds the container's lock.
    std::optional<std::uint64_t> keptDiskUsage(const ContainerAddress& address);
    void keepDiskUsage(const ContainerAddress& address, const FileURL& measured, std::uint64_t bytes);
    Result<void> checkWipe(std::uint32_t userId, const std::string* identifier, ContainerClass containerClass);

    /// POSIX code of an item that is not the container that it lies in the place of.
    static constexpr int notTheContainer = ESTALE;
    enum class DeathRow : std::uint8_t { ofRoot, ofFileSystem };
    /// Moves an item to `destination` on root's death row, or where that is another file system to the row of its own.
    /// `moving` is the lock of moves to death row. Errors are not logged.
    Result<DeathRow> condemn(const FileURL& url, const FileURL& destination, std::optional<std::uint32_t> owner,
                             const platform::MutexLock& moving);
    /// `from` is open and holds the item.
    Result<void> condemnOnItsFileSystem(int from, const FileURL& url, std::optional<std::uint32_t> owner);
    /// Error notTheContainer for a directory of another's.
    Result<void> judgeOwner(int directory, const FileURL& url, std::uint32_t owner);
    /// The same of `destination` in `to`, with the item again where it was, or beside that.
    Result<void> putBackIfAnothers(int from, const FileURL& url, int to, const FileURL& destination,
                                   std::uint32_t owner);

    struct DeletionPass;
    void runDeletionPass(const std::function<void(ErrorCode)>& completion);
    void deleteEverythingOnDeathRow(DeletionPass& pass);
    /// The row of the file system that `place` lies on.
    void deleteEverythingOnDeathRowOf(const FileURL& place, DeletionPass& pass);
    /// Each item of an open row to `remove`; the error says that not all could be read.
    Result<void> forEachCondemned(int directory, const FileURL& row,
                                  const std::function<Result<void>(const FileURL&)>& remove, DeletionPass& pass);
    Result<void> moveToTemporary(const FileURL& url, const FileURL& destination);
    void findInTemporary(int directory, const FileURL& temporary);
    void deleteWhatIsInTemporary();
    enum class Orphan : std::uint8_t { no, byName, noMetadata };
    /// `classDirectory` is open and holds the entry. Several threads may ask at once.
    Orphan orphanKind(int classDirectory, const FileURL& entry, ContainerClass containerClass);
    void reportOrphan(const FileURL& entry);
    // Passes of the setup; each gives the number of items it changed.
    std::uint64_t migrateBundles();
    std::uint64_t migrateWellknown();
    std::uint64_t discardAtBoot(const std::optional<FileURL>& url, const char* what,
                                std::optional<std::uint32_t> owner);
    /// `classDirectory` is open and holds the entries. How many went.
    std::uint64_t removeOrphans(int classDirectory, const std::vector<FileURL>& entries, ContainerClass containerClass);
    /// Copies across file systems that a stop cut short: hidden, so no listing shows them.
    void discardCopyLeftovers(const FileURL& directory);
    std::uint64_t cleanUpUsers();
    std::uint64_t sweepStaging();
    /// Names in staging that journals on the disk still speak of; nullopt when it cannot be told which there are.
    std::optional<std::set<std::string, std::less<>>> stagedByJournals();
    std::size_t journalCount();
    /// Whether what is not found of a user's containers has gone: the user's home is there, and holds the place of
    /// them.
    bool showsContainers(std::uint32_t userId);
    void makeDirectoriesDurable();

    StoreServices& services_;
    const Client client_;
    std::atomic<bool> allowOtherIdLookup_;
    std::atomic<bool> allowGroupIdLookup_{false};
};

} // namespace zor
