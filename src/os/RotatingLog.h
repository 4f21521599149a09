// SPDX-License-Identifier: Apache-2.0
// The daemon's log: one file of bounded size, or a few of them in rotation, and standard error beside it or in its
// place. Under a service manager that leads standard error to the system journal, each line goes there, too.
//
// Invariants: a file never grows beyond its size; a line is one write(2) and lies in one file; a line that could not be
// written whole leaves nothing behind (it is counted, and the next one that can be written is preceded by one that says
// how many were lost, and why). Only this process writes to the files: it holds the lock of its root. Any thread; lines
// of different threads follow one another.
//
// The path is used once, to open its directory, which is root's; from then on names are taken in that directory. These
// changes do not go through Disk: the log is to tell what happened when a disk call fails, and nothing is recovered
// from it.
#pragma once

#include "base/Mutex.h"
#include "os/FileDescriptor.h"
#include "os/ServiceManager.h"
#include "platform/Errno.h"
#include "platform/Process.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace zor::platform {

class RotatingLog final : public PlatformLog {
public:
    /// `yes`: every line also goes to standard error.
    enum class Foreground { no, yes };
    /// A line that the journal takes is not written to standard error, which it would read, too.
    explicit RotatingLog(Foreground foreground, int standardError = 2)
        : RotatingLog(foreground, standardError, Journal::ofEnvironment(standardError)) {}
    RotatingLog(Foreground foreground, int standardError, Journal journal);

    bool open(std::string_view name, int level) override;
    [[nodiscard]] bool isOpen() const override { return open_.load(std::memory_order_acquire); }
    [[nodiscard]] int level() const override { return level_.load(std::memory_order_relaxed); }
    void enableDiskLogging(const std::string& path, unsigned fileCount, std::size_t fileBytesMax) override;
    void write(int level, std::string_view function, std::string_view message) override;
    void writeToSystemLog(int priority, std::string_view message) override;

    /// Lines that did not reach the file since the start.
    [[nodiscard]] std::uint64_t linesLost() const { return linesLost_.load(std::memory_order_relaxed); }

private:
    [[nodiscard]] bool haveFile() ZOR_REQUIRES(mutex_);
    void openFile() ZOR_REQUIRES(mutex_);
    void rotate() ZOR_REQUIRES(mutex_);
    [[nodiscard]] std::string fileName(unsigned index) const ZOR_REQUIRES(mutex_);
    void writeToFile(const std::string& line) ZOR_REQUIRES(mutex_);
    /// Whether the line is there.
    bool writeToJournal(int level, std::string_view function, std::string_view message) const;
    void sayNoFile(const std::string& path) const ZOR_REQUIRES(mutex_);
    /// False, and `error_` says why, when nothing of the line is in the file.
    [[nodiscard]] bool append(const std::string& line) ZOR_REQUIRES(mutex_);
    void lose() ZOR_REQUIRES(mutex_);
    void writeToStandardError(int level, const std::string& line) ZOR_REQUIRES(mutex_);
    [[nodiscard]] std::string format(int level, std::string_view function, std::string_view message) const
        ZOR_REQUIRES(mutex_);

    const Foreground foreground_;
    const int standardError_;
    const Journal journal_;
    std::atomic<bool> open_{false};
    std::atomic<int> level_{0};
    std::atomic<std::uint64_t> linesLost_{0};

    Mutex mutex_;
    FileDescriptor directory_ ZOR_GUARDED_BY(mutex_);
    std::string baseName_ ZOR_GUARDED_BY(mutex_);
    unsigned fileCount_ ZOR_GUARDED_BY(mutex_) = 1;
    std::size_t fileBytesMax_ ZOR_GUARDED_BY(mutex_) = 0;
    FileDescriptor file_ ZOR_GUARDED_BY(mutex_);
    std::size_t fileBytes_ ZOR_GUARDED_BY(mutex_) = 0;
    /// Lines lost since the last one that was written, and the errno of the last loss.
    std::uint64_t lostUnsaid_ ZOR_GUARDED_BY(mutex_) = 0;
    Errno error_ ZOR_GUARDED_BY(mutex_);
    /// When a file that could not be opened is tried again, in seconds of the monotonic clock.
    std::int64_t openAgainAt_ ZOR_GUARDED_BY(mutex_) = 0;
    /// The reader of standard error has stopped reading; lines are left out there until it goes on.
    bool standardErrorStalled_ ZOR_GUARDED_BY(mutex_) = false;
};

// The form of one log line: 2026-11-24T10:15:30.123+00:00 zorvaned[PID]: <LEVEL> FUNCTION: MESSAGE
//
// One event is one line, whatever a client put into a string that the message quotes. Any thread.

struct LogEvent {
    timespec time{};
    pid_t pid = 0;
    int level = 0;
    std::string_view function;
    std::string_view message;
};

/// The whole line with its newline, at most `bytesMax` long: what is too much is cut off at the end, and the line says
/// so.
[[nodiscard]] std::string formatLogLine(const LogEvent& event, std::size_t bytesMax);

} // namespace zor::platform
