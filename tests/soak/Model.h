// SPDX-License-Identifier: Apache-2.0
// What a client knows of one container of its own: a state, or after a request that nobody answered the states of which
// it must be one.
#pragma once

#include "zorvane/Client.h"

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zor::soak {

struct Known {
    /// Absent: made by a request whose answer did not come.
    std::optional<std::array<std::uint8_t, 16>> uuid;
    /// Of the file that the client keeps there, and of the value that it attached; empty without.
    std::string content;
    std::string value;

    [[nodiscard]] bool fits(const Known& other, bool whateverValue) const {
        return (!uuid || !other.uuid || *uuid == *other.uuid) && content == other.content &&
               (whateverValue || value == other.value);
    }
};
/// nullopt: there is no container.
using State = std::optional<Known>;

inline std::string textOf(const State& state) {
    if (!state)
        return "none";
    const std::string uuid = state->uuid ? zorvane::uuidText(*state->uuid) : "some UUID";
    return uuid + ", content '" + state->content + "', value '" + state->value + "'";
}

class Model {
public:
    [[nodiscard]] bool isCertain() const { return states_.size() == 1; }
    /// Only while it is certain.
    [[nodiscard]] const State& state() const { return states_.front(); }
    void become(State state) {
        states_ = {std::move(state)};
        valueDoubted_ = false;
    }
    /// The client wrote it itself.
    void setContent(const std::string& content) { states_.front()->content = content; }
    /// The daemon could not write a value and goes on with it in memory: until it writes the next, either may show.
    void doubtValue() { valueDoubted_ = true; }
    /// A request was not answered, or not carried out: what it was to make may be there or not, never half.
    void mayBe(State other) { states_.push_back(std::move(other)); }
    /// What was seen has to be one of the possible states.
    [[nodiscard]] bool observe(const State& seen) {
        for (const State& possible : states_)
            if (possible.has_value() == seen.has_value() && (!seen || possible->fits(*seen, valueDoubted_))) {
                states_ = {seen};
                return true;
            }
        return false;
    }
    [[nodiscard]] std::string text() const {
        std::string all;
        for (const State& state : states_)
            all += (all.empty() ? "" : ", or ") + textOf(state);
        return all;
    }

private:
    std::vector<State> states_{std::nullopt};
    bool valueDoubted_ = false;
};

} // namespace zor::soak
