// SPDX-License-Identifier: Apache-2.0
#include "os/RotatingLog.h"

#include "base/Log.h"
#include "plist/Text.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

namespace zor::platform {

namespace {

/// A stack in a report takes some kilobytes; what is longer is no line that somebody reads.
constexpr std::size_t lineBytesMax = 64 * 1024;
/// Readable for root and its group: the lines quote identifiers and paths of all users.
constexpr mode_t fileMode = 0640;
constexpr int standardErrorPatienceMilliseconds = 1000;

std::int64_t monotonicSeconds() {
    timespec now{};
    ::clock_gettime(CLOCK_MONOTONIC, &now);
    return now.tv_sec;
}

} // namespace

RotatingLog::RotatingLog(Foreground foreground, int standardError, Journal journal)
    : foreground_(foreground), standardError_(standardError), journal_(std::move(journal)) {}

bool RotatingLog::open(std::string_view name, int level) {
    if (name.empty())
        return false;
    level_.store(level, std::memory_order_relaxed);
    open_.store(true, std::memory_order_release);
    return true;
}

void RotatingLog::enableDiskLogging(const std::string& path, unsigned fileCount, std::size_t fileBytesMax) {
    const MutexLock lock(mutex_);
    const std::size_t slash = path.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    baseName_ = slash == std::string::npos ? path : path.substr(slash + 1);
    fileCount_ = std::max(fileCount, 1U);
    fileBytesMax_ = fileBytesMax;
    file_.reset();
    openAgainAt_ = 0;
    directory_.reset(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!directory_.valid())
        error_ = Errno::last();
    else
        openFile();
    if (!file_.valid())
        sayNoFile(path);
}

void RotatingLog::sayNoFile(const std::string& path) const {
    const std::string text = formatted("Failed to open the log file %s: %s", path.c_str(), error_.text());
    if (!writeToJournal(LOG_ERR, "log", text))
        ::syslog(LOG_DAEMON | LOG_ERR, "%s", text.c_str());
}

void RotatingLog::write(int level, std::string_view function, std::string_view message) {
    const MutexLock lock(mutex_);
    const std::string line = format(level, function, message);
    const bool inFile = open_.load(std::memory_order_relaxed) && directory_.valid();
    if (inFile)
        writeToFile(line);
    const bool inJournal = writeToJournal(level, function, message);
    if (!inJournal && (!inFile || foreground_ == Foreground::yes))
        writeToStandardError(level, line);
}

bool RotatingLog::writeToJournal(int level, std::string_view function, std::string_view message) const {
    return journal_.isConnected() &&
           journal_.write({.level = level, .function = function, .message = message.substr(0, lineBytesMax)});
}

void RotatingLog::writeToSystemLog(int priority, std::string_view message) {
    if (writeToJournal(LOG_PRI(priority), "log", message))
        return;
    std::string text;
    plist::appendEscaped(text, message.substr(0, lineBytesMax));
    ::syslog(LOG_DAEMON | LOG_PRI(priority), "%s", text.c_str());
    if (foreground_ == Foreground::yes) {
        const MutexLock lock(mutex_);
        writeToStandardError(priority, text + "\n");
    }
}

std::string RotatingLog::format(int level, std::string_view function, std::string_view message) const {
    LogEvent event{.pid = ::getpid(), .level = level, .function = function, .message = message};
    ::clock_gettime(CLOCK_REALTIME, &event.time);
    return formatLogLine(event, fileBytesMax_ == 0 ? lineBytesMax : std::min(fileBytesMax_, lineBytesMax));
}

std::string RotatingLog::fileName(unsigned index) const {
    return index == 0 ? baseName_ : baseName_ + "." + std::to_string(index);
}

bool RotatingLog::haveFile() {
    if (!file_.valid() && monotonicSeconds() >= openAgainAt_)
        openFile();
    return file_.valid();
}

void RotatingLog::openFile() {
    openAgainAt_ = monotonicSeconds() + 1;
    constexpr int flags = O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
    FileDescriptor file(::openat(directory_.get(), baseName_.c_str(), flags, fileMode));
    struct stat status{};
    if (!file.valid() || ::fstat(file.get(), &status) != 0) {
        error_ = Errno::last();
        return;
    }
    if (!S_ISREG(status.st_mode)) {
        error_ = Errno(EINVAL);
        return;
    }
    file_ = std::move(file);
    fileBytes_ = static_cast<std::size_t>(status.st_size);
}

void RotatingLog::rotate() {
    if (fileCount_ == 1) {
        if (::ftruncate(file_.get(), 0) == 0)
            fileBytes_ = 0;
        else
            error_ = Errno::last();
        return;
    }
    for (unsigned index = fileCount_ - 1; index > 0; --index) {
        const std::string from = fileName(index - 1);
        const std::string to = fileName(index);
        if (::renameat(directory_.get(), from.c_str(), directory_.get(), to.c_str()) != 0 && errno != ENOENT) {
            error_ = Errno::last();
            return;
        }
    }
    file_.reset();
    openFile();
}

void RotatingLog::writeToFile(const std::string& line) {
    if (!haveFile()) {
        lose();
        return;
    }
    if (lostUnsaid_ > 0) {
        if (!append(format(LOG_ERR, "log",
                           formatted("%llu log lines were lost: %s", static_cast<unsigned long long>(lostUnsaid_),
                                     error_.text())))) {
            lose();
            return;
        }
        lostUnsaid_ = 0;
    }
    if (!append(line))
        lose();
}

bool RotatingLog::append(const std::string& line) {
    if (fileBytes_ + line.size() > fileBytesMax_ && fileBytes_ > 0)
        rotate();
    if (!file_.valid() || fileBytes_ + line.size() > fileBytesMax_)
        return false;
    for (;;) {
        const ssize_t written = ::write(file_.get(), line.data(), line.size());
        if (written == static_cast<ssize_t>(line.size())) {
            fileBytes_ += line.size();
            return true;
        }
        if (written < 0 && errno == EINTR)
            continue;
        error_ = written < 0 ? Errno::last() : Errno(ENOSPC);
        // Half a line would be glued to the next one.
        if (written > 0 && ::ftruncate(file_.get(), static_cast<off_t>(fileBytes_)) != 0)
            fileBytes_ += static_cast<std::size_t>(written);
        return false;
    }
}

void RotatingLog::lose() {
    ++lostUnsaid_;
    linesLost_.fetch_add(1, std::memory_order_relaxed);
}

void RotatingLog::writeToStandardError(int level, const std::string& line) {
    const std::string whole = "<" + std::to_string(level) + ">" + line;
    // A pipe or a socket that says it is writable takes PIPE_BUF bytes without blocking.
    for (std::size_t done = 0; done < whole.size();) {
        pollfd ready{.fd = standardError_, .events = POLLOUT, .revents = 0};
        const int count = ::poll(&ready, 1, standardErrorStalled_ ? 0 : standardErrorPatienceMilliseconds);
        if (count < 0 && errno == EINTR)
            continue;
        standardErrorStalled_ = count <= 0;
        if (count <= 0)
            return;
        const std::size_t bytes = std::min<std::size_t>(whole.size() - done, PIPE_BUF);
        const ssize_t written = ::write(standardError_, whole.data() + done, bytes);
        if (written < 0 && errno == EINTR)
            continue;
        if (written <= 0)
            return;
        done += static_cast<std::size_t>(written);
    }
}

using plist::appendEscaped;

namespace {

constexpr std::string_view cutMark = " [cut]\n";

unsigned char byteAt(std::string_view text, std::size_t position) {
    return static_cast<unsigned char>(text[position]);
}

} // namespace

std::string formatLogLine(const LogEvent& event, std::size_t bytesMax) {
    tm calendar{};
    ::gmtime_r(&event.time.tv_sec, &calendar);
    char head[96];
    std::snprintf(head, sizeof head, "%04d-%02d-%02dT%02d:%02d:%02d.%03ld+00:00 zorvaned[%d]: <%d> ",
                  calendar.tm_year + 1900, calendar.tm_mon + 1, calendar.tm_mday, calendar.tm_hour, calendar.tm_min,
                  calendar.tm_sec, event.time.tv_nsec / 1'000'000, static_cast<int>(event.pid), event.level);
    std::string line = head;
    line.reserve(line.size() + event.function.size() + event.message.size() + 3);
    appendEscaped(line, event.function);
    line += ": ";
    // No escape is shorter than what it stands for, so the rest cannot reach the line.
    appendEscaped(line, event.message.substr(0, bytesMax));
    if (line.size() < bytesMax && event.message.size() <= bytesMax) {
        line += '\n';
        return line;
    }
    std::size_t kept = bytesMax > cutMark.size() ? bytesMax - cutMark.size() : 0;
    kept = kept < line.size() ? kept : line.size();
    while (kept > 0 && kept < line.size() && (byteAt(line, kept) & 0xC0) == 0x80)
        --kept;
    line.resize(kept);
    line += cutMark;
    return line;
}

} // namespace zor::platform
