// SPDX-License-Identifier: Apache-2.0
// The client of one message: who it is, what it may ask for, and the names under which it asks.
//
// Each message has one object; the daemon's own lives as long as the daemon. It does nothing itself: each name is that
// of an operation, whose header says its meaning, errors and locks. Operations may be called from any thread; rights
// are changed by the thread that serves the message.
#pragma once

#include "daemon/Operations.h"
#include "operations/Basics.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor {

/// Every operation takes its locks. A caller that holds one already calls the operation itself, and shows the lock.
enum class UseLocking : std::int32_t { yes = 1 };

class ZORClientConnection {
public:
    using Client = Caller;
    using ContainerAddress = zor::ContainerAddress;
    using ContainerMetadata = zor::ContainerMetadata;
    using CreateOrLookupOptions = zor::CreateOrLookupOptions;
    using DeletionBatch = zor::DeletionBatch;
    using DiskUsageAnswer = zor::DiskUsageAnswer;
    using ListedContainer = zor::ListedContainer;
    using ListedPage = zor::ListedPage;
    using PreserveOldUUID = zor::PreserveOldUUID;
    using ReplaceRequest = zor::ReplaceRequest;

    ZORClientConnection(Operations& operations, Client client) : operations_(operations), caller_(std::move(client)) {}
    ZORClientConnection(const ZORClientConnection&) = delete;
    ZORClientConnection& operator=(const ZORClientConnection&) = delete;

    [[nodiscard]] const Caller& caller() const { return caller_; }
    [[nodiscard]] const std::optional<std::string>& clientBundleIdentifier() const { return caller_.bundleIdentifier; }
    [[nodiscard]] std::uint32_t clientUserId() const { return caller_.userId; }
    [[nodiscard]] bool onlyOwnIdentifier() const { return caller_.onlyOwnIdentifier; }
    [[nodiscard]] bool ownsRoot() const { return caller_.ownsRoot(); }
    // The lookups beyond its own that the client may make; handlers widen or narrow them.
    [[nodiscard]] bool allowOtherIdLookup() const { return caller_.allowOtherIdLookup; }
    void setAllowOtherIdLookup(bool allow) { caller_.allowOtherIdLookup = allow; }
    [[nodiscard]] bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }

    Result<FoundContainer> createOrLookupContainerForUser(std::uint32_t userId, const std::string* identifier,
                                                          ContainerClass containerClass,
                                                          const CreateOrLookupOptions& options) {
        return operations_.creation.createOrLookupContainerForUser(caller_, userId, identifier, containerClass,
                                                                   options);
    }
    Result<std::vector<ListedContainer>> containersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                           bool transient) {
        return operations_.listing.containersForUser(userId, containerClass, transient);
    }
    Result<ListedPage> containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient,
                                         const std::string& after) {
        return operations_.listing.containersForUser(userId, containerClass, transient, after);
    }
    Result<void> stageForDeleteContainersWithUsers(const DeletionBatch& batch, UseLocking) {
        return operations_.deletion.stageForDeleteContainersWithUsers(batch);
    }
    Result<void> deleteContainerForUser(std::uint32_t userId, const std::string* identifier,
                                        ContainerClass containerClass, bool transient) {
        return operations_.deletion.deleteContainerForUser(caller_, userId, identifier, containerClass, transient);
    }
    Result<void> replaceContainer(const ReplaceRequest& request, StartDeletionThread startDeletionThread) {
        return operations_.replace.replaceContainer(request, startDeletionThread);
    }
    Result<void> deleteDataContainerContentForUser(std::uint32_t userId, const std::string* identifier,
                                                   ContainerClass containerClass) {
        return operations_.wipe.deleteDataContainerContentForUser(caller_, userId, identifier, containerClass);
    }
    Result<void> setInfoValue(const plist::Value* value, const std::string* key, const ContainerAddress& address,
                              UseLocking) {
        return operations_.infoValues.setInfoValue(caller_, value, key, address);
    }
    Result<plist::Value> infoValueForKey(const std::string* key, const ContainerAddress& address, UseLocking) {
        return operations_.infoValues.infoValueForKey(key, address);
    }
    Result<ContainerMetadata> metadataForUser(const ContainerAddress& address) {
        return operations_.infoValues.metadataForUser(address);
    }
    Result<void> recreateDefaultStructureForUser(const ContainerAddress& address) {
        return operations_.structure.recreateDefaultStructureForUser(address);
    }
    Result<void> regenerateDirectoryUUIDForUser(const ContainerAddress& address) {
        return operations_.structure.regenerateDirectoryUUIDForUser(address);
    }
    DiskUsageAnswer diskUsageForUserId(const ContainerAddress& address) {
        return operations_.diskUsage.diskUsageForUserId(caller_, address);
    }
    Result<void> retryTestForUser(std::uint32_t userId, std::uint64_t numCrashes) {
        return operations_.retryTest.retryTestForUser(caller_, userId, numCrashes);
    }

    // The daemon's own.
    void rebootContainerManagerSetup() { operations_.settingUp.rebootContainerManagerSetup(); }
    void containerManagerSetup() { operations_.settingUp.containerManagerSetup(); }
    std::uint64_t _cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass) {
        return operations_.orphans._cleanupOrphanedDataForUser(userId, containerClass);
    }
    Result<void> _recoverFromReplaceOperationsWithError() {
        return operations_.recovery._recoverFromReplaceOperationsWithError();
    }
    Result<void> _moveItemAtURLToDeathRow(const FileURL& url, StartDeletionThread startDeletionThread) {
        return operations_.deathRow._moveItemAtURLToDeathRow(url, startDeletionThread);
    }
    void deleteContainersOnDeathRowWithCompletion(std::function<void(ErrorCode)> completion) {
        operations_.deathRow.deleteContainersOnDeathRowWithCompletion(std::move(completion));
    }
    Result<void> _removeItemOrMoveToTempAtURL(const FileURL& url) {
        return operations_.deathRow._removeItemOrMoveToTempAtURL(url);
    }
    bool _setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                            ContainerClass containerClass, const std::optional<FileURL>& url) {
        return operations_.mappings._setSandboxContainerMappingForUser(userId, identifier, containerClass, url);
    }

private:
    Operations& operations_;
    Caller caller_;
    bool allowGroupIdLookup_ = false;
};

} // namespace zor
