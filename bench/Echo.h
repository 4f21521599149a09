// SPDX-License-Identifier: Apache-2.0
// The floor of a request: a process that does nothing but what every server on an epoll with one-shot arming does. It
// waits, reads as many bytes as a request has, writes those of the reply, and arms the connection again.
#pragma once

#include "Client.h"
#include "Processes.h"

#include <memory>
#include <optional>
#include <string>

namespace zor::bench {

class Echo {
public:
    struct Options {
        unsigned threads = 1;
        std::optional<int> processor{};
    };
    /// Listens in `directory`. Every `requestBytes` bytes are answered with `reply`.
    Echo(const std::string& directory, std::size_t requestBytes, Frame reply, const Options& options);

    [[nodiscard]] Client connect() const;
    [[nodiscard]] double processorSeconds() const { return process_->processorSeconds(); }

private:
    const std::string directory_;
    platform::FileDescriptor listening_;
    std::unique_ptr<ChildProcess> process_;
};

} // namespace zor::bench
