// SPDX-License-Identifier: Apache-2.0
#include "store/EntitlementFile.h"

#include "fs/Durability.h"

#include <algorithm>

namespace zor {

namespace {

/// Whether nothing at all is handed out of this value, so that the one under the other key counts as well.
bool givesNothing(const plist::Value* value) {
    if (!value || value->asString())
        return !value;
    const plist::Array* array = value->asArray();
    return !array || array->empty() ||
           !std::ranges::all_of(*array, [](const plist::Value& element) { return element.asString(); });
}

/// The list that an entry of the map has for this type, whatever it is. An identifier that is handed a group counts,
/// and so does one that lists it in a list that is not handed out.
std::vector<const plist::Value*> groupsIn(const plist::Value& entry, GroupType type) {
    std::vector<const plist::Value*> lists;
    const auto add = [&](const plist::Value* value) {
        if (value)
            lists.push_back(value);
        return givesNothing(value);
    };
    const plist::Dictionary* entitlements = entry.asDictionary();
    if (!entitlements)
        return lists;
    if (type == GroupType::application)
        add(entitlements->find(entitlementKeys::applicationGroups));
    else if (add(entitlements->find(entitlementKeys::systemGroups)))
        add(entitlements->find(entitlementKeys::systemGroupContainers));
    return lists;
}

/// The groups in a list, or the one that stands in its place.
std::vector<std::string> groupNamesIn(const plist::Value& list) {
    if (const std::string* one = list.asString())
        return {*one};
    std::vector<std::string> names;
    if (const plist::Array* array = list.asArray())
        for (const plist::Value& element : *array)
            if (const std::string* name = element.asString())
                names.push_back(*name);
    return names;
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
        for (const plist::Value* groups : groupsIn(entry, type)) {
            if (log && !groups->asArray())
                log->write(logLevelError, function, "identifier: %s has non-array type of group container IDs: %s",
                           ZOR_SHOWN(identifier), plist::describe(groups).c_str());
            else if (log && log->writes(logLevelDebug))
                log->write(logLevelDebug, function, "Entitlements for identifier %s references container IDs: %s",
                           ZOR_SHOWN(identifier), plist::describe(groups).c_str());
            for (std::string& name : groupNamesIn(*groups))
                references[std::move(name)].push_back(identifier);
        }
    }
    return references;
}

} // namespace zor
