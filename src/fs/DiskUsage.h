// SPDX-License-Identifier: Apache-2.0
// Allocated bytes of every non-directory below a directory, each hard-linked file counted once.
//
// Breadth first, one bulk read buffer for each thread, no recursion; a second thread shares the directories of a large
// tree. The queue of directories is bounded; what does not fit it, and what lies deeper than a path can name, is
// measured depth first on the spot, so width and depth are bounded by nothing. The set of files seen grows only with
// files whose link count is not 1. Links are not followed and other file systems not entered. Never fails: what cannot
// be read adds nothing and is said in the log. Any thread, any number at once.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

namespace zor::fs {

struct UsageLog {
    /// Called with level 3 or 7 and the message, by one thread at a time. May be empty.
    std::function<void(int level, const std::string& message)> write;
    /// Messages above this level are not even made.
    int levelMax = 3;
};

struct Usage {
    std::uint64_t bytes = 0;
    /// This process ran out of descriptors or memory meanwhile: some of the tree is not in it.
    bool cutShort = false;
    /// When the last of what was examined, directories too, was changed (ctime, which nobody can set).
    std::chrono::system_clock::time_point lastChange{};
};

/// `path` names the directory, open for reading, in messages and serves nothing else. Its offset is moved.
Usage diskUsage(int directory, const std::string& path, const UsageLog& log);

} // namespace zor::fs
