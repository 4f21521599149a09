// SPDX-License-Identifier: Apache-2.0
// Every name that the platform layer has below the system root, spelled here and nowhere else.
//
// Paths are relative to the root's descriptor and open with openBeneath; SystemRoot::path turns them into absolute
// ones.
#pragma once

#include "ipc/Names.h"

namespace zor::platform::names {

// Files that the daemon reads.
inline constexpr const char* identityDirectory = "etc/zorvane/identities.d";
inline constexpr const char* identityFileSuffix = ".plist";
inline constexpr const char* wellKnownTable = "etc/zorvane/wellknown.plist";
inline constexpr const char* configurationFile = "etc/zorvane/zorvaned.conf";
inline constexpr const char* internalBuildMark = "etc/zorvane/internal-build";
inline constexpr const char* operatingSystemRelease = "etc/os-release";
inline constexpr const char* passwordFile = "etc/passwd";

// Names that live as long as the boot. Single names lie in runtimeDirectory.
inline constexpr const char* runParent = "run";
inline constexpr const char* runtimeName = "zorvane";
inline constexpr const char* runtimeDirectory = ipc::runtimeDirectory.data();
inline constexpr const char* serviceSocket = ipc::serviceName.data();
inline constexpr const char* upcallSocket = ipc::upcallServiceName.data();
inline constexpr const char* statusSocket = ipc::statusSocketName.data();
inline constexpr const char* lockFile = "zorvaned.lock";
inline constexpr const char* lockState = ipc::lockStateFile.data();
inline constexpr const char* usersFile = ipc::usersFile.data();
inline constexpr const char* sandboxDirectory = "sandbox";
inline constexpr const char* assertionDirectory = ipc::assertionDirectory.data();

// The log directory, which the store makes, and its files.
inline constexpr const char* logDirectory = "private/var/root/Library/Logs/Zorvane";
inline constexpr const char* logFile = "zorvaned.log";
inline constexpr const char* crashFile = "zorvaned.crash";

// POSIX semaphore, followed by "." and a hash of the root unless that is "/".
inline constexpr const char* bootMarker = "zorvaned.fb_check";
/// The directory in which the C library keeps a semaphore named X, in the file sem.X.
inline constexpr const char* semaphoreDirectory = "/dev/shm";
inline constexpr const char* semaphoreFilePrefix = "sem.";
/// The second boot marker, in runtimeDirectory.
inline constexpr const char* bootMarkerFile = "zorvaned.boot";
/// The kernel's name of this boot.
inline constexpr const char* bootIdentifier = "/proc/sys/kernel/random/boot_id";

// Extended attribute with a data-protection class: the first where the daemon is root.
inline constexpr const char* protectionAttribute = "trusted.zorvane.protection";
inline constexpr const char* protectionAttributeUser = "user.zorvane.protection";

// Names of the sockets that the service manager passes.
inline constexpr const char* passedServiceSocket = "ipsi";
inline constexpr const char* passedUpcallSocket = "upcall";
inline constexpr const char* passedStatusSocket = "status";

} // namespace zor::platform::names
