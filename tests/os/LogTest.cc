// SPDX-License-Identifier: Apache-2.0
#include "base/Log.h"
#include "base/ZORError.h"
#include "os/RotatingLog.h"
#include "plist/Text.h"
#include "support/Frames.h"
#include "support/TestRoot.h"

#include <csignal>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sstream>
#include <sys/resource.h>

namespace zor::platform {
namespace {

using support::TestRoot;

std::vector<std::string> linesOf(const std::string& text) {
    EXPECT_TRUE(text.empty() || text.ends_with('\n')) << "the last line has no end";
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);)
        lines.push_back(line);
    return lines;
}

/// Writes into "log", "log.1" and so on in a root of its own.
struct FileLog {
    using Foreground = RotatingLog::Foreground;
    FileLog(unsigned fileCount, std::size_t bytesMax, Foreground foreground = Foreground::no, int standardError = 2)
        : log(foreground, standardError) {
        EXPECT_TRUE(log.open("com.veltra.zorvaned", 5));
        log.enableDiskLogging(root.path("log"), fileCount, bytesMax);
    }
    void write(const std::string& message, int level = 3) { log.write(level, "f", message); }
    /// The text of one of the files.
    [[nodiscard]] std::string text(unsigned index = 0) const {
        return root.read(index == 0 ? "log" : "log." + std::to_string(index));
    }
    [[nodiscard]] std::vector<std::string> lines(unsigned index = 0) const { return linesOf(text(index)); }

    const TestRoot root;
    RotatingLog log;
};

// No string that a client gives can forge a line or steer a terminal.
TEST(LogLine, EscapesWhatIsNoText) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"plain text\twith a tab", "plain text\twith a tab"},
        {"two\nlines\r", "two\\nlines\\x0d"},
        {std::string("nul\0end", 7), "nul\\x00end"},
        {"\x1b[31m\x7f", "\\x1b[31m\\x7f"},
        {"caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80", "caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"},
        {"\xc2\x9b"
         "31m",
         "\\xc2\\x9b31m"},                                      // U+009B begins a terminal's control sequence
        {"a\u202Eb\u2069", "a\\xe2\\x80\\xaeb\\xe2\\x81\\xa9"}, // what turns the direction of writing
        {"\u2028\u2029\u0085", "\\xe2\\x80\\xa8\\xe2\\x80\\xa9\\xc2\\x85"},     // ends of lines
        {"a\u200Bb\u00AD\uFEFF", "a\\xe2\\x80\\x8bb\\xc2\\xad\\xef\\xbb\\xbf"}, // what is not seen
        {"\U000E0041", "\\xf3\\xa0\\x81\\x81"},
        {"\xff\xc3", "\\xff\\xc3"},                   // no UTF-8; a sequence that ends too early
        {"\xc0\x8a", "\\xc0\\x8a"},                   // an overlong newline
        {"\xed\xa0\x80", "\\xed\\xa0\\x80"},          // a surrogate
        {"\xf4\x90\x80\x80", "\\xf4\\x90\\x80\\x80"}, // beyond Unicode
    };
    for (const auto& [given, expected] : cases) {
        std::string line;
        plist::appendEscaped(line, given);
        EXPECT_EQ(line, expected);
    }
}

// A line has the form that tools read, never passes its bound, is whole below it, and cuts no character in two.
TEST(LogLine, IsCutAtItsBound) {
    std::string message;
    for (int i = 0; i < 20; ++i)
        message += "\xe2\x82\xac";
    const timespec time{.tv_sec = 1795515330, .tv_nsec = 123'999'999};
    const LogEvent event{.time = time, .pid = 42, .level = 5, .function = "main", .message = message};
    const std::string whole = formatLogLine(event, 1000);
    EXPECT_EQ(whole, "2026-11-24T10:15:30.123+00:00 zorvaned[42]: <5> main: " + message + "\n");
    for (std::size_t bound = 8; bound <= whole.size() + 2; ++bound) {
        const std::string line = formatLogLine(event, bound);
        EXPECT_LE(line.size(), bound);
        EXPECT_TRUE(plist::isUtf8(line)) << "a character was cut in two";
        EXPECT_TRUE(bound >= whole.size() ? line == whole : line.ends_with(" [cut]\n"));
    }
}

// Files stay within count and size, and together, oldest first, end with the newest lines without a gap.
TEST(RotatingLog, KeepsCountAndSize) {
    for (const unsigned fileCount : {1U, 2U, 4U}) {
        constexpr std::size_t bytesMax = 1000;
        FileLog log(fileCount, bytesMax);
        constexpr int linesWritten = 200;
        for (int i = 0; i < linesWritten; ++i)
            log.write("line " + std::to_string(i));
        std::vector<std::string> lines;
        for (unsigned index = fileCount; index-- > 0;) {
            const std::vector<std::string> ofFile = log.lines(index);
            EXPECT_FALSE(ofFile.empty());
            EXPECT_LE(log.text(index).size(), bytesMax);
            lines.insert(lines.end(), ofFile.begin(), ofFile.end());
        }
        EXPECT_EQ(log.text(fileCount), "");
        EXPECT_GT(lines.size(), (fileCount - 1) * 10);
        for (std::size_t i = 0; i < lines.size(); ++i)
            EXPECT_TRUE(lines[i].ends_with("line " + std::to_string(linesWritten - lines.size() + i))) << lines[i];
        EXPECT_EQ(log.log.linesLost(), 0U);
    }
}

// A log that exists is gone on with, and a link in its place is not followed.
TEST(RotatingLog, OpensOnlyAFileOfItsOwn) {
    FileLog log(1, 1000);
    log.write("old line");
    log.root.write("victim", "untouched");
    ASSERT_EQ(::symlink(log.root.path("victim").c_str(), log.root.path("linked").c_str()), 0);
    log.log.enableDiskLogging(log.root.path("linked"), 1, 1000);
    log.write("lost");
    EXPECT_EQ(log.root.read("victim"), "untouched");
    EXPECT_EQ(log.log.linesLost(), 1U);
    log.log.enableDiskLogging(log.root.path("log"), 1, 1000);
    log.write("new");
    ASSERT_EQ(log.lines().size(), 3U);
    EXPECT_TRUE(log.lines().front().ends_with("old line"));
}

// A full disk (the process's own limit, at every size within one line) costs lines, not the daemon, and leaves no half.
TEST(RotatingLog, SurvivesAFullDisk) {
    const auto ignored = std::signal(SIGXFSZ, SIG_IGN);
    rlimit old{};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &old), 0);
    for (rlim_t room = 0; room < 80; room += 7) {
        FileLog log(2, 100'000);
        log.write("before");
        const rlimit full{.rlim_cur = log.text().size() + room, .rlim_max = old.rlim_max};
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &full), 0);
        log.write(std::string(100, 'x'));
        log.write(std::string(100, 'x'));
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &old), 0);
        log.write("after");
        const auto lines = log.lines();
        ASSERT_EQ(lines.size(), 3U);
        EXPECT_TRUE(lines[0].ends_with("before"));
        EXPECT_TRUE(lines[1].contains("log: 2 log lines were lost: ")) << lines[1];
        EXPECT_TRUE(lines[2].ends_with("after"));
        EXPECT_EQ(log.log.linesLost(), 2U);
    }
    std::signal(SIGXFSZ, ignored);
}

// Standard error gets the whole line behind the prefix; a reader that has stopped costs lines there, not time.
TEST(RotatingLog, WritesToStandardErrorWithoutWaitingForever) {
    int ends[2] = {};
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const FileDescriptor reader(ends[0]);
    const FileDescriptor writer(ends[1]);
    FileLog log(1, 10'000'000, RotatingLog::Foreground::yes, writer.get());
    log.write("seen", 5);
    char buffer[512];
    const ssize_t bytes = ::read(reader.get(), buffer, sizeof buffer);
    ASSERT_GT(bytes, 0);
    EXPECT_EQ(std::string(buffer, static_cast<std::size_t>(bytes)), "<5>" + log.text());
    const auto begun = std::chrono::steady_clock::now();
    for (int i = 0; i < 3000; ++i)
        log.write("nobody reads this line of the log any more", 5);
    EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(5));
    EXPECT_EQ(log.lines().size(), 3001U);
}

// Goal: in the journal a line has its fields and a priority by which errors can be told from what clients do wrong, and
// it is said once. Method: a socket in the journal's place, a table of lines, and a pipe as standard error.
TEST(Journal, TellsErrorsFromWhatClientsDoWrong) {
    const TestRoot root;
    const FileDescriptor listening(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(support::bindTo(listening.get(), root.path("journal")));
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC | O_NONBLOCK), 0);
    const FileDescriptor reading(ends[0]);
    const FileDescriptor standardError(ends[1]);
    RotatingLog sink(RotatingLog::Foreground::yes, standardError.get(), Journal::at(root.path("journal")));
    ASSERT_TRUE(sink.open("com.veltra.zorvaned", 5));
    const Log log(sink);
    const std::function<void(const LogSubject::Take&)> request = [](const LogSubject::Take& take) {
        take("ZORVANE_IDENTIFIER", "a\nPRIORITY=0");
    };
    const std::tuple<std::optional<ErrorCode>, bool, const char*> rows[] = {
        {std::nullopt, false, "PRIORITY=3"},
        {std::nullopt, true, "PRIORITY=4"},
        {ErrorCode::notFound, true, "PRIORITY=5"},
        {ErrorCode::propertyListNotWritten, true, "PRIORITY=3"}};
    for (const auto& [code, isClients, priority] : rows) {
        std::optional<LogRequestScope> asked;
        if (isClients)
            asked.emplace(request);
        if (code)
            Reporter(log, "f").error({*code, 7}, "two\nlines");
        else
            log.write(3, "f", "two\nlines");
        char entry[1024];
        const ssize_t bytes = ::recv(listening.get(), entry, sizeof entry, MSG_DONTWAIT);
        ASSERT_GT(bytes, 0);
        const auto fields = linesOf({entry, static_cast<std::size_t>(bytes)});
        EXPECT_EQ(fields.front(), priority);
        EXPECT_EQ(fields.back(), code ? "MESSAGE=7: two\\nlines" : "MESSAGE=two\\nlines");
        EXPECT_EQ(std::ranges::count(fields, "ZORVANE_IDENTIFIER=a\\nPRIORITY=0"), isClients ? 1 : 0);
        EXPECT_EQ(std::ranges::count(fields, "CODE_FUNC=f"), 1);
    }
    char byte = 0;
    EXPECT_EQ(::read(reading.get(), &byte, 1), -1) << "said twice";
}

} // namespace
} // namespace zor::platform
