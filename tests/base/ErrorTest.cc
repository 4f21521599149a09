// SPDX-License-Identifier: Apache-2.0
// Error values and their one line, the level gate, the limit on provoked lines, and the boundary where exceptions end.
#include "base/ZORException.h"
#include "device/FileCrashAnnotation.h"
#include "os/LinuxDisk.h"
#include "os/Names.h"
#include "support/FileTree.h"
#include "support/RecordingLog.h"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor {
namespace {

using support::LogLine;

// One line exactly when it is asked for, with the place and the cause.
TEST(Error, IsLoggedOnceWhereItIsMade) {
    const ZORError cause = posixError({"rename", 7}, ENOENT, "rename of %s failed", "/a");
    support::RecordingLog sink(logLevelNotice);
    const Log log(sink);
    for (const LogFlag flag : {LogFlag::no, LogFlag::yes})
        for (const ZORError* underlying : {static_cast<const ZORError*>(nullptr), &cause})
            EXPECT_TRUE(makeError(log, {"operation", 42}, ErrorCode::moveToLiveFailed, underlying, flag, "moving %d", 5)
                            .is(ErrorCode::moveToLiveFailed));
    EXPECT_EQ(sink.take(), (std::vector<LogLine>{{3, "operation", "42: moving 5"},
                                                 {3, "operation", "42: moving 5 (POSIX 2 \"rename of /a failed\")"}}));
    const ZORError bare({"operation", 42}, ErrorDomain::zor, -3, std::nullopt);
    EXPECT_FALSE(bare.description());
    EXPECT_EQ(static_cast<std::uint64_t>(bare.replyCode()), 0xFFFF'FFFF'FFFF'FFFDU);
    EXPECT_EQ(posixError(ZOR_HERE, EPERM, "x").replyCode(), static_cast<ErrorCode>(EACCES)); // 1 would say success
    EXPECT_EQ(posixError(ZOR_HERE, EAGAIN, "x").replyCode(), static_cast<ErrorCode>(1000 + EAGAIN)); // 11 is a code
    EXPECT_EQ(posixError(ZOR_HERE, ENOTEMPTY, "x").replyCode(), static_cast<ErrorCode>(ENOTEMPTY));
    EXPECT_FALSE(cause.is(static_cast<ErrorCode>(2)));
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

class Build final : public platform::InternalBuildQuery {
public:
    explicit Build(bool internal) : internal_(internal) {}
    [[nodiscard]] bool isInternalBuild() const override { return internal_; }

private:
    const bool internal_;
};

class NoAnnotation final : public platform::CrashAnnotation {
public:
    void record(std::string_view) override { ADD_FAILURE() << "a crash was recorded"; }
};

// An exception becomes error 40 under the operation's name; anything that is none passes through.
TEST(ExceptionBoundary, TurnsExceptionsIntoError40) {
    support::RecordingLog sink(logLevelNotice);
    const Log log(sink);
    const Build build(false);
    NoAnnotation annotation;
    ExceptionBoundary boundary(log, build, annotation);

    const auto own = boundary.run({"lookup", 2}, []() -> Result<int> { throw ZORException("Range", "5 beyond 4"); });
    EXPECT_TRUE(!own && own.error().is(ErrorCode::exceptionCaught));
    const auto lines = sink.take(3, "lookup");
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_TRUE(lines[0].starts_with("2: Got exception: Range: 5 beyond 4 : ")) << lines[0];
    struct NoException {};
    EXPECT_THROW((void)boundary.run({"lookup", 4}, []() -> Result<int> { throw NoException(); }), NoException);
}

// On an internal build the process dies with the first report in its file: a child whose threads all fail at once.
TEST(ExceptionBoundary, AnInternalBuildAbortsWithTheFirstReport) {
    const support::TemporaryDirectory directory;
    const std::string logs = directory.path() + "/" + platform::names::logDirectory;
    std::filesystem::create_directories(logs);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        const struct rlimit noCore{};
        ::setrlimit(RLIMIT_CORE, &noCore);
        auto root = platform::SystemRoot::open(directory.path());
        platform::LinuxDisk disk(platform::Syncs::off);
        platform::FileCrashAnnotation annotation(*root, disk);
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        const Build build(true);
        ExceptionBoundary boundary(log, build, annotation);
        std::vector<std::jthread> threads;
        for (int i = 0; i < 4; ++i)
            threads.emplace_back([&] {
                ::pthread_setname_np(::pthread_self(), "worker");
                (void)boundary.run({"lookup", 1}, []() -> Result<int> { throw ZORException("Range", "5 beyond 4"); });
            });
        threads.clear();
        ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGABRT) << status;
    std::ifstream file(logs + "/" + platform::names::crashFile);
    const std::string report{std::istreambuf_iterator<char>(file), {}};
    EXPECT_TRUE(report.starts_with("** INTERNAL ERROR: Uncaught Exception **\n"
                                   "Exception: <worker> Range: 5 beyond 4\nStack:\n"))
        << report;
    EXPECT_EQ(report.find("INTERNAL ERROR", 5), std::string::npos) << "a second report was written";
}

} // namespace
} // namespace zor
