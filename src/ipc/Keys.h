// SPDX-License-Identifier: Apache-2.0
// The words of the protocol: command numbers, and the keys of requests and replies. Their one home: the daemon's
// handlers and the client library both take them from here.
#pragma once

#include <cstdint>
#include <string_view>

namespace zor::ipc {

enum class Command : std::uint64_t {
    createOrLookupContainer = 0,
    listContainers = 1,
    replaceContainer = 2,
    stageContainersForDelete = 3,
    deleteContainersOnDeathRow = 4,
    setInfoValue = 5,
    getInfoValue = 6,
    getMetadata = 7,
    recreateDefaultStructure = 8,
    regenerateDirectoryUUID = 9,
    deleteContainer = 10,
    wipeEntitledPluginDataContainer = 11,
    wipeDataContainerContent = 12,
    getGroupContainerPaths = 13,
    getGroupContainerIdentifiers = 14,
    getSystemContainerPath = 15,
    getSystemGroupContainerPaths = 16,
    getSystemGroupContainerPath = 17,
    processEntitlements = 18,
    setDataProtection = 19,
    recreateDefaultStructure2 = 20,
    getDiskUsage = 21,
    retryTest = 22,
};
inline constexpr std::uint64_t commandCount = 23;

/// "ReplyError" of a command that did what it was asked to do.
inline constexpr std::uint64_t replySuccess = 1;

// Types: u64 is an unsigned 64-bit integer, UUID is data of 16 bytes.
namespace keys {

// Requests.
inline constexpr std::string_view command = "Command";                     // u64; absent reads as 0
inline constexpr std::string_view containerClass = "ContainerClass";       // u64
inline constexpr std::string_view userId = "UserID";                       // u64
inline constexpr std::string_view identifier = "Identifier";               // string
inline constexpr std::string_view uuid = "UUID";                           // UUID
inline constexpr std::string_view createIfNecessary = "CreateIfNecessary"; // boolean
inline constexpr std::string_view transient = "Transient";                 // boolean
/// String: the list comes in pages; empty for the first one, then what the reply before gave.
inline constexpr std::string_view pageAfter = "PageAfter";
inline constexpr std::string_view oldContainerUUID = "OldContainerUUID";           // UUID
inline constexpr std::string_view oldContainerClass = "OldContainerClass";         // u64
inline constexpr std::string_view oldIdentifier = "OldIdentifier";                 // string
inline constexpr std::string_view oldContainerUserId = "OldContainerUserID";       // u64
inline constexpr std::string_view newContainerUUID = "NewContainerUUID";           // UUID
inline constexpr std::string_view newContainerClass = "NewContainerClass";         // u64
inline constexpr std::string_view newIdentifier = "NewIdentifier";                 // string
inline constexpr std::string_view newContainerUserId = "NewContainerUserID";       // u64
inline constexpr std::string_view containerClassesArray = "ContainerClassesArray"; // array of u64
inline constexpr std::string_view uuidsArray = "UUIDsArray";                       // array of UUID
inline constexpr std::string_view userIdsArray = "UserIDsArray";                   // array of u64
inline constexpr std::string_view identifiersArray = "IdentifiersArray";           // array of strings
inline constexpr std::string_view key = "Key";                                     // string
inline constexpr std::string_view value = "Value";                                 // any
inline constexpr std::string_view infoDictRequested = "InfoDictRequested";         // boolean
inline constexpr std::string_view numRetryCrashes = "NumRetryCrashes";             // u64
inline constexpr std::string_view groupIdentifier = "GroupIdentifier";             // string
inline constexpr std::string_view entitlements = "Entitlements";                   // any; a dictionary is meant
inline constexpr std::string_view optionsDictionary = "OptionsDictionary";         // any; a dictionary is meant
inline constexpr std::string_view dataProtectionClass = "DataProtectionClass";     // signed 64-bit integer
inline constexpr std::string_view isThirdParty = "IsThirdParty";                   // boolean
inline constexpr std::string_view retryIfLocked = "RetryIfLocked";                 // boolean

// Options of processEntitlements.
inline constexpr std::string_view parentBundleIdOption = "com.veltra.Zorvane.ParentBundleID"; // string
inline constexpr std::string_view registeredByCallerOption =
    "com.veltra.Zorvane.EntitlementsRegisteredByCaller";                                            // boolean
inline constexpr std::string_view placeholderOption = "com.veltra.Zorvane.PlaceholderEntitlements"; // boolean

// Replies.
inline constexpr std::string_view replyError = "ReplyError";           // u64, in every reply
inline constexpr std::string_view replyUUID = "ReplyUUID";             // UUID
inline constexpr std::string_view replyExisted = "ReplyExisted";       // boolean
inline constexpr std::string_view replyPath = "ReplyPath";             // string
inline constexpr std::string_view replyIdentifier = "ReplyIdentifier"; // string
inline constexpr std::string_view replyIdsArray = "ReplyIdsArray";     // array of strings
inline constexpr std::string_view replyUUIDsArray = "ReplyUUIDsArray"; // array of UUID
/// String, where another page follows: its "PageAfter".
inline constexpr std::string_view replyNextPage = "ReplyNextPage";
inline constexpr std::string_view replyInfoValue = "ReplyInfoValue";                         // any
inline constexpr std::string_view replyTransient = "ReplyTransient";                         // boolean
inline constexpr std::string_view replyInfoDictionary = "ReplyInfoDictionary";               // dictionary
inline constexpr std::string_view replyDiskUsage = "ReplyDiskUsage";                         // u64, bytes
inline constexpr std::string_view replyGroupContainerDict = "ReplyGroupContainerDict";       // identifier to path
inline constexpr std::string_view replyGroupIdentifiersArray = "ReplyGroupIdentifiersArray"; // array

// The status reply.
inline constexpr std::string_view statusPeer = "Peer";                             // dictionary
inline constexpr std::string_view peerKnown = "Known";                             // boolean
inline constexpr std::string_view peerIdentifier = "Identifier";                   // string
inline constexpr std::string_view peerExplanation = "Explanation";                 // string
inline constexpr std::string_view peerMaySendEveryCommand = "MaySendEveryCommand"; // boolean
inline constexpr std::string_view statusDaemon = "Daemon";                         // dictionary
inline constexpr std::string_view daemonUptimeMilliseconds = "UptimeMilliseconds"; // u64
inline constexpr std::string_view statusCounters = "Counters";                     // dictionary
/// Dictionary: identifier to entitlements, and the keys that the entitlement map keeps for itself.
inline constexpr std::string_view statusEntitlements = "Entitlements";
/// Dictionary: "Application" and "System" to dictionaries of group identifier to an array of the identifiers that list
/// it, one for each time that they do.
inline constexpr std::string_view statusGroupReferences = "GroupReferences";
inline constexpr std::string_view statusApplicationGroups = "Application";
inline constexpr std::string_view statusSystemGroups = "System";
inline constexpr std::string_view statusEntitlementsLeftOut = "EntitlementsLeftOut"; // boolean

} // namespace keys

/// Keys of a container's info that the system gives a meaning to.
namespace infoKeys {
/// u64, bytes: what a bundle was measured to take.
inline constexpr std::string_view staticDiskUsage = "com.veltra.Brevance.StaticDiskUsage";
/// Integer: the data-protection class that was asked for last; absent reads as 3.
inline constexpr std::string_view contentProtectionClass = "com.veltra.Brevance.ContentProtectionClass";
/// The groups that an identifier is entitled to, as older systems kept them in its data container.
inline constexpr std::string_view groupContainerIds = "com.veltra.Brevance.GroupContainerIDs";
} // namespace infoKeys

} // namespace zor::ipc
