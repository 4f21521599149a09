// SPDX-License-Identifier: Apache-2.0
#include "platform/RefusalLimiter.h"
#include "platform/TestRoot.h"
#include "platform/linux/LogLine.h"
#include "platform/linux/RotatingLog.h"
#include "plist/EscapedText.h"

#include <csignal>
#include <map>
#include <poll.h>
#include <sys/resource.h>
#include <vector>

namespace zor::platform {
namespace {

std::vector<std::string> linesOf(const std::string& text) {
    std::vector<std::string> lines;
    std::size_t begin = 0;
    for (std::size_t end = text.find('\n'); end != std::string::npos; end = text.find('\n', begin)) {
        lines.push_back(text.substr(begin, end - begin));
        begin = end + 1;
    }
    EXPECT_EQ(begin, text.size()) << "the last line has no end";
    return lines;
}

// Goal: no string that a client gives can forge a line or steer a terminal. Method: one row for each kind of byte.
TEST(LogLine, EscapesWhatIsNoText) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"plain text\twith a tab", "plain text\twith a tab"},
        {"two\nlines\r", "two\\nlines\\x0d"},
        {std::string("nul\0end", 7), "nul\\x00end"},
        {"\x1b[31m\x7f", "\\x1b[31m\\x7f"},
        {"caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80", "caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"},
        {"\xc2\x9b"
         "31m",
         "\\xc2\\x9b31m"},                            // U+009B begins a terminal's control sequence
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

TEST(LogLine, HasTheFormThatToolsRead) {
    const LogEvent event{.time = {.tv_sec = 1795515330, .tv_nsec = 123'999'999},
                         .pid = 42,
                         .level = 5,
                         .function = "main",
                         .message = "hello"};
    EXPECT_EQ(formatLogLine(event, 1000), "2026-11-24T10:15:30.123+00:00 zorvaned[42]: <5> main: hello\n");
}

// Goal: a line never passes its bound, and is whole below it. Method: every bound around the length, with a message
// whose characters take three bytes.
TEST(LogLine, IsCutAtItsBound) {
    std::string message;
    for (int i = 0; i < 20; ++i)
        message += "\xe2\x82\xac";
    const LogEvent event{.time = {}, .pid = 1, .level = 3, .function = "f", .message = message};
    const std::string whole = formatLogLine(event, 1000);
    for (std::size_t bound = 8; bound <= whole.size() + 2; ++bound) {
        const std::string line = formatLogLine(event, bound);
        EXPECT_LE(line.size(), bound);
        EXPECT_EQ(line.back(), '\n');
        std::string again;
        plist::appendEscaped(again, std::string_view(line).substr(0, line.size() - 1));
        EXPECT_EQ(again + "\n", line) << "a character was cut in two";
        if (bound >= whole.size()) {
            EXPECT_EQ(line, whole);
        } else {
            EXPECT_TRUE(line.ends_with(" [cut]\n"));
        }
    }
}

// Goal: files stay within count and size, and lines stay whole and in order. Method: many lines into several
// configurations; the files together, oldest first, end with the newest lines without a gap.
TEST(RotatingLog, KeepsCountAndSize) {
    for (const unsigned fileCount : {1U, 2U, 4U}) {
        const TestRoot root;
        RotatingLog log(RotatingLog::Foreground::no);
        constexpr std::size_t bytesMax = 1000;
        ASSERT_TRUE(log.open("com.veltra.zorvaned", 5));
        log.enableDiskLogging(root.path("log"), fileCount, bytesMax);
        constexpr int linesWritten = 200;
        for (int i = 0; i < linesWritten; ++i)
            log.write(3, "test", "line " + std::to_string(i));
        std::vector<std::string> lines;
        for (unsigned index = fileCount; index-- > 0;) {
            const std::string text = root.read(index == 0 ? "log" : "log." + std::to_string(index));
            EXPECT_LE(text.size(), bytesMax);
            EXPECT_FALSE(text.empty());
            for (std::string& line : linesOf(text))
                lines.push_back(std::move(line));
        }
        EXPECT_NE(::access(root.path("log." + std::to_string(fileCount)).c_str(), F_OK), 0);
        EXPECT_GT(lines.size(), (fileCount - 1) * 10);
        for (std::size_t i = 0; i < lines.size(); ++i)
            EXPECT_TRUE(lines[i].ends_with("line " + std::to_string(linesWritten - lines.size() + i))) << lines[i];
        EXPECT_EQ(log.linesLost(), 0U);
    }
}

// Goal: a log that exists is gone on with, and a link in its place is not followed.
TEST(RotatingLog, OpensOnlyAFileOfItsOwn) {
    const TestRoot root;
    root.write("log", "old line\n");
    root.write("victim", "untouched");
    RotatingLog log(RotatingLog::Foreground::no);
    ASSERT_TRUE(log.open("n", 5));
    log.enableDiskLogging(root.path("log"), 1, 1000);
    log.write(3, "f", "new");
    EXPECT_EQ(linesOf(root.read("log")).size(), 2U);
    EXPECT_EQ(linesOf(root.read("log")).front(), "old line");
    ASSERT_EQ(::symlink(root.path("victim").c_str(), root.path("linked").c_str()), 0);
    log.enableDiskLogging(root.path("linked"), 1, 1000);
    log.write(3, "f", "lost");
    EXPECT_EQ(root.read("victim"), "untouched");
    EXPECT_EQ(log.linesLost(), 1U);
}

// Goal: a full disk costs lines, not the daemon, and leaves no half line. Method: the process's own file-size limit
// stands for the full disk, at every size within one line.
TEST(RotatingLog, SurvivesAFullDisk) {
    const auto ignored = std::signal(SIGXFSZ, SIG_IGN);
    rlimit old{};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &old), 0);
    for (rlim_t room = 0; room < 80; room += 7) {
        const TestRoot root;
        RotatingLog log(RotatingLog::Foreground::no);
        ASSERT_TRUE(log.open("n", 5));
        log.enableDiskLogging(root.path("log"), 2, 100'000);
        log.write(3, "f", "before");
        const rlimit full{.rlim_cur = root.read("log").size() + room, .rlim_max = old.rlim_max};
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &full), 0);
        const std::string message(100, 'x');
        log.write(3, "f", message);
        log.write(3, "f", message);
        ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &old), 0);
        log.write(3, "f", "after");
        const auto lines = linesOf(root.read("log"));
        ASSERT_EQ(lines.size(), 3U);
        EXPECT_TRUE(lines[0].ends_with("before"));
        EXPECT_NE(lines[1].find("log: 2 log lines were lost: "), std::string::npos) << lines[1];
        EXPECT_TRUE(lines[2].ends_with("after"));
        EXPECT_EQ(log.linesLost(), 2U);
    }
    std::signal(SIGXFSZ, ignored);
}

// Goal: standard error gets the whole line behind the prefix; a reader that has stopped costs lines there, not time.
TEST(RotatingLog, WritesToStandardErrorWithoutWaitingForever) {
    const TestRoot root;
    int ends[2] = {};
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const FileDescriptor reader(ends[0]);
    const FileDescriptor writer(ends[1]);
    RotatingLog log(RotatingLog::Foreground::yes, writer.get());
    ASSERT_TRUE(log.open("n", 5));
    log.enableDiskLogging(root.path("log"), 1, 10'000'000);
    log.write(5, "f", "seen");
    char buffer[512];
    const ssize_t bytes = ::read(reader.get(), buffer, sizeof buffer);
    ASSERT_GT(bytes, 0);
    EXPECT_EQ(std::string(buffer, static_cast<std::size_t>(bytes)), "<5>" + root.read("log"));
    const auto begun = std::chrono::steady_clock::now();
    for (int i = 0; i < 3000; ++i)
        log.write(5, "f", "nobody reads this line of the log any more");
    EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(5));
    EXPECT_EQ(linesOf(root.read("log")).size(), 3001U);
}

// Goal: lines of many threads are whole, none is lost, while files rotate. Method: count them in all files.
TEST(RotatingLog, SerialisesThreads) {
    const TestRoot root;
    RotatingLog log(RotatingLog::Foreground::no);
    ASSERT_TRUE(log.open("n", 5));
    log.enableDiskLogging(root.path("log"), 4, 20'000);
    constexpr int threadCount = 4;
    constexpr int linesEach = 200;
    std::vector<std::thread> threads;
    for (int t = 0; t < threadCount; ++t)
        threads.emplace_back([&log, t] {
            for (int i = 0; i < linesEach; ++i)
                log.write(3, "f", "thread " + std::to_string(t) + " line " + std::to_string(i) + ".");
        });
    for (std::thread& thread : threads)
        thread.join();
    std::size_t lines = 0;
    for (const char* name : {"log", "log.1", "log.2", "log.3"}) {
        for (const std::string& line : linesOf(root.read(name))) {
            EXPECT_TRUE(line.ends_with(".") && line.find("thread ") != std::string::npos) << line;
            ++lines;
        }
    }
    EXPECT_EQ(lines, static_cast<std::size_t>(threadCount * linesEach));
}

// Goal: each user has so many lines a second, what is left out is told exactly once, and many users take no more memory
// than the table. Method: a clock of the test's own.
TEST(RefusalLimiter, CountsWhatItLeavesOut) {
    RefusalLimiter::Clock::time_point now{};
    std::map<uid_t, std::uint64_t> reported;
    RefusalLimiter limiter([&](uid_t uid, std::uint64_t count) { reported[uid] += count; }, [&] { return now; });
    const auto admitted = [&](uid_t uid, int attempts) {
        int count = 0;
        for (int i = 0; i < attempts; ++i)
            count += limiter.admit(uid) ? 1 : 0;
        return count;
    };
    EXPECT_EQ(admitted(501, 1000), 200);
    EXPECT_EQ(admitted(502, 150), 150);
    EXPECT_TRUE(reported.empty());
    now += std::chrono::seconds(1);
    EXPECT_EQ(admitted(502, 1), 1);
    EXPECT_EQ(reported, (std::map<uid_t, std::uint64_t>{{501, 800}}));
    EXPECT_EQ(admitted(501, 300), 200);
    limiter.reportAll(); // somebody looks before the second is over
    limiter.reportAll();
    EXPECT_EQ(reported[501], 900U);
    EXPECT_EQ(admitted(501, 1), 0) << "looking gives no new lines";
    now += std::chrono::seconds(2);
    // More users than places, within one second: the count of whoever has to go is told.
    EXPECT_EQ(admitted(1, 201), 200);
    reported.clear();
    now += std::chrono::milliseconds(1);
    for (uid_t uid = 1000; uid < 1000 + RefusalLimiter::usersMax; ++uid)
        EXPECT_TRUE(limiter.admit(uid));
    EXPECT_EQ(reported, (std::map<uid_t, std::uint64_t>{{1, 1}}));
}

} // namespace
} // namespace zor::platform
