// SPDX-License-Identifier: Apache-2.0
// Ordinary conditions of a device that lose data where a daemon takes what is away for what is gone: a home that is
// missing at a boot and comes later, and two programs of one application that are entitled to different groups.
#pragma once

#include "soak/Session.h"

#include <functional>

namespace zor::soak {

inline constexpr std::uint32_t lateUser = 504;

class Conditions {
public:
    /// Before the daemon starts: the user, the home, the programs and their entries.
    explicit Conditions(Session& session);
    /// `restart` ends the daemon and boots it again.
    void bootWithoutAHome(const std::function<void()>& restart);
    /// One of the two programs speaks; the groups of both must be there.
    void oneOfTwoSpeaks(bool first);

private:
    /// Makes what must not be lost. False: no daemon answered.
    bool hold();
    [[nodiscard]] std::optional<zorvane::Client> client() const;

    Session& session_;
    const std::string home_;
    std::string container_;
    std::string group_;
};

} // namespace zor::soak
