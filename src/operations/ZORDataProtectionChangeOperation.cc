// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORDataProtectionChangeOperation.h"

#include "base/Mutex.h"
#include "platform/Errno.h"

#include <atomic>
#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <thread>
#include <unistd.h>

namespace zor {

using fs::WalkEntry;
using fs::WalkEntryKind;
using fs::WalkStep;

namespace {

constexpr const char* performFunction = "performChangeOperation";
constexpr const char* passFunction = "_runChangeOperationNeedToRetry";

/// Never given, and never taken away either.
constexpr int untouchableClass = 2;
/// Files get this in place of class 0, which only directories can have.
constexpr int classOfFilesForNone = 3;
/// A retry that finds the device locked came before the queue was suspended: it need not come again at once.
constexpr std::chrono::milliseconds retryInterval{20};

unsigned long long number(ContainerClass containerClass) {
    return static_cast<unsigned long long>(containerClass);
}

/// Absent when it cannot be told.
std::optional<DirectoryIdentity> identityOf(int directory) {
    struct statx status{};
    if (::statx(directory, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_INO | STATX_BTIME, &status) != 0)
        return std::nullopt;
    return DirectoryIdentity{.device = makedev(status.stx_dev_major, status.stx_dev_minor),
                             .inode = status.stx_ino,
                             .birthSeconds = status.stx_btime.tv_sec,
                             .birthNanoseconds = status.stx_btime.tv_nsec};
}

/// The first failure of a walk, on whichever thread. Any thread.
class FirstFailure {
public:
    void note(Result<void> done) {
        if (done)
            return;
        const platform::MutexLock held(mutex_);
        if (!error_)
            error_ = std::move(done).error();
        is_ = true;
    }
    [[nodiscard]] bool is() const { return is_; }
    Result<void> take() {
        const platform::MutexLock held(mutex_);
        return error_ ? Result<void>(std::move(*error_)) : Result<void>();
    }

private:
    std::atomic<bool> is_{false};
    platform::Mutex mutex_;
    std::optional<ZORError> error_ ZOR_GUARDED_BY(mutex_);
};

} // namespace

void ZORDataProtectionChangeOperation::performChangeOperation() {
    conclude(needs_.boundary.run({performFunction, __LINE__}, [&] { return attempt(); }));
}

void ZORDataProtectionChangeOperation::retry() {
    const LogRequestScope asked(request_);
    conclude(needs_.boundary.run({performFunction, __LINE__}, [&] {
        startRetry();
        return attempt();
    }));
}

void ZORDataProtectionChangeOperation::startRetry() {
    if (!retried_ && retryStartBlock_)
        retryStartBlock_();
    if (std::exchange(retried_, true))
        std::this_thread::sleep_for(retryInterval);
}

Result<ZORDataProtectionChangeOperation::NeedRetry> ZORDataProtectionChangeOperation::attempt() {
    const platform::BlockingScope blocking(
        platform::Load::heavy); // a large tree must not take one of the few threads from all clients
    const NeedRetry needRetry = TRY(_runChangeOperationNeedToRetry());
    if (needRetry == NeedRetry::yes && retryIfLocked_ == RetryIfLocked::yes)
        queueRetry();
    return needRetry;
}

void ZORDataProtectionChangeOperation::conclude(const Result<NeedRetry>& attempted) {
    const Reporter report(needs_.log, performFunction);
    const ZORMetadata& container = *dataContainerMetadata_;
    const bool locked = attempted && *attempted == NeedRetry::yes;
    if (locked && retryIfLocked_ == RetryIfLocked::yes)
        return; // another thread may be at the retry by now
    std::optional<ZORError> error;
    if (!attempted) {
        error = attempted.error();
        report.write(logLevelNotice,
                     "Operation to update protection classes for user: %u, id: %s, containerClass: %llu to "
                     "class %d failed with error %s",
                     container.uid(), ZOR_SHOWN(container.identifier()), number(container.containerClass()),
                     newDataProtectionClass_, error->text().c_str());
    }
    if (locked)
        error = report.error(ErrorCode::lockedAndNotRetried,
                             "Tried to update user: %u, id: %s, containerClass: %llu to protection class %d, but was "
                             "locked and didn't retry",
                             container.uid(), ZOR_SHOWN(container.identifier()), number(container.containerClass()),
                             newDataProtectionClass_);
    if (completionBlock_)
        completionBlock_(locked, error);
}

void ZORDataProtectionChangeOperation::queueRetry() {
    const ZORMetadata& container = *dataContainerMetadata_;
    needs_.log.write(
        logLevelNotice, performFunction,
        "Retrying container protection update to %d on next unlock for user: %u, id: %s, containerClass: %llu",
        newDataProtectionClass_, container.uid(), ZOR_SHOWN(container.identifier()),
        number(container.containerClass()));
    if (!request_)
        request_ = LogSubject::keptRequest();
    ZORDispatchAsyncWithTransaction(needs_.retries, [self = shared_from_this()] { self->retry(); });
}

Result<ZORDataProtectionChangeOperation::NeedRetry> ZORDataProtectionChangeOperation::_runChangeOperationNeedToRetry() {
    std::vector<Item> items;
    platform::FileDescriptor container;
    {
        const IdentifierLock lock(needs_.locks, dataContainerMetadata_->uuid().string(), LockMode::reading);
        TRY(checkStillThere(lock));
        items = existingItems();
        container = TRY(openContainer(items));
    }
    const auto walked = walk(container.get(), items);
    if (!walked && walked.error().isPosix(EPERM))
        return NeedRetry::yes;
    TRY(walked);
    // Nothing may come between the look and the record: else what is recorded could be of a container that has gone.
    const IdentifierWriteLock lock(needs_.locks, dataContainerMetadata_->uuid().string(), Touches::nothing());
    TRY(checkStillThere(lock));
    const auto now = needs_.fileManager.resolver().openDirectoryPath(dataContainerMetadata_->url());
    const auto identity = now ? identityOf(now->get()) : std::nullopt;
    if (!identity || identity != identityOf(container.get()))
        return changedMeanwhile();
    if (recordBlock_)
        recordBlock_(lock);
    return NeedRetry::no;
}

ZORError ZORDataProtectionChangeOperation::changedMeanwhile() {
    return Reporter(needs_.log, passFunction)
        .error(ErrorCode::pathNotAsExpected,
               "Cancelling data protection operation because container path changed on disk. This indicates "
               "the app may have been updated and changed its protection level.");
}

Result<void> ZORDataProtectionChangeOperation::checkStillThere(const IdentifierLock& held) {
    ZOR_ASSERT(held.identifier() == dataContainerMetadata_->uuid().string());
    const ZORMetadata& container = *dataContainerMetadata_;
    // A record that the identifier leads to may be in another's hands: it is looked for, and not looked at.
    const auto found =
        needs_.cache.containerForUser(container.uid(), container.containerClass(), &container.identifier(), false);
    if (!found)
        return Reporter(needs_.log, passFunction)
            .error(ErrorCode::notFound, &found.error(),
                   "Failed to lookup container to set data protection for userId: %u, identifier: %s, Class: "
                   "%llu",
                   container.uid(), ZOR_SHOWN(container.identifier()), number(container.containerClass()));
    const auto same = needs_.cache.containerForUser(container.uid(), container.containerClass(),
                                                    &container.identifier(), container.uuid().string());
    if (!same || !*same || (*same)->transient() || (*same)->url() != container.url())
        return changedMeanwhile();
    return {};
}

std::vector<ZORDataProtectionChangeOperation::Item> ZORDataProtectionChangeOperation::existingItems() {
    std::vector<Item> items;
    for (const std::string_view name : ZORGlobalConfiguration::appUserDataItemNames()) {
        const FileURL url = dataContainerMetadata_->url().appendingDirectory(name);
        if (needs_.fileManager.itemExistsAtURL(url))
            items.push_back({.name = std::string(name), .path = url.path()});
    }
    return items;
}

std::string ZORDataProtectionChangeOperation::shown(const std::vector<Item>& items) {
    plist::Array paths;
    for (const Item& item : items)
        paths.emplace_back(item.path);
    const plist::Value list(std::move(paths));
    return plist::describe(&list);
}

Result<platform::FileDescriptor> ZORDataProtectionChangeOperation::openContainer(const std::vector<Item>& items) {
    auto opened = needs_.fileManager.resolver().openDirectory(dataContainerMetadata_->url());
    struct stat status{};
    if (!opened || ::fstat(opened->get(), &status) != 0) {
        const Errno error = platform::neverLocked(opened ? Errno::last() : opened.error());
        return posixError({passFunction, __LINE__}, error, "fts_open failed for %s : %s", shown(items).c_str(),
                          error.text());
    }
    // While the change waited, another one may have come to the same place.
    const auto identity = identityOf(opened->get());
    if (!firstMet_)
        firstMet_ = identity;
    if (identity != firstMet_)
        return changedMeanwhile();
    owner_ = status.st_uid;
    return std::move(*opened);
}

Result<void> ZORDataProtectionChangeOperation::walk(int container, const std::vector<Item>& items) {
    {
        const platform::MutexLock held(sharedMutex_);
        namesMet_.forgetAll();
        foreignFiles_ = 0;
    }
    FirstFailure failure;
    OpenItems files([&](const OpenItem& file) {
        if (!failure.is())
            failure.note(changeFile(file));
    });
    // A directory hands its class on to what is made in it, and comes after the files that lie in it. It waits for
    // them with some others, so that few waits are made for the second thread.
    std::vector<OpenItem> ended;
    const auto changeEnded = [&] {
        files.settle();
        for (const OpenItem& directory : ended)
            if (!failure.is())
                failure.note(changeDirectory(directory));
        ended.clear();
    };
    for (const Item& item : items) {
        fs::TreeWalker walker(fs::WalkStatus::typeOnly);
        const Errno status = walker.walk(container, item.name.c_str(), [&](const WalkEntry& entry) {
            failure.note(visit(entry, item, files, ended));
            if (ended.size() == OpenItems::batchCount)
                changeEnded();
            return failure.is() ? WalkStep::stop : WalkStep::proceed;
        });
        if (failure.is())
            break;
        if (status)
            needs_.log.write(logLevelError, passFunction, "FTS returned error for %s : %s", item.path.c_str(),
                             status.text());
    }
    changeEnded();
    files.finish();
    TRY(failure.take());
    saySharedFiles();
    return {};
}

void ZORDataProtectionChangeOperation::saySharedFiles() {
    const platform::MutexLock held(sharedMutex_);
    const std::uint64_t left = namesMet_.unfinished() + foreignFiles_;
    if (left > 0)
        needs_.log.write(logLevelNotice, passFunction,
                         "Left the protection class of %llu files in %s as it is: they have names outside, or "
                         "another owner",
                         static_cast<unsigned long long>(left), dataContainerMetadata_->url().c_str());
}

Result<void> ZORDataProtectionChangeOperation::visit(const WalkEntry& entry, const Item& item, OpenItems& files,
                                                     std::vector<OpenItem>& ended) {
    if (entry.onOtherFileSystem)
        return {};
    const auto path = [&] { return entry.depth == 0 ? item.path : item.path + '/' + entry.path(); };
    switch (entry.kind) {
    case WalkEntryKind::directory:
    case WalkEntryKind::symbolicLink:
    case WalkEntryKind::other:
        return {};
    case WalkEntryKind::directoryEnd: {
        if ((operationType_ & protectionChange::directories) == 0)
            return {};
        platform::FileDescriptor directory(::fcntl(entry.directory, F_DUPFD_CLOEXEC, 0));
        if (!directory.valid()) {
            const Errno error = Errno::last();
            return posixError({passFunction, __LINE__}, error, "Failed to open %s : %s", ZOR_SHOWN(path()),
                              error.text());
        }
        ended.push_back({.descriptor = std::move(directory), .path = path()});
        return {};
    }
    case WalkEntryKind::file: {
        if ((operationType_ & protectionChange::files) == 0)
            return {};
        std::string name = path();
        if (auto opened = TRY(needs_.fileManager.openForDataProtection(entry, name)))
            files.add({.descriptor = std::move(*opened), .path = std::move(name)});
        return {};
    }
    case WalkEntryKind::unreadableDirectory:
    case WalkEntryKind::noStatus:
        break;
    }
    needs_.log.write(logLevelError, passFunction, "FTS returned error for %s : %s", ZOR_SHOWN(path()),
                     entry.error.text());
    return {};
}

Result<void> ZORDataProtectionChangeOperation::changeDirectory(const OpenItem& directory) {
    return setClass(directory, S_IFDIR, newDataProtectionClass_,
                    [](const struct stat&, int current) { return current == untouchableClass; });
}

Result<void> ZORDataProtectionChangeOperation::changeFile(const OpenItem& file) {
    const std::int32_t target = newDataProtectionClass_ == 0 ? classOfFilesForNone : newDataProtectionClass_;
    const bool keepLower = (operationType_ & protectionChange::keepLower) != 0;
    return setClass(file, S_IFREG, target, [this, target, keepLower](const struct stat& status, int current) {
        if (isShared(status))
            return true;
        return current == target || current == untouchableClass || (keepLower && target > current);
    });
}

Result<void> ZORDataProtectionChangeOperation::setClass(
    const OpenItem& item, mode_t kind, std::int32_t target,
    const std::function<bool(const struct stat& status, int current)>& declines) {
    const Reporter report(needs_.log, passFunction);
    mode_t mode = 0;
    auto done = needs_.fileManager.setDataProtectionClassOfOpenItem(
        item.descriptor.get(), kind, item.path, target, [&](const struct stat& status, int current) {
            mode = status.st_mode;
            if (declines(status, current))
                return false;
            if (needs_.log.writes(logLevelDebug))
                report.write(logLevelDebug, "Setting protection class of %s to %d", ZOR_SHOWN(item.path), target);
            return true;
        });
    if (done || !done.error().isPosix(EBADF))
        return done;
    report.write(logLevelError, "Ignoring failure to set protection class to %d on %s (mode 0%o): %s", target,
                 ZOR_SHOWN(item.path), mode, done.error().text().c_str());
    return {};
}

bool ZORDataProtectionChangeOperation::isShared(const struct stat& status) {
    if (status.st_uid == owner_ && status.st_nlink <= 1)
        return false;
    const platform::MutexLock held(sharedMutex_);
    // The container's owner can rename during the walk, so that one name is met twice; by that he reaches what is his
    // own anyway, and nothing else.
    if (status.st_uid == owner_)
        return !namesMet_.wasLast(status);
    // The container's owner can move another's file in. A file that root put there with one name is the container's.
    if (status.st_nlink <= 1 && (status.st_uid == 0 || status.st_uid == ::geteuid()))
        return false;
    ++foreignFiles_;
    return true;
}

} // namespace zor
