// SPDX-License-Identifier: Apache-2.0
// The class directories as the cache reads them: for all that need one by one thread, without the mutex.
#include "base/Mutex.h"
#include "fs/PathResolver.h"
#include "fs/SharedWork.h"
#include "fs/TreeWalker.h"
#include "store/ZORContainerCache.h"
#include "store/ZORMetadata.h"

#include <cerrno>
#include <exception>
#include <functional>
#include <iterator>
#include <malloc.h>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor {

using platform::MutexLock;

namespace {

// Reads the metadata of every container in a class directory.
//
// Reading is one open, one fstat, one read and one close an entry. In a large directory a second thread takes every
// other stretch of entries: when the directory is not in memory, two reads are under way at the disk instead of one,
// and when it is, two processors parse. Each record is handed over in the directory's order all the same, so that of
// two containers with one identifier the later listed counts.

class ClassDirectoryReader {
public:
    ClassDirectoryReader(const Log& log, ZORFileManager& fileManager, FileURL directory, std::uint32_t userId)
        : log_(log), fileManager_(fileManager), directory_(std::move(directory)), userId_(userId) {}

    /// Calls `found` for each valid container, on this thread; what is not valid is logged and left out. Fails with the
    /// listing's error, ENOKEY where an encryption hides the names, and `found` is then not called.
    Result<void> forEach(const std::function<void(std::shared_ptr<ZORMetadata>)>& found);
    /// Whether an entry of the last listing may be a container that an encryption hides.
    [[nodiscard]] bool metHidden() const { return metHidden_; }

private:
    const Log& log_;
    ZORFileManager& fileManager_;
    const FileURL directory_;
    const std::uint32_t userId_;
    bool metHidden_ = false;
};

/// The number of a directory's entries that are no containers and are told one by one: a user may have filled it with
/// any number.
constexpr std::size_t refusalsSaidMax = 200;

/// The entries that could not be read as containers. Any thread.
class Refusals {
public:
    void add(std::size_t index, ZORError error) {
        const ZORError* const cause = error.underlying();
        const MutexLock held(mutex_);
        ++count_;
        if (cause && cause->isOwnShortage())
            shortage_ = Errno(cause->code());
        isHidden_ = isHidden_ || (cause && cause->isPosix(ENOKEY));
        first_.emplace(index, std::move(error));
        if (first_.size() > refusalsSaidMax)
            first_.erase(std::prev(first_.end()));
    }
    /// In the directory's order.
    void say(const Log& log, const FileURL& directory) {
        const MutexLock held(mutex_);
        for (const auto& [index, error] : first_)
            logError(log, error);
        if (count_ > first_.size())
            log.write(logLevelError, "readAndValidateMetadataAtUrl", "%llu more entries of %s are no containers",
                      static_cast<unsigned long long>(count_ - first_.size()), directory.c_str());
    }
    /// That this process was short of descriptors or memory.
    Errno shortage() {
        const MutexLock held(mutex_);
        return shortage_;
    }
    [[nodiscard]] bool isHidden() {
        const MutexLock held(mutex_);
        return isHidden_;
    }

private:
    platform::Mutex mutex_;
    std::uint64_t count_ ZOR_GUARDED_BY(mutex_) = 0;
    std::map<std::size_t, ZORError> first_ ZOR_GUARDED_BY(mutex_);
    Errno shortage_ ZOR_GUARDED_BY(mutex_);
    bool isHidden_ ZOR_GUARDED_BY(mutex_) = false;
};

/// The names of a directory in one block of memory, each NUL-terminated.
struct Names {
    std::string bytes;
    std::vector<std::uint32_t> starts;
    void add(const char* name, std::size_t length) {
        starts.push_back(static_cast<std::uint32_t>(bytes.size()));
        bytes.append(name, length + 1);
    }
    [[nodiscard]] const char* at(std::size_t index) const { return bytes.data() + starts[index]; }
};

Result<void> ClassDirectoryReader::forEach(const std::function<void(std::shared_ptr<ZORMetadata>)>& found) {
    const auto failed = [&](Errno error) {
        return posixError({"urlsForItemsInDirectoryAtURL", __LINE__}, error, "_IterateDirectory for %s returned %s",
                          directory_.c_str(), error.text());
    };
    const auto directory = fileManager_.resolver().openDirectory(directory_);
    platform::Disk& disk = fileManager_.disk();
    const bool hidden = directory
                            ? disk.hidesNames(directory->get())
                            : directory.error() == ENOENT && fs::hiddenBy(fileManager_.resolver(), disk, directory_);
    if (!directory || hidden) {
        const Errno error = hidden ? Errno(ENOKEY) : directory.error();
        if (error != ENOENT)
            log_.write(logLevelError, "_IterateDirectory", "opendir of %s failed: %s", directory_.c_str(),
                       error.text());
        return failed(error);
    }
    Names names;
    fs::BulkDirectoryRead::Buffer buffer;
    fs::BulkDirectoryRead entries(directory->get(), buffer);
    while (const auto* entry = entries.next())
        if (entry->name[0] != '.')
            names.add(entry->name, entry->nameBytes);
    if (entries.error())
        return failed(entries.error());

    const MetadataReader reader(disk, directory->get(), directory_.path(), userId_, CheckClassPath::yes);
    std::vector<std::shared_ptr<ZORMetadata>> records(names.starts.size());
    Refusals refusals;
    fs::forEachStretch(records.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            auto record = reader.read(names.at(i));
            if (record)
                records[i] = std::move(*record);
            else
                refusals.add(i, std::move(record).error());
        }
    });
    refusals.say(log_, directory_);
    metHidden_ = refusals.isHidden();
    // An entry that this process could not look at may be a container. Taken for none, it would get a double.
    if (const Errno shortage = refusals.shortage())
        return failed(shortage);
    for (auto& record : records)
        if (record)
            found(std::move(record));
    return {};
}

/// A look over a class directory after something has gone from it takes at most a hundredth of the time, and comes at
/// most once a second: who owns the directory can make it necessary again and again.
constexpr std::chrono::seconds lookOverPauseMin{1};
constexpr int lookOverShare = 100;

/// The reading of so many leaves holes in the memory, a tenth of the size of the records that it made.
constexpr std::size_t recordsWithHoles = 10'000;

void giveHolesBack() {
#ifdef __GLIBC__
    ::malloc_trim(0);
#endif
}

} // namespace

Result<void> ZORContainerCache::readUnlocked(const Key& key, const std::function<Result<void>()>& read) {
    const platform::BlockingScope blocking;
    std::optional<Result<void>> result;
    std::exception_ptr thrown;
    beingRead_.insert(key);
    cacheLock_.unlock();
    try {
        result.emplace(read());
    } catch (...) {
        thrown = std::current_exception();
    }
    cacheLock_.lock();
    beingRead_.erase(key);
    readEnded_.broadcast();
    if (thrown)
        std::rethrow_exception(thrown);
    return std::move(*result);
}

Result<ZORContainerCache::ClassCache> ZORContainerCache::readClassDirectory(const Key& key) {
    UserHome* const home = homeOf(key);
    const auto seen = home ? home->look() : UserHome::Seen();
    if (home && seen.state == UserHome::State::missing)
        return posixError(ZOR_HERE, Errno(ENOENT),
                          "The home of user %u is not there; the next request looks for it again", key.userId);
    const auto directory = configuration_.containerDirectoryURLForUser(key.userId, key.containerClass, key.transient);
    if (!directory)
        return posixError(ZOR_HERE, Errno(ENOENT), "User %u has no directory for class %s", key.userId,
                          className(key.containerClass));
    ClassDirectoryReader reader(log_, fileManager_, *directory, key.userId);
    ClassCache cache{.records = {}, .infoBytesOf = {}, .homeGeneration = seen.generation};
    TRY(reader.forEach([&](Record record) {
        record->setTransient(key.transient);
        const std::size_t infoBytes = infoBytesOf(*record);
        store(cache, std::move(record), infoBytes);
    }));
    if (cache.records.size() >= recordsWithHoles)
        giveHolesBack();
    cache.hidesSome = reader.metHidden();
    // A daemon that was killed may have left containers here that are not on the disk yet; who finds one here is told
    // that it exists.
    const auto opened = fileManager_.resolver().openDirectory(*directory);
    const Errno synced = opened ? durability_.afterMove(opened->get()) : opened.error();
    if (synced)
        return posixError(ZOR_HERE, synced, "sync of %s failed: %s", directory->c_str(), synced.text());
    return cache;
}

bool ZORContainerCache::lookOver(const Key& key, const Found& gone) {
    const auto directory = configuration_.containerDirectoryURLForUser(key.userId, key.containerClass, key.transient);
    const MutexLock held(cacheLock_);
    const auto stillLies = [&](const ClassCache& cache) {
        const auto known = cache.records.find(std::string_view(gone.record->identifier()));
        return known != cache.records.end() && (*known)->place().name() == gone.place.name();
    };
    const auto before = caches_.find(key);
    if (before == caches_.end() || beingRead_.contains(key) || !stillLies(before->second))
        return true; // somebody has been here meanwhile, or is
    using Clock = std::chrono::steady_clock;
    const auto begin = Clock::now();
    if (begin < nextLookOver_[key] || !directory)
        return false;
    const std::uint64_t serial = before->second.serial;
    std::set<std::string> names;
    ClassCache there;
    const auto read = readUnlocked(key, [&] {
        return ClassDirectoryReader(log_, fileManager_, *directory, key.userId).forEach([&](Record record) {
            names.insert(record->place().name());
            record->setTransient(key.transient);
            const std::size_t infoBytes = infoBytesOf(*record);
            store(there, std::move(record), infoBytes);
        });
    });
    const auto end = Clock::now();
    nextLookOver_[key] = end + std::max<Clock::duration>(lookOverPauseMin, (end - begin) * lookOverShare);
    if (!read)
        return false;
    const auto now = caches_.find(key);
    if (now == caches_.end())
        return true;
    // Only of what has gone from its place: others may be in the hands of an operation. When there has been one, the
    // place of the one that was looked for is all that is known to be the same.
    const bool unchanged = now->second.serial == serial;
    for (const Record& found : there.records) {
        const auto cached = now->second.records.find(found);
        if (cached == now->second.records.end() || names.contains((*cached)->place().name()))
            continue;
        if (!unchanged && ((*cached)->identifier() != gone.record->identifier() || !stillLies(now->second)))
            continue;
        log_.write(logLevelNotice, __func__, "Cache: %s%s: Identifier: %s was moved from %s to %s",
                   className(key.containerClass), suffix(key.transient), ZOR_SHOWN(found->identifier()),
                   (*cached)->url().c_str(), found->url().c_str());
        store(now->second, found, infoBytesOf(*found));
    }
    noteChange(now->second);
    return true;
}

ZORContainerCache::Held ZORContainerCache::heldByUser(std::uint32_t userId) {
    std::uint64_t drops = 0;
    bool isWhole = false;
    {
        const MutexLock held(cacheLock_);
        isWhole = wholeUsers_.contains(userId);
        drops = drops_;
    }
    const bool isBuilt = !isWhole && buildAllOfUser(userId);
    const MutexLock held(cacheLock_);
    if (isBuilt && drops == drops_)
        wholeUsers_.insert(userId);
    Held all;
    for (auto cache = caches_.lower_bound(Key{userId, ContainerClass::undefined, false});
         cache != caches_.end() && cache->first.userId == userId; ++cache) {
        all.containers += cache->second.records.size();
        all.infoBytes += cache->second.infoBytes;
    }
    return all;
}

bool ZORContainerCache::buildAllOfUser(std::uint32_t userId) {
    bool shortage = false;
    for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number)
        for (const bool transient : {false, true}) {
            const Key key{userId, static_cast<ContainerClass>(number), transient};
            if (!configuration_.users().mayOwn(key.containerClass, userId))
                continue;
            // A class that cannot be read holds nothing in memory either.
            const Errno failure = lookForDirectory(key);
            if (!failure) {
                const MutexLock held(cacheLock_);
                (void)_getCacheForUserId(key);
            }
            shortage = shortage || isOwnShortage(failure);
        }
    UserHome* const home = configuration_.homeOf(userId);
    return !shortage && (!home || home->lookIfDue().state != UserHome::State::missing);
}

} // namespace zor
