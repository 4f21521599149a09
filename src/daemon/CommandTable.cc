// SPDX-License-Identifier: Apache-2.0
#include "daemon/CommandTable.h"

#include "daemon/commands/Commands.h"
#include "platform/Service.h"

namespace zor {

namespace {

using ipc::Command;
using platform::entitlementKeys::allowed;
using platform::entitlementKeys::wipeContainer;

constexpr std::string_view none = noEntitlementRequired;
constexpr ReplyFlag now = ReplyFlag::dispatcherReplies;
constexpr ReplyFlag later = ReplyFlag::handlerReplies;

constexpr std::array<ZORCommandTableRow, ipc::commandCount> rows = {{
    {Command::createOrLookupContainer, commands::createOrLookupContainer, none, now},
    {Command::listContainers, commands::listContainers, allowed, now},
    {Command::replaceContainer, commands::replaceContainer, allowed, now},
    {Command::stageContainersForDelete, commands::stageContainersForDelete, allowed, now},
    {Command::deleteContainersOnDeathRow, commands::deleteContainersOnDeathRow, allowed, later},
    {Command::setInfoValue, commands::setInfoValue, allowed, now},
    {Command::getInfoValue, commands::getInfoValue, allowed, now},
    {Command::getMetadata, commands::getMetadata, allowed, now},
    {Command::recreateDefaultStructure, commands::recreateDefaultStructure, allowed, now},
    {Command::regenerateDirectoryUUID, commands::regenerateDirectoryUUID, allowed, now},
    {Command::deleteContainer, commands::deleteContainer, allowed, now},
    {Command::wipeEntitledPluginDataContainer, commands::wipeEntitledPluginDataContainer, wipeContainer, now},
    {Command::wipeDataContainerContent, commands::wipeDataContainerContent, allowed, now},
    {Command::getGroupContainerPaths, commands::getGroupContainerPaths, none, now},
    {Command::getGroupContainerIdentifiers, commands::getGroupContainerIdentifiers, allowed, now},
    {Command::getSystemContainerPath, commands::getSystemContainerPath, none, now},
    {Command::getSystemGroupContainerPaths, commands::getSystemGroupContainerPaths, none, now},
    {Command::getSystemGroupContainerPath, commands::getSystemGroupContainerPath, none, now},
    {Command::processEntitlements, commands::processEntitlements, allowed, now},
    {Command::setDataProtection, commands::setDataProtection, allowed, later},
    {Command::recreateDefaultStructure2, commands::recreateDefaultStructure, allowed, now},
    {Command::getDiskUsage, commands::getDiskUsage, allowed, now},
    {Command::retryTest, commands::retryTest, allowed, now},
}};

constexpr bool everyRowIsItsCommand() {
    for (std::size_t i = 0; i < rows.size(); ++i)
        if (static_cast<std::size_t>(rows[i].command) != i || rows[i].handler == nullptr)
            return false;
    return true;
}
static_assert(everyRowIsItsCommand());

} // namespace

const std::array<ZORCommandTableRow, ipc::commandCount> commandTable = rows;

} // namespace zor
