// SPDX-License-Identifier: Apache-2.0
#include "entitlements/ZORWhitelist.h"

#include "fs/DictionaryFile.h"
#include "fs/OwnedFile.h"
#include "platform/linux/Names.h"

#include <algorithm>
#include <cerrno>

namespace zor {

namespace {

constexpr std::string_view systemKey = "System";
constexpr std::string_view systemGroupKey = "SystemGroup";
constexpr std::size_t nameBytesMax = 255; // of one path component on Linux

/// A name that a listing shows and that cannot lead anywhere else.
bool isDirectoryName(const std::string& name) {
    return !name.empty() && name.size() <= nameBytesMax && name[0] != '.' && name.find('/') == std::string::npos;
}

ZORWhitelist::Mapping builtInSystemContainers() {
    return {{"com.veltra.settingsd", "com.veltra.settingsd"}};
}

ZORWhitelist::Mapping builtInSystemGroups() {
    ZORWhitelist::Mapping mapping;
    for (const char* identifier : {"systemgroup.com.veltra.fonts", "systemgroup.com.veltra.timezone",
                                   "systemgroup.com.veltra.certificates", "systemgroup.com.veltra.dictionaries"})
        mapping.emplace(identifier, identifier);
    return mapping;
}

ZORWhitelist::Mapping mappingIn(const plist::Dictionary& file, std::string_view key, const Log& log) {
    ZORWhitelist::Mapping mapping;
    const plist::Dictionary* table = file.dictionary(key);
    if (!table)
        return mapping;
    for (const auto& [identifier, value] : *table) {
        const std::string* name = value.asString();
        const bool taken = name && std::ranges::any_of(mapping, [&](const auto& row) { return row.second == *name; });
        if (!name || !isDirectoryName(*name) || taken)
            log.write(logLevelError, "ZORWhitelist",
                      "Well-known container %s has no usable directory name of its own (%s); ignoring it",
                      ZOR_SHOWN(identifier), plist::describe(&value).c_str());
        else
            mapping.emplace(identifier, *name);
    }
    return mapping;
}

} // namespace

ZORWhitelist ZORWhitelist::forSystem(const Log& log, ZORFileManager& fileManager) {
    const FileURL url = FileURL::file(fileManager.resolver().root().path(platform::names::wellKnownTable));
    const auto file = readDictionaryAtURL(url, fs::metadataFileBytesMax, fileManager);
    if (file)
        return {mappingIn(*file, systemKey, log), mappingIn(*file, systemGroupKey, log)};
    if (!file.error().isPosix(ENOENT))
        log.write(logLevelError, __func__, "The table of well-known containers is not used: %s",
                  file.error().text().c_str());
    return {builtInSystemContainers(), builtInSystemGroups()};
}

const ZORWhitelist::Mapping* ZORWhitelist::tableOf(ContainerClass containerClass) const {
    if (containerClass == ContainerClass::sharedSystemGroup)
        return &systemGroupWhitelist_;
    return containerClass == ContainerClass::dataSystem ? &systemWhitelist_ : nullptr;
}

const std::string* ZORWhitelist::wellknownContainerForId(std::string_view identifier,
                                                         ContainerClass containerClass) const {
    const Mapping* table = tableOf(containerClass);
    if (!table)
        return nullptr;
    const auto row = table->find(identifier);
    return row == table->end() ? nullptr : &row->second;
}

const std::string* ZORWhitelist::wellknownSystemContainerForId(std::string_view identifier) const {
    return wellknownContainerForId(identifier, ContainerClass::dataSystem);
}

const std::string* ZORWhitelist::wellknownSystemGroupContainerForId(std::string_view identifier) const {
    return wellknownContainerForId(identifier, ContainerClass::sharedSystemGroup);
}

bool ZORWhitelist::systemContainerIdIsWellknown(std::string_view identifier) const {
    return wellknownSystemContainerForId(identifier) != nullptr;
}

bool ZORWhitelist::systemGroupContainerIdIsWellknown(std::string_view identifier) const {
    return wellknownSystemGroupContainerForId(identifier) != nullptr;
}

bool ZORWhitelist::containerIdIsWellknown(std::string_view identifier, ContainerClass containerClass) const {
    return wellknownContainerForId(identifier, containerClass) != nullptr;
}

bool ZORWhitelist::directoryNameIsWellknown(std::string_view name, ContainerClass containerClass) const {
    const Mapping* table = tableOf(containerClass);
    return table && std::ranges::any_of(*table, [&](const auto& row) { return row.second == name; });
}

std::vector<std::string> ZORWhitelist::wellknownSystemContainers() const {
    std::vector<std::string> identifiers;
    for (const auto& [identifier, name] : systemWhitelist_)
        identifiers.push_back(identifier);
    return identifiers;
}

std::vector<std::string> ZORWhitelist::wellknownSystemGroupContainers() const {
    std::vector<std::string> identifiers;
    for (const auto& [identifier, name] : systemGroupWhitelist_)
        identifiers.push_back(identifier);
    return identifiers;
}

} // namespace zor
