// SPDX-License-Identifier: Apache-2.0
// Structured answers whose content differs from daemon to daemon, such as the status: read them generically.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <variant>
#include <vector>

namespace zorvane {

struct Value;
using List = std::vector<Value>;
using Map = std::map<std::string, Value>;

struct Value {
    std::variant<bool, std::int64_t, std::uint64_t, double, std::string, List, Map> content;
};

} // namespace zorvane
