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

// NotServedYet.cc: commands of the table that this version refuses, with an error and a line that says so.
void notServedYet(CommandContext& context);
void notServedYetDeferred(CommandContext& context);

} // namespace zor::commands
