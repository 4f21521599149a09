// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORDataProtectionManager.h"

#include "base/ZORError.h"
#include "ipc/Protocol.h"

#include <cerrno>
#include <cstdlib>
#include <semaphore.h>

namespace zor {

namespace {

constexpr const char* initFunction = "initWithBundleIdentifier";

platform::TerminationReason reasonOf(const Log& log, std::uint8_t code) {
    using platform::TerminationReason;
    switch (code) {
    case static_cast<std::uint8_t>(TerminationReason::installation):
    case static_cast<std::uint8_t>(TerminationReason::cacheDeletion):
    case static_cast<std::uint8_t>(TerminationReason::critical):
        return static_cast<TerminationReason>(code);
    default:
        log.write(logLevelError, initFunction, "Unknown reason: %d", code);
        std::abort();
    }
}

/// The semaphore with which the service's answer is waited for. The answer may come after the wait was given up, so
/// both sides share it.
class Acquisition {
public:
    Acquisition() : usable_(::sem_init(&semaphore_, 0, 0) == 0) {}
    ~Acquisition() {
        if (usable_)
            ::sem_destroy(&semaphore_);
    }
    Acquisition(const Acquisition&) = delete;
    Acquisition& operator=(const Acquisition&) = delete;

    [[nodiscard]] bool usable() const { return usable_; }
    void answer(bool acquired) {
        acquired_ = acquired;
        ::sem_post(&semaphore_);
    }
    /// Whether it was granted.
    [[nodiscard]] bool wait() {
        while (::sem_wait(&semaphore_) != 0 && errno == EINTR)
            continue;
        return acquired_;
    }

private:
    sem_t semaphore_{};
    const bool usable_;
    bool acquired_ = true;
};

} // namespace

std::unique_ptr<ZORApplicationTerminationAssertion>
ZORApplicationTerminationAssertion::initWithBundleIdentifier(const Log& log,
                                                             platform::TerminationAssertionService& service,
                                                             const std::string& bundleIdentifier, std::uint8_t reason) {
    const Reporter report(log, initFunction);
    const auto acquisition = std::make_shared<Acquisition>();
    if (!acquisition->usable()) {
        report.write(logLevelError, "Failed to create completion semaphore: %s", Errno::last().text());
        return nullptr;
    }
    Handle handle =
        service.acquire(bundleIdentifier, reasonOf(log, reason),
                        [report, acquisition, bundleIdentifier](const std::optional<std::string>& error) {
                            if (error)
                                report.write(logLevelError, "Failed to acquire termination assertion for %s : %s",
                                             ZOR_SHOWN(bundleIdentifier), error->c_str());
                            acquisition->answer(!error);
                        });
    if (!handle) {
        report.write(logLevelError, "No termination assertion could be obtained for %s", ZOR_SHOWN(bundleIdentifier));
        return nullptr;
    }
    if (!acquisition->wait())
        return nullptr;
    return std::unique_ptr<ZORApplicationTerminationAssertion>(
        new ZORApplicationTerminationAssertion(std::move(handle)));
}

ZORApplicationTerminationAssertion::~ZORApplicationTerminationAssertion() {
    if (termAssertion_)
        std::abort(); // nil == _termAssertion
}

using platform::MutexLock;
using Operation = ZORDataProtectionChangeOperation;

namespace {

constexpr const char* function = "setDataProtectionOnDataContainerForUser";

/// The one class that nobody may ask for.
constexpr int classNeverAllowed = 2;
/// The last of those that applications of others may ask for.
constexpr int classMaxOfOthers = 3;

/// Files are changed where the new class is stricter; else directories alone are.
std::int32_t changeType(int current, int requested) {
    const bool stricter = current > requested || (current == 0 && requested <= 2);
    return stricter ? protectionChange::directories | protectionChange::files | protectionChange::keepLower
                    : protectionChange::directories;
}

} // namespace

/// The state that the blocks of one change share.
struct ZORDataProtectionManager::Change {
    Change(ZORDataProtectionManager& itsManager, Request itsRequest, std::shared_ptr<const ZORMetadata> itsContainer,
           Completion itsCompletion)
        : manager(itsManager), request(std::move(itsRequest)), container(std::move(itsContainer)),
          completion(std::move(itsCompletion)) {
        const MutexLock lock(manager.mutex_);
        pending = manager.pending_.insert(manager.pending_.end(), {.uuid = container->uuid(),
                                                                   .userId = request.userId,
                                                                   .identifier = container->identifier(),
                                                                   .containerClass = request.containerClass,
                                                                   .dataProtectionClass = request.dataProtectionClass});
    }
    Change(const Change&) = delete;
    Change& operator=(const Change&) = delete;
    /// The end of a daemon that does not wait for the unlock is an end of the change too.
    ~Change() { end(); }
    void end() {
        dropAssertion();
        const MutexLock lock(manager.mutex_);
        if (pending)
            manager.pending_.erase(*pending);
        pending.reset();
    }
    void dropAssertion() {
        if (assertion)
            assertion->invalidate();
        assertion.reset();
    }

    ZORDataProtectionManager& manager;
    const Request request;
    const std::shared_ptr<const ZORMetadata> container;
    const Completion completion;
    std::unique_ptr<ZORApplicationTerminationAssertion> assertion;
    std::optional<std::list<Pending>::iterator> pending;
};

void ZORDataProtectionManager::setDataProtectionOnDataContainerForUser(const Request& request,
                                                                       const Completion& completion) {
    auto prepared =
        needs_.boundary.run({function, __LINE__}, [&]() -> Result<std::shared_ptr<ZORDataProtectionChangeOperation>> {
            return prepare(request, completion);
        });
    if (!prepared)
        completion(prepared.error().replyCode());
    else if (!*prepared)
        completion(ErrorCode::success);
    else
        (*prepared)->performChangeOperation();
}

std::vector<ZORDataProtectionManager::Pending> ZORDataProtectionManager::pending() {
    const MutexLock lock(mutex_);
    return {pending_.begin(), pending_.end()};
}

Result<std::shared_ptr<ZORDataProtectionChangeOperation>>
ZORDataProtectionManager::prepare(const Request& request, const Completion& completion) {
    const auto container = TRY(containerOf(request));
    const int current = container->recordedProtectionClass().value_or(platform::defaultProtectionClass);
    if (current == request.dataProtectionClass)
        return std::shared_ptr<Operation>();
    TRY(checkClass(request));
    TRY(checkBound(request));
    auto operation = std::make_shared<Operation>(needs_.change, container, request.dataProtectionClass,
                                                 request.retryIfLocked ? Operation::RetryIfLocked::yes
                                                                       : Operation::RetryIfLocked::no,
                                                 changeType(current, request.dataProtectionClass));
    const auto change = std::make_shared<Change>(*this, request, container, completion);
    operation->setRetryStartBlock([this, change] {
        change->dropAssertion();
        change->assertion = ZORApplicationTerminationAssertion::initWithBundleIdentifier(
            needs_.log, needs_.assertions, change->container->identifier(),
            static_cast<std::uint8_t>(platform::TerminationReason::installation));
    });
    operation->setRecordBlock([this, change](const IdentifierWriteLock& held) { record(*change, held); });
    operation->setCompletionBlock(
        [this, change](bool wasLocked, const std::optional<ZORError>& error) { finish(*change, wasLocked, error); });
    return operation;
}

Result<std::shared_ptr<const ZORMetadata>> ZORDataProtectionManager::containerOf(const Request& request) {
    const Reporter report(needs_.log, function);
    if (!request.identifier || !isPerUserClass(request.containerClass))
        return report.error(ErrorCode::invalidObject, "Can't act on an invalid object: userId: %u, ID: %s, class: %ld",
                            request.userId, ZOR_SHOWN(request.identifier), static_cast<long>(request.containerClass));
    return needs_.replaces.undisturbed([&] { return copyOfRecord(request); });
}

Result<std::shared_ptr<const ZORMetadata>> ZORDataProtectionManager::copyOfRecord(const Request& request) {
    needs_.cache.prepare(request.userId, request.containerClass, false);
    // Records are shared: what this change goes by is copied while nobody can change it.
    const AllIdentifiersLock lock(needs_.locks, LockMode::reading);
    TRY(needs_.replaces.refuseIfUnderWay(request.userId, request.containerClass, *request.identifier));
    const auto record =
        needs_.cache.containerForUser(request.userId, request.containerClass, &*request.identifier, false);
    if (!record)
        return Reporter(needs_.log, function)
            .error(ErrorCode::notFound, &record.error(), "No Container with userId: %u, identifier: %s, Class: %ld",
                   request.userId, ZOR_SHOWN(request.identifier), static_cast<long>(request.containerClass));
    const ZORMetadata& found = **record;
    return std::make_shared<const ZORMetadata>(found.uid(), found.uuid(), found.containerClass(), found.identifier(),
                                               found.info(), found.place());
}

Result<void> ZORDataProtectionManager::checkClass(const Request& request) {
    const Reporter report(needs_.log, function);
    const int requested = request.dataProtectionClass;
    if (requested == classNeverAllowed)
        return report.error(ErrorCode::valueNotAllowed, "Data protection class %d is not allowed", requested);
    if (request.isSecondOrThirdPartyApp && (requested < 0 || requested > classMaxOfOthers))
        return report.error(ErrorCode::valueNotAllowed,
                            "Data protection class %d is invalid for 2nd and 3rd party apps", requested);
    return {};
}

Result<void> ZORDataProtectionManager::checkBound(const Request& request) {
    const auto changes = [&] {
        const MutexLock lock(mutex_);
        return pending_.size();
    }();
    if (request.byOwner || changes < needs_.limits.protectionChangesMax)
        return {};
    return Reporter(needs_.log, function)
        .error(ErrorCode::lockedAndNotRetried,
               "%llu changes of protection wait already, and no more may; ask again after an unlock",
               static_cast<unsigned long long>(changes));
}

void ZORDataProtectionManager::finish(Change& change, bool wasLocked, const std::optional<ZORError>& error) {
    const Reporter report(needs_.log, function);
    if (error)
        report.write(logLevelError, "Failed to set data protection on container with identifier %s at %s to %d: %s",
                     ZOR_SHOWN(change.container->identifier()), change.container->url().c_str(),
                     change.request.dataProtectionClass, error->text().c_str());
    if (wasLocked && change.request.retryIfLocked)
        report.write(logLevelError, "Unexpectedly got completion block called with wasLocked");
    change.dropAssertion();
    change.end();
    change.completion(error ? error->replyCode() : ErrorCode::success);
}

void ZORDataProtectionManager::record(const Change& change, const IdentifierWriteLock& held) {
    const ZORMetadata& container = *change.container;
    const plist::Value value(change.request.dataProtectionClass);
    const std::string key(ipc::infoKeys::contentProtectionClass);
    const auto recorded = needs_.infoValues.setInfoValue(Caller::daemonItself(), &value, &key,
                                                         {.userId = change.request.userId,
                                                          .uuid = container.uuid(),
                                                          .identifier = container.identifier(),
                                                          .containerClass = container.containerClass()},
                                                         held);
    if (!recorded)
        needs_.log.write(logLevelError, function, "Failed to set protection class info for %s at %s to %d : %llu",
                         ZOR_SHOWN(container.identifier()), container.url().c_str(), change.request.dataProtectionClass,
                         static_cast<unsigned long long>(recorded.error().replyCode()));
}

} // namespace zor
