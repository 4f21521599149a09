// SPDX-License-Identifier: Apache-2.0
// Judges a document by one of the schemas that are installed, as far as they use the language: a word of a schema that
// is not known here is a fault.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

namespace zor::whole {

/// Where and how the document differs; empty when it does not.
std::string differenceFromSchema(const nlohmann::json& schema, const nlohmann::json& document);

} // namespace zor::whole
