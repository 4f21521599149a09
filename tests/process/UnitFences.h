// SPDX-License-Identifier: Apache-2.0
// The fences of the installed unit around a daemon of a test: no more capabilities than it leaves, no new ones, and an
// end at the first system call that its filter does not let pass. So whatever the tests have a daemon do works on a
// device.
#pragma once

#include <linux/filter.h>
#include <vector>

namespace zor::whole {

class UnitFences {
public:
    UnitFences();
    /// In the new process, before it executes the daemon. Capabilities are root's to drop.
    [[nodiscard]] bool enter();
    /// False where a sanitizer needs other calls, or nothing said at build time which calls the unit's groups hold.
    [[nodiscard]] bool hasFilter() const { return !filter_.empty(); }

private:
    std::vector<unsigned> capabilities_;
    std::vector<sock_filter> filter_;
};

} // namespace zor::whole
