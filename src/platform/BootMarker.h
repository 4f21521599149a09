// SPDX-License-Identifier: Apache-2.0
// The mark that the once-per-boot work is done; it ends with the boot.
#pragma once

#include <string>

namespace zor::platform {

class BootMarker {
public:
    virtual ~BootMarker() = default;
    /// Whether the mark exists and is ours. A mark made by somebody else counts as absent; `foreign` then is true.
    struct State {
        bool present = false;
        bool foreign = false;
    };
    [[nodiscard]] virtual State look() const = 0;
    /// Makes the mark. 0 or an errno.
    virtual int make() = 0;
    /// Removes the mark: the next launch takes itself for the first of its boot.
    virtual void forget() = 0;
    [[nodiscard]] virtual std::string name() const = 0;
};

} // namespace zor::platform
