// SPDX-License-Identifier: Apache-2.0
// Tells, in one walk of a tree, whether a file that has several names has one outside: when all its names have been
// met, it has none.
//
// What is counted are meetings. Whoever can rename in the tree during the walk can have one name met twice, so who asks
// sees to it that nobody can, or that nobody gains by it. Memory grows with the files of which names are still to come.
#pragma once

#include <sys/stat.h>
#include <unordered_map>

namespace zor::fs {

class NamesMet {
public:
    /// Counts one name of a file, of which `status` is fresh: whether it was the last.
    [[nodiscard]] bool wasLast(const struct stat& status) {
        if (status.st_nlink <= 1)
            return true;
        const auto met = met_.try_emplace(status.st_ino, 0).first;
        if (++met->second < status.st_nlink)
            return false;
        met_.erase(met);
        return true;
    }
    /// Files of which a name has been met and another has not.
    [[nodiscard]] std::size_t unfinished() const { return met_.size(); }
    void forgetAll() { met_.clear(); }

private:
    std::unordered_map<ino_t, nlink_t> met_;
};

} // namespace zor::fs
