// SPDX-License-Identifier: Apache-2.0
// The system and system-group containers that lie at a fixed path: identifier to directory name.
//
// Immutable after it is made; any thread.
#pragma once

#include "daemon/base/ContainerClass.h"
#include "fs/ZORFileManager.h"

#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

class ZORWhitelist {
public:
    using Mapping = std::map<std::string, std::string, std::less<>>;

    /// initWithSystemContainerMapping:systemGroupContainerMapping:
    ZORWhitelist(Mapping systemContainers, Mapping systemGroupContainers)
        : systemWhitelist_(std::move(systemContainers)), systemGroupWhitelist_(std::move(systemGroupContainers)) {}
    /// The tables of DIR/etc/zorvane/wellknown.plist where that file stands, else the built-in ones. A file that cannot
    /// be used, or a row in it, is said in the log and left out.
    static ZORWhitelist forSystem(const Log& log, ZORFileManager& fileManager);

    [[nodiscard]] const Mapping& systemWhitelist() const { return systemWhitelist_; }
    [[nodiscard]] const Mapping& systemGroupWhitelist() const { return systemGroupWhitelist_; }

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

private:
    [[nodiscard]] const Mapping* tableOf(ContainerClass containerClass) const;

    Mapping systemWhitelist_;
    Mapping systemGroupWhitelist_;
};

} // namespace zor
