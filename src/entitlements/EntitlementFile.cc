// SPDX-License-Identifier: Apache-2.0
#include "entitlements/EntitlementFile.h"

#include "fs/DictionaryFile.h"

namespace zor {

namespace {

/// The groups that an entry of the map lists for this type, whatever they are; nullptr for none.
const plist::Value* groupsIn(const plist::Value& entry, GroupType type) {
    const plist::Dictionary* entitlements = entry.asDictionary();
    if (!entitlements)
        return nullptr;
    if (type == GroupType::application)
        return entitlements->find(entitlementKeys::applicationGroups);
    const plist::Value* value = entitlements->find(entitlementKeys::systemGroups);
    const bool nothing = !value || (value->asArray() && value->asArray()->empty());
    return nothing ? entitlements->find(entitlementKeys::systemGroupContainers) : value;
}

} // namespace

Result<plist::Dictionary> readEntitlementFile(const FileURL& url, ZORFileManager& fileManager) {
    return readDictionaryAtURL(url, entitlementFileBytesMax, fileManager);
}

bool ownsSystemContainer(const plist::Dictionary& map, std::string_view identifier) {
    const plist::Dictionary* entitlements = map.dictionary(identifier);
    return entitlements && entitlements->isTrue(entitlementKeys::systemContainer);
}

GroupReferences groupReferencesIn(const plist::Dictionary& map, GroupType type, const Log* log) {
    constexpr const char* function = "_copyReferenceCountSetOfType";
    GroupReferences references;
    for (const auto& [identifier, entry] : map) {
        const plist::Value* groups = groupsIn(entry, type);
        if (!groups)
            continue;
        const plist::Array* array = groups->asArray();
        if (log && !array)
            log->write(logLevelError, function, "identifier: %s has non-array type of group container IDs: %s",
                       ZOR_SHOWN(identifier), plist::describe(groups).c_str());
        else if (log && log->writes(logLevelDebug))
            log->write(logLevelDebug, function, "Entitlements for identifier %s references container IDs: %s",
                       ZOR_SHOWN(identifier), plist::describe(groups).c_str());
        for (const plist::Value& group : array ? *array : plist::Array())
            if (const std::string* name = group.asString())
                references[*name].push_back(identifier);
    }
    return references;
}

} // namespace zor
