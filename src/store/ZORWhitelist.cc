// SPDX-License-Identifier: Apache-2.0
#include "store/ZORWhitelist.h"

#include "fs/Durability.h"
#include "ipc/Identifiers.h"
#include "os/SystemRoot.h"

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

ZORWhitelist::Table tableIn(const plist::Dictionary& file, std::string_view key, const Log& log) {
    const Reporter report(log, "ZORWhitelist");
    ZORWhitelist::Table table;
    const plist::Value* value = file.find(key);
    const plist::Dictionary* rows = value ? value->asDictionary() : nullptr;
    if (value && !rows) {
        const std::string shown(key);
        report.write(logLevelError, "Well-known containers under %s are no dictionary; ignoring them", shown.c_str());
        table.isWhole = false;
    }
    for (const auto& [identifier, row] : rows ? *rows : plist::Dictionary()) {
        const std::string* name = row.asString();
        const bool taken =
            name && std::ranges::any_of(table.rows, [&](const auto& other) { return other.second == *name; });
        if (name && isDirectoryName(*name) && !taken) {
            table.rows.emplace(identifier, *name);
            continue;
        }
        report.write(logLevelError, "Well-known container %s has no usable directory name of its own (%s); ignoring it",
                     ZOR_SHOWN(identifier), plist::describe(&row).c_str());
        table.isWhole = false;
    }
    return table;
}

} // namespace

ZORWhitelist ZORWhitelist::forSystem(const Log& log, ZORFileManager& fileManager) {
    const FileURL url = FileURL::file(fileManager.resolver().root().path(platform::names::wellKnownTable));
    const auto file = readDictionaryAtURL(url, fs::metadataFileBytesMax, fileManager);
    if (file)
        return {tableIn(*file, systemKey, log), tableIn(*file, systemGroupKey, log)};
    const bool isThere = !file.error().isPosix(ENOENT);
    if (isThere)
        log.write(logLevelError, __func__, "The table of well-known containers is not used: %s",
                  file.error().text().c_str());
    return {{.rows = builtInSystemContainers(), .isWhole = !isThere},
            {.rows = builtInSystemGroups(), .isWhole = !isThere}};
}

const ZORWhitelist::Table* ZORWhitelist::tableOf(ContainerClass containerClass) const {
    if (containerClass == ContainerClass::sharedSystemGroup)
        return &systemGroup_;
    return containerClass == ContainerClass::dataSystem ? &system_ : nullptr;
}

const std::string* ZORWhitelist::wellknownContainerForId(std::string_view identifier,
                                                         ContainerClass containerClass) const {
    const Table* table = tableOf(containerClass);
    if (!table)
        return nullptr;
    const auto row = table->rows.find(identifier);
    return row == table->rows.end() ? nullptr : &row->second;
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
    const Table* table = tableOf(containerClass);
    return table && std::ranges::any_of(table->rows, [&](const auto& row) { return row.second == name; });
}

bool ZORWhitelist::isWhole(ContainerClass containerClass) const {
    const Table* table = tableOf(containerClass);
    return !table || table->isWhole;
}

ZORWhitelist::NameOf ZORWhitelist::judgeName(std::string_view name, ContainerClass containerClass) const {
    // An identifier of the table whose container goes by another name is a name all the same: what lies there is not
    // ours to judge by a table that may have changed.
    if (UUID::parse(name) || containerIdIsWellknown(name, containerClass) ||
        directoryNameIsWellknown(name, containerClass))
        return NameOf::container;
    return isWhole(containerClass) ? NameOf::noContainer : NameOf::unknown;
}

std::vector<std::string> ZORWhitelist::wellknownSystemContainers() const {
    std::vector<std::string> identifiers;
    for (const auto& [identifier, name] : system_.rows)
        identifiers.push_back(identifier);
    return identifiers;
}

std::vector<std::string> ZORWhitelist::wellknownSystemGroupContainers() const {
    std::vector<std::string> identifiers;
    for (const auto& [identifier, name] : systemGroup_.rows)
        identifiers.push_back(identifier);
    return identifiers;
}

} // namespace zor
