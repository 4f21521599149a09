// SPDX-License-Identifier: Apache-2.0
#include "process/JsonSchema.h"

#include <algorithm>

namespace zor::whole {

namespace {

using nlohmann::json;

bool hasType(const std::string& type, const json& document) {
    return type == (document.is_number_integer() ? "integer" : document.is_number() ? "number" : document.type_name());
}

std::string properties(const json& schema, const json& document) {
    if (!document.is_object())
        return {};
    const json known = schema.value("properties", json::object());
    for (const auto& [name, value] : document.items()) {
        const json rule = known.contains(name) ? known[name] : schema.value("additionalProperties", json(true));
        if (rule == json(false))
            return name + " is not known";
        if (const auto difference = rule.is_object() ? differenceFromSchema(rule, value) : ""; !difference.empty())
            return name + ": " + difference;
    }
    return {};
}

} // namespace

std::string differenceFromSchema(const json& schema, const json& document) {
    for (const auto& [word, rule] : schema.items()) {
        std::string difference;
        const json list = rule.is_array() ? rule : json::array({rule});
        const auto isSo = [&](const auto& judge) { return std::any_of(list.begin(), list.end(), judge); };
        if (word == "type")
            difference = isSo([&](const json& type) { return hasType(type, document); }) ? "" : "is no " + rule.dump();
        else if (word == "enum" || word == "const")
            difference = isSo([&](const json& value) { return value == document; }) ? "" : "is not " + rule.dump();
        else if (word == "anyOf")
            difference =
                isSo([&](const json& one) { return differenceFromSchema(one, document).empty(); }) ? "" : "none fits";
        else if (word == "required")
            difference =
                isSo([&](const json& name) { return !document.contains(name); }) ? "not all of " + rule.dump() : "";
        else if (word == "properties" || word == "additionalProperties")
            difference = properties(schema, document);
        else if (word == "items")
            for (std::size_t i = 0; i < document.size() && difference.empty(); ++i)
                difference = differenceFromSchema(rule, document[i]);
        else
            difference = "the schema says " + word;
        if (!difference.empty())
            return difference;
    }
    return {};
}

} // namespace zor::whole
