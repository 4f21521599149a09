// SPDX-License-Identifier: Apache-2.0
// The words of the protocol, in their one home: where clients find the daemon, the kinds of container, the numbers of
// commands, the keys of requests and replies, and the codes of errors. The daemon's handlers and the client library
// both take them from here.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

namespace zor::ipc {

// The places where clients find the daemon. Paths are relative to the system root, which is / on a device.

/// The service's name; also the name of its socket.
inline constexpr std::string_view serviceName = "com.veltra.zorvaned";
inline constexpr std::string_view upcallServiceName = "com.veltra.zorvaned.upcall";
inline constexpr std::string_view statusSocketName = "zorvaned.status";
/// Holds the sockets.
inline constexpr std::string_view runtimeDirectory = "run/zorvane";
/// In it: a locked file for each program that must not be started now, named by its percent-encoded identifier.
inline constexpr std::string_view assertionDirectory = "assertions";
/// In it: the numbers of the users that own containers, as the daemon serves them.
inline constexpr std::string_view usersFile = "users";
/// In it: whether the device is locked.
inline constexpr std::string_view lockStateFile = "lockstate";

// The kinds of container and their names. The number is what requests carry and metadata files hold; the name is also
// the path of the class's directory, relative to the directory that holds all of them.

enum class ContainerClass : std::uint64_t {
    undefined = 0,
    bundleApplication = 1,
    dataApplication = 2,
    bundleKolvexPlugin = 3,
    dataKolvexPlugin = 4,
    bundleVPNPlugin = 5,
    dataVPNPlugin = 6,
    sharedAppGroup = 7,
    bundleFramework = 8,
    dataIpsiService = 9,
    dataInternalDaemon = 10,
    dataTempDir = 11,
    dataSystem = 12,
    sharedSystemGroup = 13,
    /// The bound: valid classes are below it, and above undefined.
    max = 14,
};

/// Names by number. Index 0 is no class.
inline constexpr std::array<std::string_view, 14> containerClassNames = {
    "Undefined",           "Bundle/Application", "Data/Application", "Bundle/KolvexPlugin", "Data/KolvexPlugin",
    "Bundle/VPNPlugin",    "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",    "Data/IpsiService",
    "Data/InternalDaemon", "Data/TempDir",       "Data/System",      "Shared/SystemGroup",
};
static_assert(containerClassNames.size() == static_cast<std::size_t>(ContainerClass::max));

[[nodiscard]] constexpr bool isContainerClass(std::uint64_t number) {
    return number > static_cast<std::uint64_t>(ContainerClass::undefined) &&
           number < static_cast<std::uint64_t>(ContainerClass::max);
}

/// The exact name of a valid class, nothing else.
[[nodiscard]] constexpr std::optional<ContainerClass> containerClassOfName(std::string_view name) {
    for (std::size_t number = 1; number < containerClassNames.size(); ++number)
        if (containerClassNames[number] == name)
            return static_cast<ContainerClass>(number);
    return std::nullopt;
}

/// Containers of these classes hold code; they belong to one user for the whole system.
[[nodiscard]] constexpr bool isBundleClass(ContainerClass containerClass) {
    return containerClass == ContainerClass::bundleApplication ||
           containerClass == ContainerClass::bundleKolvexPlugin || containerClass == ContainerClass::bundleVPNPlugin ||
           containerClass == ContainerClass::bundleFramework;
}

[[nodiscard]] constexpr bool isSystemClass(ContainerClass containerClass) {
    return containerClass == ContainerClass::dataSystem || containerClass == ContainerClass::sharedSystemGroup;
}

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
inline constexpr std::string_view passedSockets = "PassedSockets";                 // boolean: asks for the reply's

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
inline constexpr std::string_view replyPassedSockets = "ReplyPassedSockets";                 // boolean

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

namespace zor {

// The codes of ZORErrorDomain, as "ReplyError" carries them to clients. A code, once given out, keeps its meaning.

enum class ErrorCode : std::uint64_t {
    success = 1,
    moveToTemporaryFailed = 4,
    transientRemovalFailed = 5,
    subdirectoryFailed = 6,
    stagingDirectoryFailed = 7,
    moveToLiveFailed = 8,
    stagingRemovalFailed = 9,
    pathNotAsExpected = 10,
    invalidObject = 11,
    metadataUnreadable = 12,
    oldNotMovedToStaging = 14,
    newNotMovedIntoPlace = 15,
    deathRowItemNotDestroyed = 17,
    identifierMissing = 18,
    notFound = 21,
    replacedByItself = 22,
    classesDiffer = 23,
    infoKeyNotFound = 24,
    alreadyExists = 27,
    listForDeletionFailed = 28,
    metadataInvalid = 29,
    journalValuesInvalid = 33,
    propertyListNotWritten = 34,
    journalUnusable = 35,
    replaceCleanUpFailed = 36,
    valueNotAllowed = 38,
    exceptionCaught = 40,
    moveToDeathRowFailed = 41,
    cacheNotRebuilt = 43,
    cachedContainerWithoutMetadata = 44,
    cacheAddFailed = 45,
    cacheRemoveFailed = 46,
    cacheInputInvalid = 47,
    directoryNotRenamed = 48,
    notEntitled = 55,
    usersDiffer = 56,
    entitlementFileNotWritten = 59,
    entitlementCountsDiffer = 60,
    lockedAndNotRetried = 61,
    ownerNotChanged = 62,
};

} // namespace zor
