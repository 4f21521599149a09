// SPDX-License-Identifier: Apache-2.0
// Finds containers without scanning the disk: for each user, class and transient flag, the records by identifier.
//
// Such a class cache is built from disk when it is first needed and kept; only adding and removing change it, and the
// setup drops all of them once, before the first client. One of a user's is worth nothing when the user's home has
// gone, come or become another one, and is built anew then. If an encryption hides containers, those that are known are
// found, and of no other is it said that it does not exist. The disk is the truth all the same: a lookup that returns a
// record has just seen its metadata file. If that file has gone with its directory, the class directory is looked over
// once for where the container may have been moved to. Code 21 is the one answer that means "does not exist"; every
// other failure means "not known".
//
// One mutex guards the class caches. Nobody waits for a disk on it: a class directory is read without it, by one thread
// for all that need it, and what was read counts unless the class has changed meanwhile. The checks on disk run without
// it, too. A caller that needs a lookup and a later add to be one step holds the identifier locks around both, and has
// the class read before it takes them (prepare). Exceptions end at these operations (code 40).
#pragma once

#include "base/ContainerClass.h"
#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/Durability.h"
#include "ipc/Identifiers.h"
#include "platform/Errno.h"
#include "store/Configuration.h"
#include "store/ZORMetadata.h"

#include <chrono>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace zor {

// How much clients may leave behind in the daemon's memory, and how a listing is cut into pages. Everything left behind
// is found again at the next start, so nothing of it may grow without bound.
//
// Shares count by the user whose containers they are, and bind every client but the owners of the root: users share
// what belongs to the bundles' and the system's owner, and the installer, an owner of the root, is not kept out by
// them. Tests make these smaller.

struct StoreLimits {
    /// Containers of one user, transient ones and groups among them. A record takes some hundred bytes, 1.4 KB with the
    /// longest identifier, so ten users (the usual number) and the two owners stay below 2 GB at the very worst.
    std::size_t containersMaxPerUser = 100'000;
    /// Bytes of memory of the info values of one user's containers: those of one container may take a megabyte.
    std::size_t infoBytesMaxPerUser = std::size_t{64} << 20;
    /// Changes of protection that have begun and not ended: while the device is locked each takes some hundred bytes.
    std::size_t protectionChangesMax = 10'000;
    /// Containers in one page of a listing. With the longest identifiers that is 11 MB, of the 64 MB that a connection
    /// may have unread.
    std::size_t listPageMax = 10'000;
};

class ZORContainerCache {
public:
    using Record = std::shared_ptr<ZORMetadata>;

    ZORContainerCache(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration,
                      fs::Durability& durability, ExceptionBoundary& boundary)
        : log_(log), fileManager_(fileManager), configuration_(configuration), durability_(durability),
          boundary_(boundary) {}
    ZORContainerCache(const ZORContainerCache&) = delete;
    ZORContainerCache& operator=(const ZORContainerCache&) = delete;

    /// The cache's own record of the identifier. `identifier` nullptr: error 47.
    Result<Record> containerForUser(std::uint32_t userId, ContainerClass containerClass, const std::string* identifier,
                                    bool transient);
    /// The record whose internal UUID is `uuidString` (upper-case), live before transient; its transient flag is set
    /// accordingly. nullptr when there is none; an error only where that is left open: for want of descriptors or
    /// memory, because an encryption hides it, or because the user's home is not there.
    Result<Record> containerForUser(std::uint32_t userId, ContainerClass containerClass, const std::string* identifier,
                                    std::string_view uuidString);
    /// The parts of a live container that a reply needs: read at one moment, under the mutex of the class caches.
    struct LiveContainer {
        Record record;
        UUID uuid;
        std::string path;
    };
    /// The live container of the identifier when all is as usual: its class has been read in the home that is there,
    /// its place is on the disk for good, and its metadata file was seen right now. Reads no directory and changes
    /// nothing.
    [[nodiscard]] std::optional<LiveContainer> liveContainerForUser(std::uint32_t userId, ContainerClass containerClass,
                                                                    const std::string& identifier);
    /// Every record whose metadata file is still there. Want of descriptors or memory makes none go missing: error 44;
    /// nor does an encryption, or a home that is not there: error 43.
    Result<std::vector<Record>> allContainersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                     bool transient);
    struct Page {
        std::string after;
        std::size_t containersMax;
    };
    struct PageOfRecords {
        std::vector<Record> records;
        /// The identifier behind which the next page begins; absent when there is none.
        std::optional<std::string> next;
    };
    /// The first `containersMax` of those behind `after`, in the order of their identifiers' bytes; an empty one is
    /// before all. Looks at no metadata file of others.
    Result<PageOfRecords> pageOfContainersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient,
                                                  const Page& page);
    /// Stores the record under its identifier, at `place`, over any other of that identifier.
    Result<void> addContainerMetadata(const Record& record, std::uint32_t userId, ContainerPlace place, bool transient);
    Result<void> removeContainerForUser(std::uint32_t userId, ContainerClass containerClass,
                                        const std::string* identifier, bool transient);

    /// Reads what a lookup will need, where that has not been done, and asks a home that may stop answering whether it
    /// does. Called before the all-identifiers lock is taken, so that nobody waits there for this disk. The lookup
    /// tells a failure, at once.
    void prepare(std::uint32_t userId, ContainerClass containerClass, bool transient) ZOR_EXCLUDES(cacheLock_);
    /// The same for a lookup by UUID: of transient containers only where there may be some.
    void prepare(std::uint32_t userId, ContainerClass containerClass) ZOR_EXCLUDES(cacheLock_);
    /// Forgets every class cache; each is built anew when it is next needed.
    void dropAll() ZOR_EXCLUDES(cacheLock_);
    /// The containers of a user, in classes of every kind, transient ones included. The first time that a user is asked
    /// for, every class cache of the user's is built whose directory is there; later this is a sum over them. While the
    /// user's home is missing that comes again.
    struct Held {
        std::size_t containers = 0;
        /// Memory of the info values.
        std::size_t infoBytes = 0;
    };
    [[nodiscard]] Held heldByUser(std::uint32_t userId) ZOR_EXCLUDES(cacheLock_);
    /// For the status: class caches and the records in them.
    struct Counts {
        std::size_t classCaches = 0;
        std::size_t records = 0;
    };
    [[nodiscard]] Counts counts() ZOR_EXCLUDES(cacheLock_);
    /// Containers of which clients are shown info values that are not on the disk. Looks at all records.
    [[nodiscard]] std::vector<UUID> withUnsavedInfo() ZOR_EXCLUDES(cacheLock_);

private:
    struct IdentifierOf {
        using is_transparent = void;
        static std::string_view of(std::string_view identifier) noexcept { return identifier; }
        static std::string_view of(const Record& record) noexcept { return record->identifier(); }
        /// That it throws nothing has the table keep no hash beside each record.
        std::size_t operator()(const auto& key) const noexcept { return ipc::hashOfIdentifier(of(key)); }
        bool operator()(const auto& left, const auto& right) const noexcept { return of(left) == of(right); }
    };
    struct ClassCache {
        std::unordered_set<Record, IdentifierOf, IdentifierOf> records;
        /// Memory of the info values of those that have some, as each had when it was stored.
        std::unordered_map<const ZORMetadata*, std::size_t> infoBytesOf;
        std::size_t infoBytes = 0; // the sum
        /// The generation of the home that they were read from.
        std::uint64_t homeGeneration = 0;
        /// There may be others, which an encryption hid when the directory was read.
        bool hidesSome = false;
        /// Another one after each change of the records.
        std::uint64_t serial = 0;
    };
    struct Key {
        std::uint32_t userId;
        ContainerClass containerClass;
        bool transient;
        auto operator<=>(const Key&) const = default;
    };

    /// `whole` is for a caller that is about to say that something is not there: the directory is read again when some
    /// of it was hidden, and while that is so it is an error. The records that are known stay the same objects.
    enum class Wanted { asKnown, whole };
    /// Reads what is missing for that. Returns with the class cache there, or an error.
    Result<ClassCache*> _getCacheForUserId(const Key& key, Wanted wanted = Wanted::asKnown) ZOR_REQUIRES(cacheLock_);
    /// The class cache as it is; nullptr when there is none, or none of the home that is there.
    ClassCache* knownCache(const Key& key) ZOR_REQUIRES(cacheLock_);
    /// Lets the mutex go while it runs `read`; other readers of the class wait meanwhile.
    Result<void> readUnlocked(const Key& key, const std::function<Result<void>()>& read) ZOR_REQUIRES(cacheLock_);
    Result<ClassCache> readClassDirectory(const Key& key);
    /// The error for which the class has no directory now. One that is missing is not made for this.
    Errno lookForDirectory(const Key& key);
    /// False when want of descriptors or memory left one unbuilt.
    bool buildAllOfUser(std::uint32_t userId) ZOR_EXCLUDES(cacheLock_);
    /// A record and where it lay when the cache was looked at. Another operation may move the container meanwhile; who
    /// holds the lock of this very container sees both agree.
    struct Found {
        Record record;
        ContainerPlace place;
    };
    Result<Found> findRecord(const Key& key, const std::string& identifier) ZOR_EXCLUDES(cacheLock_);
    Result<Record> findOnDisk(Here here, const Key& key, const std::string& identifier);
    /// The user's home, for a class of users; nullptr for any other.
    [[nodiscard]] UserHome* homeOf(const Key& key) const;
    /// Runs `find`, and once more when it failed over a home that is not the one it began with.
    template <typename Function>
    auto withCurrentHome(const Key& key, Function&& find);
    /// Whether the error says of the container neither that it is there nor that it is not.
    [[nodiscard]] bool isLeftOpen(const ZORError& error, const Key& key) const;
    ZORError failedToRebuild(Here here, const Key& key, const ZORError& cause);
    /// Whether what lies in the place of the record's metadata file is a file; an error when nothing does.
    ErrnoOr<bool> lookForFile(const FileURL& container);
    /// Reads the class directory again for what has gone from its place; false when that was not to be, yet. True means
    /// that looking the record up again is worth while.
    bool lookOver(const Key& key, const Found& gone) ZOR_EXCLUDES(cacheLock_);
    /// Code 44 or 47 unless the look for the file found it; 43 where it is hidden.
    Result<void> checkOnDisk(Here here, const Key& key, const Found& found, const ErrnoOr<bool>& looked,
                             const char* foundFormatPrefix);
    /// The containers that `take` chooses of a class's records, under the cache's lock, and whose files are there.
    template <typename Take>
    Result<std::vector<Record>> listed(const Key& key, const Take& take);
    /// Error 43 also when they were of a home that has changed since.
    Result<std::vector<Record>> thoseOnDisk(Here here, const Key& key, std::vector<Found> found,
                                            std::uint64_t homeGeneration);
    /// Behind a class's name in messages.
    static const char* suffix(bool transient) { return transient ? "(transient)" : ""; }
    static std::size_t infoBytesOf(const ZORMetadata& record);
    static void store(ClassCache& cache, Record record, std::size_t infoBytes);
    static void remove(ClassCache& cache, std::string_view identifier);
    void noteChange(ClassCache& cache) ZOR_REQUIRES(cacheLock_) { cache.serial = ++serials_; }
    /// A level-7 line under the operation's own name, which a lambda inside it does not have.
    void traceIdentifier(Here here, const Key& key, const char* what, const std::string& identifier);

    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    fs::Durability& durability_;
    ExceptionBoundary& boundary_;
    platform::Mutex cacheLock_;
    platform::ConditionVariable readEnded_;
    /// Classes whose directories are being read.
    std::set<Key> beingRead_ ZOR_GUARDED_BY(cacheLock_);
    std::uint64_t serials_ ZOR_GUARDED_BY(cacheLock_) = 0;
    /// How often all were dropped.
    std::uint64_t drops_ ZOR_GUARDED_BY(cacheLock_) = 0;
    std::map<Key, ClassCache> caches_ ZOR_GUARDED_BY(cacheLock_);
    /// Users of whom every class cache has been built that could be.
    std::set<std::uint32_t> wholeUsers_ ZOR_GUARDED_BY(cacheLock_);
    std::map<Key, std::chrono::steady_clock::time_point> nextLookOver_ ZOR_GUARDED_BY(cacheLock_);
};

} // namespace zor
