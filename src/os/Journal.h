// SPDX-License-Identifier: Apache-2.0
// The system journal in its own form: a line with fields, and a priority that says whether somebody has to act.
//
// It is used where the service manager has connected standard error to the journal. A journal that does not read loses
// lines rather than holding up who writes them; the log file has them all. Any thread.
#pragma once

#include "os/FileDescriptor.h"

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::platform {

/// The fields of a log line, and of the request that it belongs to.
struct JournalLine {
    int level = 0;
    std::string_view function;
    std::string_view message;
};

class Journal {
public:
    /// Not connected where `standardError` does not lead to the journal.
    [[nodiscard]] static Journal ofEnvironment(int standardError);
    /// One that listens at `path`.
    [[nodiscard]] static Journal at(const std::string& path);
    Journal() = default;

    [[nodiscard]] bool isConnected() const { return socket_.valid(); }
    /// Whether the journal took it.
    bool write(const JournalLine& line) const;

private:
    explicit Journal(FileDescriptor socket) : socket_(std::move(socket)) {}
    FileDescriptor socket_;
};

} // namespace zor::platform
