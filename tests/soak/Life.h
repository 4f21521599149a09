// SPDX-License-Identifier: Apache-2.0
// One client: random requests about identifiers of its own, each answer held against what it knows. When the daemon
// goes away it waits for the next one and looks what became of what it had asked for.
#pragma once

#include "soak/Choices.h"
#include "soak/Model.h"
#include "soak/Session.h"

#include <functional>
#include <set>

namespace zor::soak {

class Life {
public:
    /// `user`: as whom it connects; root or a mobile user.
    Life(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed);
    /// Until the session is stopped.
    void live();
    /// Looks at everything once more; on the thread that lived.
    void lookAtAll();

private:
    struct Item {
        std::uint64_t containerClass;
        std::uint32_t user;
        std::string identifier;
        Model model;
    };
    /// The answer of a call that should work. Notes `after` as possible when it does not come.
    template <typename T>
    bool answered(Item& item, const char* operation, const zorvane::Result<T>& answer, const State& after);
    void connect();
    void lookAt(Item& item);
    [[nodiscard]] State seen(const Item& item);
    void act(Item& item);
    void make(Item& item);
    void actOnLive(Item& item, const Known& known);
    void replace(Item& item);
    void went(Item& item);
    void writeContent(Item& item, const Known& known);
    void mendStructure(const Item& item, const Known& known);
    void protect(const Item& item);
    void question(const Item& item, const Known& known);
    void registerGroups();
    void lookAtGroups();
    [[nodiscard]] zorvane::Client::Address addressOf(const Item& item, const Known& known) const;
    [[nodiscard]] std::string newText() { return std::to_string(++texts_); }
    /// What any call may be answered with: the daemon went away, or its surroundings are in trouble.
    template <typename T>
    [[nodiscard]] bool excused(const zorvane::Result<T>& answer);
    void found(const std::string& what);

    Session& session_;
    const std::string name_;
    const std::uint32_t user_;
    Choices choices_;
    std::vector<Item> items_;
    std::optional<zorvane::Client> client_;
    std::uint64_t texts_ = 0;
    const std::string registered_;
    /// The sets of groups of which the registration must be one.
    std::vector<std::set<std::string>> groups_{{}};
    bool groupsDoubted_ = false;
};

} // namespace zor::soak
