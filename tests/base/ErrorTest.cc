// SPDX-License-Identifier: Apache-2.0
// Error values and their one line, the boundary where exceptions end.
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
    const Reporter report(log, "operation");
    const CodeOfLine failed{ErrorCode::moveToLiveFailed, 42};
    EXPECT_TRUE(report.unlogged(failed, "moving %d", 5).is(ErrorCode::moveToLiveFailed));
    EXPECT_TRUE(report.error(failed, &cause, "moving %d", 5).is(ErrorCode::moveToLiveFailed));
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

} // namespace
} // namespace zor
