// SPDX-License-Identifier: Apache-2.0
// What a process holds that an operation could leak: descriptors and threads.
#pragma once

#include <map>
#include <string>

namespace zor::support {

class ProcessResources {
public:
    /// As they are now.
    ProcessResources();
    /// What is there now and was not then, in words; empty when nothing is. Threads get a second to end.
    [[nodiscard]] std::string leakedSince() const;

private:
    std::map<int, std::string> descriptors_;
    std::size_t threads_ = 0;
};

} // namespace zor::support
