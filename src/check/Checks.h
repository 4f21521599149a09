// SPDX-License-Identifier: Apache-2.0
// The parts of a check, and the look over a store that they share. Each part reads alone, on one thread, and adds its
// findings to the look.
#pragma once

#include "check/Finding.h"
#include "check/StoreCheck.h"
#include "fs/FileSystemDeathRow.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "store/StorePlaces.h"
#include "store/ZORMetadata.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::check {

// One look: every directory is opened anew, without following a link, and judged by its descriptor.

struct MobileUser {
    std::uint32_t userId;
    FileURL home;
};

class Look {
public:
    Look(CheckedSystem& system, const CheckOptions& options);

    [[nodiscard]] CheckedSystem& device() { return system_; }
    [[nodiscard]] const CheckOptions& options() const { return options_; }
    [[nodiscard]] const ZORWhitelist& whitelist() const { return whitelist_; }
    /// Those that have a home, so far as it can be looked at.
    [[nodiscard]] const std::vector<MobileUser>& users() const { return users_; }

    /// Whether it is an account of a mobile user whose home is not there now, or holds no place for containers, as one
    /// that has not been mounted.
    [[nodiscard]] bool lacksHome(std::uint32_t userId) const { return homeless_.contains(userId); }

    /// Adds a finding and gives it for more to be filled in. `url` is what it is about.
    Finding& add(FindingCode code, const FileURL& url, std::string what, Mender mender);
    /// A finding that somebody who may use a shell can mend.
    Finding& addForPerson(FindingCode code, const FileURL& url, std::string what, std::string command);
    Finding& addUnexamined(const FileURL& url, Errno error);

    /// An open directory; nothing when there is none, or when there is something else, or an encryption hides it, which
    /// is then a finding.
    [[nodiscard]] std::optional<platform::FileDescriptor> openDirectory(const FileURL& url);
    /// Each name in an open directory but "." and "..".
    void forEachName(int directory, const FileURL& url, const std::function<void(const char* name)>& function);

    /// Moves something aside, within the directory of root, deleting nothing.
    [[nodiscard]] std::string moveAside(const FileURL& url) const;

    /// The live containers that shared-container rules ask about: identifier to directory, by class and user.
    std::map<std::pair<ContainerClass, std::uint32_t>, std::map<std::string, FileURL>> sharedContainers;

    [[nodiscard]] std::vector<Finding> take() { return std::move(findings_); }

private:
    void addUser(std::uint32_t userId);
    /// Whether an encryption hides what is in the directory, or the directory; said once of what hides it.
    bool isHidden(const FileURL& url);
    void addWrongShape(const FileURL& url);

    CheckedSystem& system_;
    const CheckOptions& options_;
    const ZORWhitelist whitelist_;
    std::vector<MobileUser> users_;
    std::set<std::uint32_t> homeless_;
    std::vector<Finding> findings_;
    std::set<std::string> misshapen_;
    std::set<std::string> hiding_;
};

// The class directories and the containers in them: names, metadata, owners and modes, standard subdirectories,
// data-protection classes.

class ContainerCheck {
public:
    explicit ContainerCheck(Look& look) : look_(look) {}
    void checkAll();

private:
    struct ClassDirectory {
        ContainerClass containerClass;
        std::uint32_t user;
        bool transient;
        FileURL url;
        int descriptor = -1;
        /// By identifier: where the last one listed lies.
        std::map<std::string, FileURL> known;
    };
    struct Container {
        const ClassDirectory& directory;
        FileURL url;
        int descriptor;
        std::shared_ptr<ZORMetadata> record;
    };

    void checkWellKnownTable();
    /// Outside of class directories: what holds the directories that a boot moves.
    void checkPlacesOfMoves();
    void checkClass(ContainerClass containerClass, std::uint32_t user, const std::optional<FileURL>& home);
    void checkDirectory(ClassDirectory& directory);
    void checkHidden(const FileURL& directory, const char* name);
    void checkEntry(ClassDirectory& directory, const MetadataReader& reader, const char* name);
    void checkMisshapen(const ClassDirectory& directory, const FileURL& url, bool nameAcceptable);
    /// False when there is no record that its class directory's owner would be given.
    [[nodiscard]] std::shared_ptr<ZORMetadata> readRecord(const ClassDirectory& directory, const MetadataReader& reader,
                                                          const char* name, int container);
    void addRefused(const ClassDirectory& directory, const char* name, const MetadataRefusal& refusal);
    void remember(ClassDirectory& directory, const Container& container);
    void checkInside(const Container& container);
    void checkOwnDirectory(const Container& container, const ContainerLayout& layout);
    [[nodiscard]] bool checkSubdirectory(const Container& container, const ContainerLayout& layout,
                                         const char* subdirectory);
    void checkProtection(const Container& container, const char* subdirectory, int descriptor);
    void checkNamesInside(const Container& container, const ContainerLayout& layout);
    Finding& addDirectoryLeftover(const FileURL& parent, std::string_view name);
    Finding& describe(Finding& finding, const Container& container) const;
    /// The directory where the container that a refused file describes belongs; nothing when that is not clear.
    [[nodiscard]] std::optional<FileURL> rightPlace(const ClassDirectory& directory, const char* name) const;

    Look& look_;
};

// Shared and system containers against the entitlements that keep them, and the entitlement file itself.

class ReferenceCheck {
public:
    explicit ReferenceCheck(Look& look) : look_(look) {}
    /// After the containers have been looked at.
    void checkAll();

private:
    /// Nothing when it cannot be known what anybody is entitled to; that is then a finding.
    [[nodiscard]] std::optional<plist::Dictionary> readMap();
    void checkGroups(const plist::Dictionary& map, bool system);
    void checkSystemContainers(const plist::Dictionary& map);

    Look& look_;
};

// The daemon's own directories: what a stop left in them, what waits on death rows, the sandbox mappings and the boot
// marker. Reads alone; one thread.

/// Calls with the topmost directory of each file system that may have a death row of its own, once.
void forEachTop(Look& look, const std::function<void(const fs::MountTop& top)>& function);
/// Calls with each row that there is, open for reading, and what it is called.
void forEachDeathRow(Look& look, const std::function<void(int row, const FileURL& url)>& function);

struct DeathRow {
    std::size_t items = 0;
    std::uint64_t bytes = 0;
    /// Since the one that waits longest was moved there; 0 without items.
    std::uint64_t oldestSeconds = 0;
};
/// Measures each item, which takes as long as its tree is large.
[[nodiscard]] DeathRow lookAtDeathRow(CheckedSystem& system);

class WorkCheck {
public:
    explicit WorkCheck(Look& look) : look_(look) {}
    void checkAll();

private:
    void checkStaging();
    void checkAside();
    void checkDeathRow();
    void addDeathRowItems(int directory, const FileURL& row);
    void checkJournals();
    void addJournal(const FileURL& url);
    void checkLibrary();
    void checkMappings();
    void checkBootMarker();

    Look& look_;
};

} // namespace zor::check
