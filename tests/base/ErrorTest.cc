// SPDX-License-Identifier: Apache-2.0
// Error values and their one line, the level gate, the boundary where exceptions end, names that are encoded.
#include "base/Format.h"
#include "base/ZORError.h"
#include "device/FileCrashAnnotation.h"
#include "os/SystemRoot.h"
#include "support/RecordingLog.h"
#include "support/SettableRoles.h"
#include "support/TestRoot.h"
#include "support/Waiting.h"

#include <concepts>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>

namespace zor {
namespace {

using support::LogLine;

// One line exactly when it is asked for, with the place and the cause; a system's number never passes for a code.
TEST(Error, IsLoggedOnceWhereItIsMade) {
    const ZORError cause = posixError({"rename", 7}, Errno(ENOENT), "rename of %s failed", "/a");
    support::RecordingLog sink(logLevelNotice);
    const Log log(sink);
    for (const LogFlag flag : {LogFlag::no, LogFlag::yes})
        EXPECT_TRUE(makeError(log, {"operation", 42}, ErrorCode::moveToLiveFailed, &cause, flag, "moving %d", 5)
                        .is(ErrorCode::moveToLiveFailed));
    EXPECT_EQ(sink.take(), (std::vector<LogLine>{{3, "operation", "42: moving 5 (POSIX 2 \"rename of /a failed\")"}}));
    for (const auto& [number, code] : {std::pair(EPERM, EACCES), {EAGAIN, 1000 + EAGAIN}, {ENOTEMPTY, ENOTEMPTY}})
        EXPECT_EQ(posixError(ZOR_HERE, Errno(number), "x").replyCode(),
                  static_cast<ErrorCode>(code)); // 1 is success, 11 a code
    EXPECT_FALSE(cause.is(static_cast<ErrorCode>(2)));
}

template <typename T>
concept TakenForANumber = requires(T error) { -error; } || requires(T error) { error < 0; } ||
                          std::convertible_to<T, int> || std::convertible_to<T, bool>;
static_assert(!TakenForANumber<Errno>);

// An error is no number of any sign, and is handed on from whatever carries it to whatever can.
TEST(Error, NumberIsPositiveAndHandedOn) {
    const auto value = [](int number) { return number == 0 ? ErrnoOr<int>(7) : Errno(number); };
    const auto number = [&](int failure) -> Errno { return Errno(TRY(value(failure)) - 7); };
    const auto word = [&](int failure) -> ErrnoOr<std::string> { return std::to_string(TRY(value(failure))); };
    EXPECT_TRUE(!number(0) && number(ENOENT) == ENOENT && word(0).value() == "7" && word(EIO).error() == EIO);
    EXPECT_DEATH((void)Errno(-ENOENT), "");
}

// Every handle state (0: no handle) against every level; a line that is not written has its arguments not evaluated.
TEST(Log, LevelGate) {
    for (const auto& [handleLevel, written] : {std::pair(0, "35"), {3, "3"}, {5, "35"}, {6, "35"}, {7, "357"}}) {
        support::RecordingLog sink(handleLevel);
        const Log log(sink);
        std::string evaluated;
        for (const int level : {3, 5, 7})
            ZOR_LOG(log, level, "%s", (evaluated += std::to_string(level)).c_str());
        EXPECT_EQ(evaluated, written) << handleLevel;
        EXPECT_EQ(sink.take().size(), evaluated.size()) << handleLevel;
    }
}

// On an internal build the process dies with the first report in its file: a child whose threads all fail at once.
TEST(ExceptionBoundary, AnInternalBuildAbortsWithTheFirstReport) {
    const support::TestRoot root;
    const std::string file = std::string(platform::names::logDirectory) + "/" + platform::names::crashFile;
    root.makeDirectories(platform::names::logDirectory);
    const pid_t child = ::fork();
    if (child == 0) {
        const rlimit noCore{};
        ::setrlimit(RLIMIT_CORE, &noCore);
        platform::FileCrashAnnotation annotation(root.root(), root.disk());
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        const support::SettableBuild build(true);
        ExceptionBoundary boundary(log, build, annotation);
        support::inThreads(4, [&](unsigned) {
            ::pthread_setname_np(::pthread_self(), "worker");
            (void)boundary.run({"lookup", 1}, []() -> Result<int> { throw ZORException("Range", "5 beyond 4"); });
        });
        ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGABRT) << status;
    const std::string report = root.read(file);
    EXPECT_TRUE(report.starts_with("** INTERNAL ERROR: Uncaught Exception **\n"
                                   "Exception: <worker> Range: 5 beyond 4\nStack:\n"))
        << report;
    EXPECT_EQ(report.find("INTERNAL ERROR", 5), std::string::npos) << "a second report was written";
}

// Any string is one visible path component, and no two are the same.
TEST(PercentEncoding, IsOneComponentAndReversible) {
    const std::pair<std::string, const char*> cases[] = {{"com.App-1_b", "com.App-1_b"},
                                                         {"..", "%2E."},
                                                         {"a/b", "a%2Fb"},
                                                         {"%2E", "%252E"},
                                                         {"\xc3\xa9", "%C3%A9"},
                                                         {"a b\n", "a%20b%0A"},
                                                         {std::string("\0", 1), "%00"}};
    for (const auto& [text, encoded] : cases) {
        EXPECT_EQ(platform::percentEncode(text), encoded);
        EXPECT_EQ(platform::percentDecode(encoded), text);
    }
    for (const char* wrong : {"%", "%2", "%2e", "%GG", ".x", "a/b", "%41", "a b"})
        EXPECT_EQ(platform::percentDecode(wrong), std::nullopt) << wrong;
}

} // namespace
} // namespace zor
