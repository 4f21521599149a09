// SPDX-License-Identifier: Apache-2.0
#include "operations/Structure.h"

#include "store/StorePlaces.h"

#include <map>
#include <optional>
#include <string_view>

namespace zor {

namespace {
constexpr const char* regenerateFunction = "regenerateDirectoryUUIDForUser";
}

using platform::FileDescriptor;

Result<void> Structure::recreateDefaultStructureForUser(const ContainerAddress& address) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        constexpr const char* function = "recreateDefaultStructureForUser";
        TRY(checkAddress(needs_.log, function, address));
        std::vector<FileURL> changed;
        auto structure = needs_.replaces.undisturbed([&]() -> Result<void> {
            const IdentifierWriteLock lock(needs_.locks, address.lockName(), Touches::nothing());
            const auto record = TRY(knownContainer(needs_, function, address, lock));
            changed = {record->url()};
            TRY(makeSubdirectories(layoutOf(address.containerClass, address.userId),
                                   record->recordedProtectionClass().value_or(protectionClassUnchanged), changed));
            return {};
        });
        if (!structure)
            return structure;
        if (const auto failed = needs_.moves.syncDirectories(changed))
            return Reporter(needs_.log, function)
                .error(ErrorCode::subdirectoryFailed, &*failed, "Failed to create sub-dir at %s%s",
                       changed.front().c_str(), "");
        return {};
    });
}

Result<void> Structure::makeSubdirectories(const ContainerLayout& layout, int protectionClass,
                                           std::vector<FileURL>& changed) {
    const FileURL container = changed.front();
    ZORFileManager& fileManager = needs_.fileManager;
    // Each is reached from the one that was judged: what has its name by then may be another's.
    std::map<std::string_view, FileDescriptor> open;
    const auto make = [&](std::string_view path) -> Result<FileDescriptor> {
        const std::size_t slash = path.rfind('/');
        const std::string_view above = slash == path.npos ? "" : path.substr(0, slash);
        if (!open.contains(above))
            open.emplace("", TRY(fileManager.openDirectoryOf(layout.topLevelOwner, container)));
        // One that is there keeps its class: its owner's, or an earlier change's.
        const bool isNew = fileManager.itemDoesNotExistAtURL(container.appendingDirectory(path));
        return fileManager.openOrCreateDirectoryBelow(
            open.at(above).get(), above.empty() ? container : container.appendingDirectory(above),
            std::string(path.substr(slash == path.npos ? 0 : slash + 1)), Intermediates::yes,
            {.mode = layout.subdirectoryMode,
             .owner = layout.subdirectoryOwner,
             .protectionClass = isNew ? protectionClass : protectionClassUnchanged});
    };
    for (const char* subdirectory : layout.subdirectories) {
        changed.push_back(container.appendingDirectory(subdirectory));
        auto made = make(subdirectory);
        if (!made)
            return Reporter(needs_.log, "_createSubDirectories")
                .error(ErrorCode::subdirectoryFailed, &made.error(), "Failed to create sub-dir at %s%s",
                       container.c_str(), subdirectory);
        open.emplace(subdirectory, std::move(*made));
    }
    return {};
}

Result<void> Structure::regenerateDirectoryUUIDForUser(const ContainerAddress& address) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        TRY(checkAddress(needs_.log, regenerateFunction, address));
        return needs_.replaces.undisturbed([&] { return regenerate(address); });
    });
}

Result<void> Structure::regenerate(const ContainerAddress& address) {
    constexpr const char* function = regenerateFunction;
    FileURL newUrl;
    std::shared_ptr<ZORMetadata> renamed;
    if (!needs_.recovery.noneWaits()) {
        const AllIdentifiersWriteLock lock(needs_.locks);
        (void)TRY(needs_.recovery.settledContainer(address.userId, address.containerClass,
                                                   address.identifier ? &*address.identifier : nullptr, *address.uuid,
                                                   lock));
    }
    {
        const IdentifierWriteLock lock(needs_.locks, address.lockName());
        const auto record = TRY(knownContainer(needs_, function, address, lock));
        const FileURL oldUrl = record->url();
        const FileURL place = oldUrl.deletingLastPathComponent();
        newUrl = place.appendingDirectory(UUID::random().string());
        const auto moved = [&]() -> Result<void> {
            const std::uint32_t owner =
                ZORGlobalConfiguration::ownerOfClassDirectory(address.containerClass, address.userId);
            const auto directory = TRY(needs_.fileManager.openDirectoryOf(owner, place));
            TRY(needs_.fileManager.openDirectoryOf(owner, oldUrl));
            TRY(needs_.fileManager.moveItem(directory.get(), oldUrl, directory.get(), newUrl));
            return {};
        }();
        if (!moved)
            return Reporter(needs_.log, function)
                .error(ErrorCode::directoryNotRenamed, &moved.error(), "Failed to move dir: %s to new UUID dir: %s",
                       oldUrl.c_str(), newUrl.c_str());
        const bool transient = record->transient(); // the mapping is the live one's
        if (isPerUserClass(address.containerClass) && !transient &&
            !needs_.mappings._setSandboxContainerMappingForUser(address.userId, record->identifier(),
                                                                address.containerClass, newUrl))
            needs_.log.write(logLevelError, function, "Failed to set container mapping in regenerate operation");
        record->setDurable(false);
        const auto added = needs_.cache.addContainerMetadata(record, address.userId, ContainerPlace(newUrl), transient);
        if (!added)
            return Reporter(needs_.log, function)
                .error(ErrorCode::cacheAddFailed, &added.error(), "Failed to add to cache: %s, url: %s, transient: %d",
                       ZOR_SHOWN(record->identifier()), newUrl.c_str(), transient);
        renamed = record;
    }
    if (const auto failed = needs_.moves.syncDirectories({newUrl.deletingLastPathComponent()}))
        return needs_.moves.notLasting(function, ErrorCode::directoryNotRenamed, newUrl, *failed);
    renamed->setDurable(true);
    return {};
}

} // namespace zor
