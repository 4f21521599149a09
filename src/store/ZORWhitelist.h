// SPDX-License-Identifier: Apache-2.0
// The system and system-group containers that lie at a fixed path: identifier to directory name.
//
// An administrator's table that could not be read whole may have given names that are unknown here: nothing is deleted
// or moved on the word of its readable rest, or of the built-in table in its place.
//
// Immutable after it is made; any thread.
#pragma once

#include "base/ContainerClass.h"
#include "fs/ZORFileManager.h"

#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

class ZORWhitelist {
public:
    using Mapping = std::map<std::string, std::string, std::less<>>;
    struct Table {
        Mapping rows;
        /// False where a file said more than could be read.
        bool isWhole = true;
    };

    /// The tables of the two classes, as they are.
    ZORWhitelist(Table systemContainers, Table systemGroupContainers)
        : system_(std::move(systemContainers)), systemGroup_(std::move(systemGroupContainers)) {}
    /// The tables of DIR/etc/zorvane/wellknown.plist where that file stands, else the built-in ones. A file that cannot
    /// be used, or a row in it, is said in the log and left out.
    static ZORWhitelist forSystem(const Log& log, ZORFileManager& fileManager);

    [[nodiscard]] const Mapping& systemWhitelist() const { return system_.rows; }
    [[nodiscard]] const Mapping& systemGroupWhitelist() const { return systemGroup_.rows; }

    // The directory name, or nullptr for an identifier that is not listed. Exact and case-sensitive.
    [[nodiscard]] const std::string* wellknownSystemContainerForId(std::string_view identifier) const;
    [[nodiscard]] const std::string* wellknownSystemGroupContainerForId(std::string_view identifier) const;
    [[nodiscard]] const std::string* wellknownContainerForId(std::string_view identifier,
                                                             ContainerClass containerClass) const;
    [[nodiscard]] bool systemContainerIdIsWellknown(std::string_view identifier) const;
    [[nodiscard]] bool systemGroupContainerIdIsWellknown(std::string_view identifier) const;
    [[nodiscard]] bool containerIdIsWellknown(std::string_view identifier, ContainerClass containerClass) const;
    [[nodiscard]] std::vector<std::string> wellknownSystemContainers() const;
    [[nodiscard]] std::vector<std::string> wellknownSystemGroupContainers() const;
    /// Whether a directory of the class may have this name although it is no UUID.
    [[nodiscard]] bool directoryNameIsWellknown(std::string_view name, ContainerClass containerClass) const;
    /// Whether the class's table is all that there is to know. True for a class without one.
    [[nodiscard]] bool isWhole(ContainerClass containerClass) const;

    enum class NameOf : std::uint8_t { container, noContainer, unknown };
    /// The kinds of name in a class's directory.
    [[nodiscard]] NameOf judgeName(std::string_view name, ContainerClass containerClass) const;

private:
    [[nodiscard]] const Table* tableOf(ContainerClass containerClass) const;

    Table system_;
    Table systemGroup_;
};

} // namespace zor
