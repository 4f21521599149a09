// SPDX-License-Identifier: Apache-2.0
// Error values and their one line, the level gate, the limit on provoked lines, and the boundary where exceptions end.
#include "daemon/base/ZORException.h"
#include "platform/linux/FileCrashAnnotation.h"
#include "platform/linux/LinuxDisk.h"
#include "platform/linux/Names.h"
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
    const LogLine plain{3, "operation", "42: Failed to move 5"};
    const LogLine caused{3, "operation", plain.message + " (POSIX 2 \"rename of /a failed\")"};
    for (const bool hasCause : {false, true}) {
        for (const LogFlag flag : {LogFlag::no, LogFlag::yes}) {
            support::RecordingLog sink(logLevelNotice);
            const Log log(sink);
            const ZORError error = makeError(log, {"operation", 42}, ErrorCode::moveToLiveFailed,
                                             hasCause ? &cause : nullptr, flag, "Failed to move %d", 5);
            const std::vector<LogLine> lines{hasCause ? caused : plain};
            EXPECT_EQ(sink.take(), flag == LogFlag::yes ? lines : std::vector<LogLine>());
            EXPECT_TRUE(error.is(ErrorCode::moveToLiveFailed));
            EXPECT_EQ(error.replyCode(), static_cast<ErrorCode>(8));
            EXPECT_EQ(error.description(), "Failed to move 5");
            ASSERT_EQ(error.underlying() != nullptr, hasCause);
            EXPECT_TRUE(!hasCause || error.underlying()->isPosix(ENOENT));
        }
    }
    const ZORError bare({"operation", 42}, ErrorDomain::zor, -3, std::nullopt);
    EXPECT_FALSE(bare.description());
    EXPECT_EQ(static_cast<std::uint64_t>(bare.replyCode()), 0xFFFF'FFFF'FFFF'FFFDU);
    EXPECT_EQ(posixError(ZOR_HERE, EPERM, "x").replyCode(), static_cast<ErrorCode>(EACCES)); // 1 would say success
    EXPECT_FALSE(cause.is(static_cast<ErrorCode>(2)));
}

// Every handle state against every level; the arguments of a line that is not written are not evaluated.
TEST(Log, LevelGate) {
    struct Row {
        int handleLevel; // 0: no handle
        std::vector<int> written;
    };
    for (const Row& row : {Row{0, {3, 5}}, Row{3, {3}}, Row{5, {3, 5}}, Row{6, {3, 5}}, Row{7, {3, 5, 7}}}) {
        support::RecordingLog sink(row.handleLevel);
        const Log log(sink);
        std::vector<int> evaluated;
        const auto note = [&](int level) {
            evaluated.push_back(level);
            return level;
        };
        for (const int level : {3, 5, 7})
            ZOR_LOG(log, level, "level %d", note(level));
        std::vector<int> written;
        for (const LogLine& line : sink.take())
            written.push_back(line.level);
        EXPECT_EQ(written, row.written) << row.handleLevel;
        EXPECT_EQ(evaluated, row.written) << row.handleLevel;
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

    EXPECT_EQ(boundary.run({"lookup", 1}, []() -> Result<int> { return 7; }), 7);
    EXPECT_TRUE(sink.take().empty());
    const auto own = boundary.run({"lookup", 2}, []() -> Result<int> { throw ZORException("Range", "5 beyond 4"); });
    EXPECT_TRUE(!own && own.error().is(ErrorCode::exceptionCaught));
    const auto lines = sink.take(3, "lookup");
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_TRUE(lines[0].starts_with("2: Got exception: Range: 5 beyond 4 : ")) << lines[0];
    EXPECT_TRUE(lines[0].contains(", ")) << "no call stack: " << lines[0];
    const auto foreign = boundary.run({"lookup", 3}, []() -> Result<int> { return std::vector<int>().at(1); });
    EXPECT_TRUE(!foreign && foreign.error().is(ErrorCode::exceptionCaught));

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
