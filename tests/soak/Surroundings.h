// SPDX-License-Identifier: Apache-2.0
// What happens to the daemon: kills, orderly ends, boots, locks of the device, a full disk, too few descriptors. And
// what must hold whenever it starts again.
#pragma once

#include "soak/Choices.h"
#include "soak/Session.h"

namespace zor::soak {

class Surroundings {
public:
    Surroundings(Session& session, std::uint64_t seed, bool diskCanBeFilled);
    /// One event, after a random time below this.
    void happen(unsigned pauseMillisecondsMax);
    /// Ends all trouble.
    void settle();
    /// With the clients silent: `zorvanectl check` finds nothing but what the hostile owner did and what is allowed.
    void check();
    /// Resident memory in KiB and open descriptors.
    struct Size {
        std::size_t residentKiB = 0;
        std::size_t descriptors = 0;
    };
    [[nodiscard]] Size size() const;
    [[nodiscard]] std::uint64_t kills() const { return kills_; }
    [[nodiscard]] std::uint64_t boots() const { return boots_; }

private:
    void kill();
    void boot();
    void lock(bool locked);
    void fillDisk();
    void starve();
    void enter(Trouble trouble);

    Session& session_;
    Choices choices_;
    const bool diskCanBeFilled_;
    std::uint64_t kills_ = 0;
    std::uint64_t boots_ = 0;
};

} // namespace zor::soak
