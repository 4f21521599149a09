// SPDX-License-Identifier: Apache-2.0
#include "support/StoreJudge.h"

#include "plist/Codec.h"

#include <algorithm>
#include <array>
#include <span>
#include <unistd.h>

namespace zor::support {

namespace {

constexpr const char* stagingPath = "private/var/root/Library/Caches/com.veltra.zorvaned/Staging";
constexpr const char* deathRowPath = "private/var/root/Library/Caches/com.veltra.zorvaned/Dead";

struct Place {
    const char* live;
    const char* transient;
};
constexpr Place bundles = {"private/var/containers", "private/var/brevad/Library/Caches/com.veltra.zorvaned"};
constexpr Place system = {"private/var/containers", "private/var/root/Library/Caches/com.veltra.zorvaned/Temp"};
constexpr Place mobile = {"private/var/mobile/Containers",
                          "private/var/mobile/Containers/Library/Caches/com.veltra.zorvaned/Temp"};

using Inside = std::span<const char* const>;
constexpr Inside nothing;
constexpr std::array inGroups = {"Library", "Library/Caches"};
constexpr std::array inData = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};

struct ContainerKind {
    std::uint64_t number;
    const char* name;
    Place place;
    std::uint32_t user;
    std::uint32_t owner;
    Inside inside;
    mode_t insideMode;
};

constexpr ContainerKind kinds[] = {
    {1, "Bundle/Application", bundles, 33, 33, nothing, 0},
    {2, "Data/Application", mobile, 501, 501, inData, 0755},
    {3, "Bundle/KolvexPlugin", bundles, 33, 33, nothing, 0},
    {4, "Data/KolvexPlugin", mobile, 501, 501, inData, 0755},
    {5, "Bundle/VPNPlugin", bundles, 33, 33, nothing, 0},
    {6, "Data/VPNPlugin", mobile, 501, 501, inData, 0755},
    {7, "Shared/AppGroup", mobile, 501, 501, inGroups, 0755},
    {8, "Bundle/Framework", bundles, 33, 33, nothing, 0},
    {9, "Data/IpsiService", mobile, 501, 501, inData, 0755},
    {10, "Data/InternalDaemon", mobile, 501, 501, inData, 0755},
    {11, "Data/TempDir", mobile, 501, 501, inData, 0755},
    {12, "Data/System", system, 499, 0, inData, 0777},
    {13, "Shared/SystemGroup", system, 499, 0, inGroups, 0777},
};

/// The fault in the kind, mode or owner of an item; empty when nothing is. Only root can give things to others.
std::string itemComplaint(const FileTree& tree, const std::string& path, mode_t kindAndMode, std::uint32_t owner) {
    const InodeId id = tree.resolve(path);
    const Inode& inode = tree.inodes.at(id == 0 ? FileTree::rootId : id);
    const bool isOwned = ::geteuid() != 0 || (inode.uid == owner && inode.gid == owner);
    if (id != 0 && inode.mode == kindAndMode && isOwned)
        return "";
    return path + (id == 0 ? " is missing; "
                           : " has mode " + std::to_string(inode.mode) + " and belongs to " +
                                 std::to_string(inode.uid) + ":" + std::to_string(inode.gid) + "; ");
}

/// Also fills in what the metadata file tells.
std::string judgeContainer(const FileTree& tree, const ContainerKind& kind, StoredContainer& container) {
    const std::string metadata = container.path + "/.com.veltra.zorvane.metadata.plist";
    std::string complaint = itemComplaint(tree, container.path, S_IFDIR | 0755, kind.owner) +
                            itemComplaint(tree, metadata, S_IFREG | 0644, 0);
    for (const char* subdirectory : kind.inside)
        complaint += itemComplaint(tree, container.path + "/" + subdirectory, S_IFDIR | kind.insideMode, kind.owner);
    if (!complaint.empty())
        return complaint;
    const auto value = plist::readPropertyList(tree.inodes.at(tree.resolve(metadata)).content);
    const plist::Dictionary* content = value ? value->asDictionary() : nullptr;
    if (!content || content->unsignedInteger("ZORMetadataContentClass") != kind.number ||
        content->unsignedInteger("ZORMetadataPersona") != kind.user)
        return metadata + " holds no dictionary, or another class's or user's; ";
    const std::string* identifier = content->string("ZORMetadataIdentifier");
    const std::string* uuid = content->string("ZORMetadataUUID");
    if (!identifier || !uuid || uuid->size() != 36)
        return metadata + " lacks the identifier or the UUID; ";
    container.identifier = *identifier;
    container.uuid = *uuid;
    return "";
}

void judgeClassDirectory(const FileTree& tree, const ContainerKind& kind, bool transient, StoreFindings& findings) {
    const std::string path = std::string(transient ? kind.place.transient : kind.place.live) + "/" + kind.name;
    const InodeId directory = tree.resolve(path);
    if (directory == 0)
        return;
    for (const auto& [name, id] : tree.inodes.at(directory).entries) {
        // Copies on their way from another file system are hidden: they have no final name yet.
        if (name.starts_with("."))
            continue;
        StoredContainer container{.classNumber = kind.number, .transient = transient, .path = path + "/" + name};
        const std::string wrong = judgeContainer(tree, kind, container);
        findings.complaint += wrong;
        if (wrong.empty() && findings.find(kind.number, transient, container.identifier) != nullptr)
            findings.doubled += container.path + " is a second container of " + container.identifier + "; ";
        if (wrong.empty())
            findings.containers.push_back(std::move(container));
    }
}

std::vector<std::string> namesIn(const FileTree& tree, const char* path) {
    std::vector<std::string> names;
    if (const InodeId directory = tree.resolve(path)) {
        for (const auto& [name, id] : tree.inodes.at(directory).entries)
            names.push_back(name);
    }
    return names;
}

} // namespace

const StoredContainer* StoreFindings::find(std::uint64_t classNumber, bool transient,
                                           const std::string& identifier) const {
    const auto found = std::find_if(containers.begin(), containers.end(), [&](const StoredContainer& container) {
        return container.classNumber == classNumber && container.transient == transient &&
               container.identifier == identifier;
    });
    return found == containers.end() ? nullptr : &*found;
}

StoreFindings judgeStore(const FileTree& tree, Transients transients) {
    StoreFindings findings;
    for (const ContainerKind& kind : kinds) {
        judgeClassDirectory(tree, kind, false, findings);
        if (transients == Transients::judged)
            judgeClassDirectory(tree, kind, true, findings);
    }
    findings.staging = namesIn(tree, stagingPath);
    findings.deathRow = namesIn(tree, deathRowPath);
    return findings;
}

} // namespace zor::support
