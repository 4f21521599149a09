// SPDX-License-Identifier: Apache-2.0
// The class directories and the containers in them: names, metadata, owners and modes, standard subdirectories,
// data-protection classes.
#pragma once

#include "check/Look.h"
#include "store/ContainerLayout.h"
#include "store/ZORMetadata.h"

#include <map>
#include <memory>
#include <string>

namespace zor::check {

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

} // namespace zor::check
