// SPDX-License-Identifier: Apache-2.0
// The command handlers. Each reads its arguments, has the user resolved, calls one container operation and fills the
// reply. Any thread of the listener; one message of a connection at a time.
#pragma once

#include "daemon/CommandTable.h"

namespace zor::commands {

// ContainerCommands.cc
void createOrLookupContainer(CommandContext& context);
void listContainers(CommandContext& context);
void deleteContainersOnDeathRow(CommandContext& context);

// DeletionCommands.cc
void stageContainersForDelete(CommandContext& context);
void deleteContainer(CommandContext& context);

// EntitlementCommands.cc
void getGroupContainerPaths(CommandContext& context);
void getGroupContainerIdentifiers(CommandContext& context);
void getSystemContainerPath(CommandContext& context);
void getSystemGroupContainerPaths(CommandContext& context);
void getSystemGroupContainerPath(CommandContext& context);
void processEntitlements(CommandContext& context);

// InfoCommands.cc
void setInfoValue(CommandContext& context);
void getInfoValue(CommandContext& context);
void getMetadata(CommandContext& context);

// LifecycleCommands.cc
void replaceContainer(CommandContext& context);
void recreateDefaultStructure(CommandContext& context);
void regenerateDirectoryUUID(CommandContext& context);
void wipeEntitledPluginDataContainer(CommandContext& context);
void wipeDataContainerContent(CommandContext& context);
void getDiskUsage(CommandContext& context);
void retryTest(CommandContext& context);

// ProtectionCommands.cc
void setDataProtection(CommandContext& context);

} // namespace zor::commands
