// SPDX-License-Identifier: Apache-2.0
// Ordinary conditions of a device that lose data where a daemon takes what is away for what is gone: a home that is
// missing at a boot and comes later, and two programs of one application that are entitled to different groups.
#pragma once

#include "soak/Session.h"

namespace zor::soak {

inline constexpr std::uint32_t lateUser = 504;

class Conditions {
public:
    /// Before the daemon starts: the user, the home, the programs and their entries.
    explicit Conditions(Session& session);
    /// `restart` ends the daemon and boots it again.
    template <typename Restart>
    void bootWithoutAHome(const Restart& restart) {
        if (!hold())
            return;
        leave();
        restart();
        askInVain();
        comeBack();
        look("after the home came back");
    }
    /// One of the two programs speaks; the groups of both must be there.
    void oneOfTwoSpeaks(bool first);

private:
    /// Makes what must not be lost, where it is missing. False: no daemon answered.
    bool hold();
    void leave();
    void askInVain();
    void comeBack();
    void look(const std::string& when);
    [[nodiscard]] std::string home() const;
    [[nodiscard]] std::optional<zorvane::Client> client() const;

    Session& session_;
    std::string container_;
    std::string group_;
};

} // namespace zor::soak
