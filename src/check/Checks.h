// SPDX-License-Identifier: Apache-2.0
// The parts of a check. Each reads alone, on one thread, and adds its findings to the look.
#pragma once

#include "check/Look.h"
#include "check/StoreCheck.h"
#include "fs/FileSystemDeathRow.h"
#include "store/StorePlaces.h"
#include "store/ZORMetadata.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

namespace zor::check {

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
