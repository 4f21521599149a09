// SPDX-License-Identifier: Apache-2.0
#include "store/ZORContainerCache.h"

#include "fs/PathResolver.h"
#include "fs/SharedWork.h"
#include "platform/Errno.h"
#include "plist/Value.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>

namespace zor {

using platform::MutexLock;

namespace {

long number(ContainerClass containerClass) {
    return static_cast<long>(containerClass);
}

/// A class directory is read so often in a row while operations change the class meanwhile.
constexpr int readsMax = 16;

} // namespace

ZORError ZORContainerCache::failedToRebuild(Here here, const Key& key, const ZORError& cause) {
    return Reporter(log_, here.function)
        .error(ErrorCode::cacheNotRebuilt, &cause, "Cache: %u-%s%s: Failed to rebuild", key.userId,
               className(key.containerClass), suffix(key.transient));
}

void ZORContainerCache::traceIdentifier(Here here, const Key& key, const char* what, const std::string& identifier) {
    if (log_.writes(logLevelDebug))
        log_.write(logLevelDebug, here.function, "Cache: %s%s: %s Identifier: %s", className(key.containerClass),
                   suffix(key.transient), what, ZOR_SHOWN(identifier));
}

UserHome* ZORContainerCache::homeOf(const Key& key) const {
    return isPerUserClass(key.containerClass) ? configuration_.homeOf(key.userId) : nullptr;
}

template <typename Function>
auto ZORContainerCache::withCurrentHome(const Key& key, Function&& find) {
    UserHome* const home = homeOf(key);
    const UserHome::Seen seen = home ? home->lookIfDue() : UserHome::Seen();
    auto found = find();
    // That nothing is known of an identifier is the usual answer for one that is new, and no sign of another home.
    if (!found && seen.state == UserHome::State::present && !found.error().is(ErrorCode::notFound) &&
        home->look().generation != seen.generation)
        found = find();
    return found;
}

bool ZORContainerCache::isLeftOpen(const ZORError& error, const Key& key) const {
    if (error.isOwnShortage() || !error.is(ErrorCode::cacheNotRebuilt))
        return error.isOwnShortage();
    UserHome* const home = homeOf(key);
    return (error.underlying() && error.underlying()->isPosix(ENOKEY)) ||
           (home && home->lookIfDue().state == UserHome::State::missing);
}

std::size_t ZORContainerCache::infoBytesOf(const ZORMetadata& record) {
    return record.info() ? plist::heldBytes(*record.info()) : 0;
}

void ZORContainerCache::store(ClassCache& cache, Record record, std::size_t infoBytes) {
    ZOR_ASSERT(record);
    remove(cache, record->identifier());
    const ZORMetadata* const stored = record.get();
    cache.records.insert(std::move(record));
    if (infoBytes > 0) {
        cache.infoBytesOf[stored] = infoBytes; // may want memory; then the size is not in the sum either
        cache.infoBytes += infoBytes;
    }
}

void ZORContainerCache::remove(ClassCache& cache, std::string_view identifier) {
    const auto known = cache.records.find(identifier);
    if (known == cache.records.end())
        return;
    if (const auto bytes = cache.infoBytesOf.find(known->get()); bytes != cache.infoBytesOf.end()) {
        ZOR_ASSERT(cache.infoBytes >= bytes->second);
        cache.infoBytes -= bytes->second;
        cache.infoBytesOf.erase(bytes);
    }
    cache.records.erase(known);
}

ZORContainerCache::ClassCache* ZORContainerCache::knownCache(const Key& key) {
    const UserHome* const home = homeOf(key);
    const auto known = caches_.find(key);
    const bool counts = known != caches_.end() && (!home || known->second.homeGeneration == home->generation());
    return counts ? &known->second : nullptr;
}

Result<ZORContainerCache::ClassCache*> ZORContainerCache::_getCacheForUserId(const Key& key, Wanted wanted) {
    if (!configuration_.users().mayOwn(key.containerClass, key.userId))
        return Reporter(log_, __func__)
            .error(ErrorCode::cacheInputInvalid, "Invalid cache get-userId %u for class %ld", key.userId,
                   static_cast<long>(key.containerClass));
    for (int reads = 0; reads < readsMax;) {
        ClassCache* const before = knownCache(key);
        if (before && (wanted == Wanted::asKnown || !before->hidesSome))
            return before;
        if (beingRead_.contains(key)) {
            const platform::BlockingScope blocking;
            readEnded_.wait(cacheLock_);
            continue;
        }
        ++reads;
        if (!before)
            ZOR_LOG(log_, logLevelDebug, "Rebuilding container class cache: %u-%s%s", key.userId,
                    className(key.containerClass), suffix(key.transient));
        const std::uint64_t serial = before ? before->serial : 0;
        const std::uint64_t drops = drops_;
        ClassCache built;
        TRY(readUnlocked(key, [&]() -> Result<void> {
            auto whole = readClassDirectory(key);
            if (!whole)
                return std::move(whole).error();
            built = std::move(*whole);
            return {};
        }));
        // An operation's later change of the class is not in what was read, or not as it is.
        const ClassCache* const now = knownCache(key);
        if (drops != drops_ || (now ? now->serial : 0) != serial)
            continue;
        if (now)
            for (const Record& known : now->records)
                if (const auto again = built.records.find(known);
                    again != built.records.end() && (*again)->place().name() == known->place().name()) {
                    const auto bytes = now->infoBytesOf.find(known.get());
                    store(built, known, bytes == now->infoBytesOf.end() ? 0 : bytes->second);
                }
        ClassCache& cache = caches_[key] = std::move(built);
        noteChange(cache);
        if (wanted == Wanted::whole && cache.hidesSome)
            return posixError(ZOR_HERE, Errno(ENOKEY),
                              "An encryption whose key is away hides containers of user %u, class %s", key.userId,
                              className(key.containerClass));
        return &cache;
    }
    return posixError(ZOR_HERE, Errno(EAGAIN), "The containers of user %u, class %s, changed whenever they were read",
                      key.userId, className(key.containerClass));
}

void ZORContainerCache::prepare(std::uint32_t userId, ContainerClass containerClass, bool transient) {
    if (!isValidClass(containerClass) || !configuration_.users().mayOwn(containerClass, userId))
        return;
    (void)boundary_.run(ZOR_HERE, [&]() -> Result<void> {
        const Key key{userId, containerClass, transient};
        UserHome* const home = homeOf(key);
        if (home && !configuration_.homeAnswers(userId, fs::MountFence::Asked::now)) {
            (void)home->look(); // who asks under the lock finds all questions asked
            return {};
        }
        const MutexLock held(cacheLock_);
        (void)_getCacheForUserId(key);
        return {};
    });
}

void ZORContainerCache::prepare(std::uint32_t userId, ContainerClass containerClass) {
    prepare(userId, containerClass, false);
    if (isValidClass(containerClass) && !lookForDirectory({userId, containerClass, true}))
        prepare(userId, containerClass, true);
}

Errno ZORContainerCache::lookForDirectory(const Key& key) {
    const auto place = configuration_.placeOfClass(key.userId, key.containerClass, key.transient);
    const auto directory = place ? fileManager_.resolver().openDirectory(*place) : Errno(ENOENT);
    return directory ? Errno() : directory.error();
}

Result<ZORContainerCache::Found> ZORContainerCache::findRecord(const Key& key, const std::string& identifier) {
    const MutexLock held(cacheLock_);
    constexpr Here here{"containerForUser", __LINE__};
    auto cache = _getCacheForUserId(key);
    if (!cache)
        return failedToRebuild(here, key, cache.error());
    auto found = (*cache)->records.find(std::string_view(identifier));
    if (found == (*cache)->records.end() && (*cache)->hidesSome) {
        cache = _getCacheForUserId(key, Wanted::whole);
        if (!cache)
            return failedToRebuild(here, key, cache.error());
        found = (*cache)->records.find(std::string_view(identifier));
    }
    if (found == (*cache)->records.end())
        return Reporter(log_, "containerForUser")
            .unlogged(ErrorCode::notFound, "Cache: %s%s: Container Not Found with ID: %s",
                      className(key.containerClass), suffix(key.transient), ZOR_SHOWN(identifier));
    return Found{.record = *found, .place = (*found)->place()};
}

ErrnoOr<bool> ZORContainerCache::lookForFile(const FileURL& container) {
    if (container.empty())
        return Errno(EINVAL);
    // A link or anything else in the file's place is no metadata file: the owner of the container can put it there.
    struct stat status{};
    TRY(fileManager_.resolver().status(container.appendingFile(names::metadataFile), status));
    return S_ISREG(status.st_mode);
}

Result<void> ZORContainerCache::checkOnDisk(Here here, const Key& key, const Found& found, const ErrnoOr<bool>& looked,
                                            const char* foundFormatPrefix) {
    if (found.place.empty())
        return Reporter(log_, here.function)
            .error(ErrorCode::cacheInputInvalid, "Cache: %s%s: nil URL from %s", className(key.containerClass),
                   suffix(key.transient), "(null)");
    if (looked.value_or(false)) {
        traceIdentifier(here, key, foundFormatPrefix, found.record->identifier());
        return {};
    }
    const FileURL file = found.place.url().appendingFile(names::metadataFile);
    const Errno missing = looked ? Errno() : looked.error();
    if (missing && missing != ENOENT)
        log_.write(logLevelError, "itemExistsAtURL", "Failed to determine if %s exists: %s", file.c_str(),
                   missing.text());
    if (missing == ENOENT && fs::hiddenBy(fileManager_.resolver(), fileManager_.disk(), file))
        return failedToRebuild(
            here, key, posixError(here, Errno(ENOKEY), "An encryption whose key is away hides %s", file.c_str()));
    std::optional<ZORError> cause;
    if (isOwnShortage(missing))
        cause = posixError(here, missing, "open of %s failed: %s", file.c_str(), missing.text());
    return Reporter(log_, here.function)
        .error(ErrorCode::cachedContainerWithoutMetadata, cause ? &*cause : nullptr,
               "Cache: %s%s: INCONSISTENT-No Metadata at: %s", className(key.containerClass), suffix(key.transient),
               file.c_str());
}

Result<ZORContainerCache::Record> ZORContainerCache::containerForUser(std::uint32_t userId,
                                                                      ContainerClass containerClass,
                                                                      const std::string* identifier, bool transient) {
    return boundary_.run(ZOR_HERE, [&]() -> Result<Record> {
        const Here here{"containerForUser", __LINE__};
        if (!isValidClass(containerClass))
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid Content Class: %ld", number(containerClass));
        if (!identifier)
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid identifier: %s", "(null)");
        const Key key{userId, containerClass, transient};
        return withCurrentHome(key, [&] { return findOnDisk(here, key, *identifier); });
    });
}

std::optional<ZORContainerCache::LiveContainer> ZORContainerCache::liveContainerForUser(std::uint32_t userId,
                                                                                        ContainerClass containerClass,
                                                                                        const std::string& identifier) {
    const Key key{userId, containerClass, false};
    UserHome* const home = homeOf(key);
    const UserHome::Seen seen = home ? home->lookIfDue() : UserHome::Seen();
    if (home && seen.state != UserHome::State::present)
        return std::nullopt;
    LiveContainer live;
    ContainerPlace place;
    {
        const MutexLock held(cacheLock_);
        const auto cache = caches_.find(key);
        if (cache == caches_.end() || (home && cache->second.homeGeneration != seen.generation))
            return std::nullopt;
        const auto found = cache->second.records.find(std::string_view(identifier));
        if (found == cache->second.records.end() || !(*found)->durable())
            return std::nullopt;
        live.record = *found;
        live.uuid = live.record->uuid();
        place = live.record->place();
    }
    const FileURL container = place.url();
    if (!lookForFile(container).value_or(false))
        return std::nullopt;
    traceIdentifier({"containerForUser", __LINE__}, key, "Found", identifier);
    live.path = container.path();
    return live;
}

Result<ZORContainerCache::Record> ZORContainerCache::findOnDisk(Here here, const Key& key,
                                                                const std::string& identifier) {
    Found found = TRY(findRecord(key, identifier));
    if (found.place.empty())
        return Reporter(log_, here.function)
            .error(ErrorCode::cacheInputInvalid, "Cache: %s%s: Invalid URL path string: %s",
                   className(key.containerClass), suffix(key.transient), "(null)");
    auto looked = lookForFile(found.place.url());
    if (!looked && looked.error() == ENOENT && lookOver(key, found)) {
        found = TRY(findRecord(key, identifier));
        looked = lookForFile(found.place.url());
    }
    TRY(checkOnDisk(here, key, found, looked, "Found"));
    return found.record;
}

Result<ZORContainerCache::Record> ZORContainerCache::containerForUser(std::uint32_t userId,
                                                                      ContainerClass containerClass,
                                                                      const std::string* identifier,
                                                                      std::string_view uuidString) {
    for (const bool transient : {false, true}) {
        auto record = containerForUser(userId, containerClass, identifier, transient);
        if (!record && isLeftOpen(record.error(), {userId, containerClass, transient}))
            return record;
        if (record && (*record)->uuid().string() == uuidString) {
            // Readers of one container may be here together: nothing is written that is so already.
            if ((*record)->transient() != transient)
                (*record)->setTransient(transient);
            return record;
        }
    }
    return Record();
}

template <typename Take>
Result<std::vector<ZORContainerCache::Record>> ZORContainerCache::listed(const Key& key, const Take& take) {
    return boundary_.run(ZOR_HERE, [&]() -> Result<std::vector<Record>> {
        const Here here{"allContainersForUser", __LINE__};
        if (!isValidClass(key.containerClass))
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid Content Class: %ld", number(key.containerClass));
        return withCurrentHome(key, [&]() -> Result<std::vector<Record>> {
            std::vector<Found> found;
            std::uint64_t homeGeneration = 0;
            {
                const MutexLock held(cacheLock_);
                const auto cache = _getCacheForUserId(key, Wanted::whole);
                if (!cache)
                    return failedToRebuild(here, key, cache.error());
                homeGeneration = (*cache)->homeGeneration;
                take((*cache)->records, found);
            }
            return thoseOnDisk(here, key, std::move(found), homeGeneration);
        });
    });
}

Result<std::vector<ZORContainerCache::Record>>
ZORContainerCache::allContainersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient) {
    return listed(Key{userId, containerClass, transient}, [](const auto& records, std::vector<Found>& all) {
        all.reserve(records.size());
        for (const Record& record : records)
            all.push_back({.record = record, .place = record->place()});
    });
}

Result<std::vector<ZORContainerCache::Record>>
ZORContainerCache::thoseOnDisk(Here here, const Key& key, std::vector<Found> found, std::uint64_t homeGeneration) {
    std::vector<ErrnoOr<bool>> looked(found.size(), false);
    fs::forEachStretch(found.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i)
            looked[i] = lookForFile(found[i].place.url());
    });
    std::vector<Record> records;
    records.reserve(found.size());
    for (std::size_t i = 0; i < found.size(); ++i) {
        Found& one = found[i];
        const auto there = checkOnDisk(here, key, one, looked[i], "ALL Found");
        if (!there && isLeftOpen(there.error(), key))
            return there.error();
        if (there)
            records.push_back(std::move(one.record));
    }
    // Containers that went with their home are not gone.
    UserHome* const home = records.size() == found.size() ? nullptr : homeOf(key);
    if (home && home->look().generation != homeGeneration)
        return failedToRebuild(here, key,
                               posixError(here, Errno(ENOENT), "The home of user %u changed meanwhile", key.userId));
    return records;
}

Result<ZORContainerCache::PageOfRecords> ZORContainerCache::pageOfContainersForUser(std::uint32_t userId,
                                                                                    ContainerClass containerClass,
                                                                                    bool transient, const Page& page) {
    PageOfRecords result;
    const auto before = [](const Record& left, const Record& right) {
        return left->identifier() < right->identifier();
    };
    result.records =
        TRY(listed(Key{userId, containerClass, transient}, [&](const auto& all, std::vector<Found>& found) {
            std::vector<Record> records;
            records.reserve(all.size());
            for (const Record& record : all)
                if (page.after.empty() || record->identifier() > page.after)
                    records.push_back(record);
            const auto end =
                records.begin() + static_cast<std::ptrdiff_t>(std::min(records.size(), page.containersMax));
            std::partial_sort(records.begin(), end, records.end(), before);
            result.next = end != records.end() ? std::optional(end[-1]->identifier()) : std::nullopt;
            for (auto record = records.begin(); record != end; ++record)
                found.push_back({.record = *record, .place = (*record)->place()});
        }));
    return result;
}

Result<void> ZORContainerCache::addContainerMetadata(const Record& record, std::uint32_t userId, ContainerPlace place,
                                                     bool transient) {
    return boundary_.run(ZOR_HERE, [&]() -> Result<void> {
        const Here here{"addContainerMetadata", __LINE__};
        if (!isValidClass(record->containerClass()))
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid Metadata Content Class: %lld",
                       static_cast<long long>(record->containerClass()));
        if (place.empty())
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid input: URL: %s", "(null)");
        const Key key{userId, record->containerClass(), transient};
        const std::size_t infoBytes = infoBytesOf(*record);
        {
            const MutexLock held(cacheLock_);
            const auto cache = _getCacheForUserId(key);
            if (!cache)
                return failedToRebuild(here, key, cache.error());
            record->setPlace(std::move(place));
            store(**cache, record, infoBytes);
            noteChange(**cache);
        }
        traceIdentifier(here, key, "Added", record->identifier());
        return {};
    });
}

Result<void> ZORContainerCache::removeContainerForUser(std::uint32_t userId, ContainerClass containerClass,
                                                       const std::string* identifier, bool transient) {
    return boundary_.run(ZOR_HERE, [&]() -> Result<void> {
        const Here here{"removeContainerForUser", __LINE__};
        if (!isValidClass(containerClass))
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid Content Class: %ld", number(containerClass));
        if (!identifier)
            return Reporter(log_, here.function)
                .error(ErrorCode::cacheInputInvalid, "Invalid Identifier: %s", "(null)");
        const Key key{userId, containerClass, transient};
        {
            const MutexLock held(cacheLock_);
            const auto cache = _getCacheForUserId(key);
            if (!cache)
                return failedToRebuild(here, key, cache.error());
            remove(**cache, *identifier);
            noteChange(**cache);
        }
        traceIdentifier(here, key, "Removed", *identifier);
        return {};
    });
}

void ZORContainerCache::dropAll() {
    const MutexLock held(cacheLock_);
    caches_.clear();
    wholeUsers_.clear();
    ++drops_;
}

ZORContainerCache::Counts ZORContainerCache::counts() {
    const MutexLock held(cacheLock_);
    Counts counts{.classCaches = caches_.size()};
    for (const auto& [key, cache] : caches_)
        counts.records += cache.records.size();
    return counts;
}

std::vector<UUID> ZORContainerCache::withUnsavedInfo() {
    std::vector<UUID> uuids;
    const MutexLock held(cacheLock_);
    for (const auto& [key, cache] : caches_)
        for (const Record& record : cache.records)
            if (!record->infoIsSaved())
                uuids.push_back(record->uuid());
    return uuids;
}

} // namespace zor
