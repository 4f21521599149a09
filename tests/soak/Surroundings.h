// SPDX-License-Identifier: Apache-2.0
// The events that the daemon meets: kills, orderly ends, boots, locks of the device, a full disk, too few descriptors,
// mounts that hang. And what must hold whenever the daemon starts again.
#pragma once

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
        [[nodiscard]] std::string text() const {
            return std::to_string(residentKiB) + " KiB, " + std::to_string(descriptors) + " descriptors";
        }
    };
    [[nodiscard]] Size size() const;
    [[nodiscard]] Count kills() const { return kills_; }
    [[nodiscard]] Count boots() const { return boots_; }

private:
    void end();
    void kill();
    void boot();
    void lock(bool locked);
    void fillDisk();
    void starve();
    /// A file system that never answers, in the hostile user's home: nobody else waits, and the daemon ends.
    void hang();
    void enter(Trouble trouble);

    Session& session_;
    Choices choices_;
    const bool diskCanBeFilled_;
    Count kills_ = 0;
    Count boots_ = 0;
};

} // namespace zor::soak
