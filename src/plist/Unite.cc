// SPDX-License-Identifier: Apache-2.0
#include "plist/Unite.h"

#include <optional>
#include <set>
#include <string>

namespace zor::plist {

namespace {

/// A list, or a string as a list of one.
std::optional<Array> listIn(const Value& value) {
    if (const Array* array = value.asArray())
        return *array;
    return value.asString() ? std::optional(Array{value}) : std::nullopt;
}

Array unitedLists(Array first, const Array& second) {
    std::set<std::string, std::less<>> present;
    for (const Value& element : first)
        if (const std::string* text = element.asString())
            present.insert(*text);
    for (const Value& element : second)
        if (const std::string* text = element.asString(); text && present.insert(*text).second)
            first.push_back(element);
    return first;
}

} // namespace

Dictionary united(Dictionary first, const Dictionary& second) {
    for (const auto& [key, value] : second) {
        const Value* const known = first.find(key);
        if (!known) {
            first.set(key, value);
            continue;
        }
        if (*known == value)
            continue;
        const auto list = listIn(value);
        if (auto knownList = listIn(*known))
            first.set(key, unitedLists(std::move(*knownList), list.value_or(Array())));
        else if (list || (known->asBoolean() && second.isTrue(key)))
            first.set(key, value);
    }
    return first;
}

} // namespace zor::plist
