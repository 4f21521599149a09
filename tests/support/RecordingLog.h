// SPDX-License-Identifier: Apache-2.0
// A log that keeps its lines, so that a test can ask for the exact level, function and words. Any thread.
#pragma once

#include "base/Log.h"
#include "base/Mutex.h"
#include "platform/Process.h"

#include <algorithm>
#include <atomic>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace zor::support {

struct LogLine {
    int level = 0;
    std::string function;
    std::string message;
    bool operator==(const LogLine&) const = default;
};

inline std::ostream& operator<<(std::ostream& out, const LogLine& line) {
    return out << "<" << line.level << "> " << line.function << ": " << line.message;
}

class RecordingLog final : public platform::PlatformLog {
public:
    /// `level` of a handle that is open from the start; 0 for none yet.
    explicit RecordingLog(int level = 0) : level_(level) {}

    bool open(std::string_view, int level) override {
        level_ = level;
        return isOpen();
    }
    [[nodiscard]] bool isOpen() const override { return level_ != 0; }
    [[nodiscard]] int level() const override { return level_; }
    void enableDiskLogging(const std::string&, unsigned, std::size_t) override {}
    void write(int level, std::string_view function, std::string_view message) override {
        const platform::MutexLock held(mutex_);
        lines_.push_back({level, std::string(function), std::string(message)});
        if (const auto* request = LogSubject::current().request) {
            std::string told;
            (*request)([&](std::string_view name, std::string_view value) {
                told.append(name).append("=").append(value).append(" ");
            });
            request_ = std::move(told);
        }
    }
    void writeToSystemLog(int priority, std::string_view message) override { write(priority, "syslog", message); }

    void setLevel(int level) { level_ = level; }
    /// The lines since the last call.
    std::vector<LogLine> take() {
        const platform::MutexLock held(mutex_);
        return std::exchange(lines_, {});
    }
    /// The messages of the lines since the last call that `function` wrote at `level`.
    std::vector<std::string> take(int level, std::string_view function) {
        std::vector<std::string> messages;
        for (LogLine& line : take())
            if (line.level == level && line.function == function)
                messages.push_back(std::move(line.message));
        return messages;
    }

    /// The fields that a line since the last call told of the request that it belongs to: "NAME=VALUE " for each.
    std::string request() {
        const platform::MutexLock held(mutex_);
        return std::exchange(request_, {});
    }

private:
    std::atomic<int> level_;
    platform::Mutex mutex_;
    std::string request_ ZOR_GUARDED_BY(mutex_);
    std::vector<LogLine> lines_ ZOR_GUARDED_BY(mutex_);
};

/// An error's own line begins with the place where it was made; the rest of it.
inline std::string withoutSourceLine(const std::string& message) {
    const std::size_t digits = std::min(message.find_first_not_of("0123456789"), message.size());
    return digits > 0 && message.compare(digits, 2, ": ") == 0 ? message.substr(digits + 2) : message;
}

inline bool hasLine(const std::vector<LogLine>& lines, int level, std::string_view function, std::string_view message) {
    return std::ranges::any_of(lines, [&](const LogLine& line) {
        return line.level == level && line.function == function &&
               (line.message == message || withoutSourceLine(line.message) == message);
    });
}

} // namespace zor::support
