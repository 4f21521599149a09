// SPDX-License-Identifier: Apache-2.0
// Structured values, as info values and entitlements are, and answers whose content differs from daemon to daemon, such
// as the status: read them generically. A value that was read can be written back as it is.
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
using Data = std::vector<std::uint8_t>;

struct Date {
    /// Since 2001-01-01 00:00 UTC, which is 978,307,200 seconds after 1970 began.
    double seconds = 0;
};

struct Value {
    /// An integer is signed where it fits.
    std::variant<bool, std::int64_t, std::uint64_t, double, std::string, List, Map, Data, Date> content;
};

} // namespace zorvane
