// SPDX-License-Identifier: Apache-2.0
// The second user: a client that asks for containers of its own, and meanwhile puts links, pipes and closed directories
// of others in the places of what the daemon works on, so that it would change what lies outside or is another's. Any
// answer will do, as long as there is one; what lies outside, or is another's, stays as it is.
#pragma once

#include "soak/Session.h"

namespace zor::soak {

inline constexpr std::uint32_t hostileUser = 502;
/// Below the root: what is found there is the owner's own doing.
inline constexpr const char* hostileHome = "private/var/second/";

class HostileOwner {
public:
    HostileOwner(Session& session, std::uint64_t seed);
    /// Two threads' work, until the session is stopped.
    void ask();
    void swap();
    /// The changes outside; empty when there are none.
    [[nodiscard]] std::string changedOutside() const;

private:
    zorvane::Result<void> askOnce(zorvane::Client& client);
    /// A client that ends in the middle of a frame.
    void askByHalves();
    void swapOnce(const std::string& victim);
    /// A closed directory of this user's.
    [[nodiscard]] std::string closedOf(uid_t owner) const;
    /// For a moment another's closed directory has the place's name.
    void nameAnothersSo(const std::string& victim);

    Session& session_;
    Choices asking_;
    Choices swapping_;
    const std::string outside_;
    std::string before_;
};

} // namespace zor::soak
