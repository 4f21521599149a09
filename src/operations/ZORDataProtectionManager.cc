// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORDataProtectionManager.h"

#include "ipc/Keys.h"
#include "operations/ZORApplicationTerminationAssertion.h"

namespace zor {

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
    if (!request.identifier || !isPerUserClass(request.containerClass))
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't act on an invalid object: userId: %u, ID: %s, class: %ld", request.userId,
                         ZOR_SHOWN(request.identifier), static_cast<long>(request.containerClass));
    needs_.cache.prepare(request.userId, request.containerClass, false);
    // Records are shared: what this change goes by is copied while nobody can change it.
    const AllIdentifiersLock lock(needs_.locks, LockMode::reading);
    const auto record =
        needs_.cache.containerForUser(request.userId, request.containerClass, &*request.identifier, false);
    if (!record)
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::notFound, &record.error(), LogFlag::yes,
                         "No Container with userId: %u, identifier: %s, Class: %ld", request.userId,
                         ZOR_SHOWN(request.identifier), static_cast<long>(request.containerClass));
    const ZORMetadata& found = **record;
    return std::make_shared<const ZORMetadata>(found.uid(), found.uuid(), found.containerClass(), found.identifier(),
                                               found.info(), found.place());
}

Result<void> ZORDataProtectionManager::checkClass(const Request& request) {
    const int requested = request.dataProtectionClass;
    if (requested == classNeverAllowed)
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
                         "Data protection class %d is not allowed", requested);
    if (request.isSecondOrThirdPartyApp && (requested < 0 || requested > classMaxOfOthers))
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
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
    return makeError(needs_.log, {function, __LINE__}, ErrorCode::lockedAndNotRetried, nullptr, LogFlag::yes,
                     "%llu changes of protection wait already, and no more may; ask again after an unlock",
                     static_cast<unsigned long long>(changes));
}

void ZORDataProtectionManager::finish(Change& change, bool wasLocked, const std::optional<ZORError>& error) {
    if (error)
        needs_.log.write(logLevelError, function,
                         "Failed to set data protection on container with identifier %s at %s to %d: %s",
                         ZOR_SHOWN(change.container->identifier()), change.container->url().c_str(),
                         change.request.dataProtectionClass, error->text().c_str());
    if (wasLocked && change.request.retryIfLocked)
        needs_.log.write(logLevelError, function, "Unexpectedly got completion block called with wasLocked");
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
