// SPDX-License-Identifier: Apache-2.0
// The figures of a run: judged against their goals, printed as a table, written as JSON.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace zor::bench {

enum class Sense { atMost, atLeast };

struct Figure {
    std::string name;              // as the JSON calls it
    std::string what;              // as the table calls it
    std::string measured;          // with its unit
    std::string floor;             // with its unit; empty where the goal is absolute
    std::optional<double> value{}; // what the goal is about; absent: not measured, and `remark` says why
    std::string unit;              // of value and goal: "x" is a ratio
    Sense sense = Sense::atMost;
    double goal = 0;
    std::string remark{};
    std::map<std::string, double> numbers{}; // everything else, for the JSON

    [[nodiscard]] bool met() const;
    [[nodiscard]] const char* verdict() const;
};

/// A printf into a string.
[[nodiscard]] std::string text(const char* format, ...) __attribute__((format(printf, 1, 2)));

struct Machine {
    std::string processor;
    unsigned processors = 0;
    std::string kernel;
    double loadBefore = 0; // processes that wanted to run in the minute before

    [[nodiscard]] static Machine here();
};

void printTable(const Machine& machine, const std::vector<Figure>& figures);
/// False, said on standard error, when the file cannot be written.
bool writeJson(const std::string& path, const Machine& machine, bool quick, const std::vector<Figure>& figures);

} // namespace zor::bench
