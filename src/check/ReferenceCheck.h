// SPDX-License-Identifier: Apache-2.0
// Shared and system containers against the entitlements that keep them, and the entitlement file itself.
#pragma once

#include "check/Look.h"

namespace zor::check {

class ReferenceCheck {
public:
    explicit ReferenceCheck(Look& look) : look_(look) {}
    /// After the containers have been looked at.
    void checkAll();

private:
    /// Nothing when it cannot be known what anybody is entitled to; that is then a finding.
    [[nodiscard]] std::optional<plist::Dictionary> readMap();
    void checkGroups(const plist::Dictionary& map, bool system);
    void checkSystemContainers(const plist::Dictionary& map);

    Look& look_;
};

} // namespace zor::check
