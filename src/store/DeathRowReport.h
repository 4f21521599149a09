// SPDX-License-Identifier: Apache-2.0
// The state that moves to death row and deletion passes share: what keeps a pass from what is still being moved, and
// what passes could not remove, for the status and to be tried again.
//
// A pass writes it, on the death-row queue; anybody reads it.
#pragma once

#include "base/Mutex.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace zor {

class DeathRowReport {
public:
    /// So many paths are kept for the status; the rest is counted.
    static constexpr std::size_t pathsMax = 64;

    struct Left {
        std::uint64_t count = 0;
        std::vector<std::string> paths;

        void add(std::string path) {
            ++count;
            if (paths.size() < pathsMax)
                paths.push_back(std::move(path));
        }
    };

    void set(Left left) {
        const platform::MutexLock held(mutex_);
        left_ = std::move(left);
    }
    [[nodiscard]] Left left() const {
        const platform::MutexLock held(mutex_);
        return left_;
    }

    /// Held while something is moved to a death row, from the making of its directory there until it has been judged. A
    /// pass takes it for a moment between the reading of an item and its removal.
    platform::Mutex moving;

    /// Names in the directory for temporary files that passes closed and moved there; absent until a pass has looked
    /// for those of earlier daemons. On the death-row queue alone.
    std::optional<std::set<std::string>> inTemporary;

private:
    mutable platform::Mutex mutex_;
    Left left_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor
