// SPDX-License-Identifier: Apache-2.0
// zorvane-bench: measures the daemon that lies beside it against bare floors, in one run on one machine.
//
// Two processes: this one makes the place to work in, waits for the other, which measures, and cleans up after it
// however it ended. A run that takes too long is ended.
#include "Benchmarks.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <getopt.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

using namespace zor::bench;

constexpr int usageExitStatus = 2;
constexpr int runSecondsMax = 1800;

constexpr const char* help =
    R"(Usage: zorvane-bench [--quick] [--only NAME] [--json FILE]

Measures the daemon beside this program and prints each figure with its goal.

  --quick       fewer repetitions and smaller stores; under a minute
  --only NAME   one group: lookup, registration, throughput, upcall, create, class,
                protection, boot, tree, replace, busy, beside,
                install, start, endurance, run
  --json FILE   write the figures to FILE, too

As root it measures on file systems made for the run; others use a directory.
)";

struct Options {
    bool quick = false;
    std::string only{};
    std::string json{};
};

struct Group {
    const char* name;
    std::vector<Figure> (*measure)(const Settings&);
};
constexpr Group groups[] = {
    {"lookup", measureLookup},
    {"registration", measureRegistration},
    {"throughput", measureThroughput},
    {"upcall", measureUpcall},
    {"create", measureCreate},
    {"class", measureClass},
    {"protection", measureProtection},
    {"boot", measureBoot},
    {"tree", measureTree},
    {"replace", measureReplace},
    {"busy", measureBusy},
    {"beside", measureBeside},
    {"install", measureInstall},
    {"start", measureStart},
    {"endurance", measureEndurance},
    {"run", measureRun},
};

[[noreturn]] void endWithUsage(const std::string& what) {
    std::fprintf(stderr, "zorvane-bench: %s\nTry 'zorvane-bench --help'.\n", what.c_str());
    std::exit(usageExitStatus);
}

Options parse(int argumentCount, char** arguments) {
    static constexpr option known[] = {{"quick", no_argument, nullptr, 'q'},
                                       {"only", required_argument, nullptr, 'o'},
                                       {"json", required_argument, nullptr, 'j'},
                                       {"help", no_argument, nullptr, 'h'},
                                       {nullptr, 0, nullptr, 0}};
    Options options;
    for (int next; (next = ::getopt_long(argumentCount, arguments, "", known, nullptr)) != -1;) {
        if (next == 'q') {
            options.quick = true;
        } else if (next == 'o') {
            options.only = optarg;
        } else if (next == 'j') {
            options.json = optarg;
        } else if (next == 'h') {
            std::fputs(help, stdout);
            std::exit(0);
        } else {
            std::exit(usageExitStatus);
        }
    }
    if (optind < argumentCount)
        endWithUsage(std::string("unexpected argument '") + arguments[optind] + "'");
    bool isGroup = options.only.empty();
    for (const Group& group : groups)
        isGroup = isGroup || options.only == group.name;
    if (!isGroup)
        endWithUsage("no group is called '" + options.only + "'");
    return options;
}

std::string ownProgram() {
    char path[4096];
    const ssize_t length = ::readlink("/proc/self/exe", path, sizeof path);
    if (length <= 0)
        failWithErrno("/proc/self/exe");
    return {path, static_cast<std::size_t>(length)};
}

/// Measures and reports; the exit status.
int measure(const Options& options, const Settings& settings) {
    const Machine machine = Machine::here();
    std::vector<Figure> figures;
    const auto begin = Clock::now();
    for (const Group& group : groups) {
        if (!options.only.empty() && options.only != group.name)
            continue;
        std::fprintf(stderr, "zorvane-bench: %s\n", group.name);
        for (Figure& figure : group.measure(settings))
            figures.push_back(std::move(figure));
    }
    printTable(machine, figures);
    std::printf("\nThe run took %.0f s.%s\n", secondsSince(begin),
                options.quick ? " A quick one: its figures are rough." : "");
    return options.json.empty() || writeJson(options.json, machine, options.quick, figures) ? 0 : 1;
}

/// Runs in the process that measures.
int measureAndReport(const Options& options, const Settings& settings) {
    try {
        return measure(options, settings);
    } catch (const std::exception& failure) {
        std::fprintf(stderr, "zorvane-bench: %s\n", failure.what());
        return 1;
    }
}

/// Waits for the measuring process; a signal to this one, or too long a time, ends it. Its exit status.
int watch(pid_t measuring, const sigset_t& signals) {
    ::alarm(runSecondsMax);
    for (;;) {
        const int signal = ::sigwaitinfo(&signals, nullptr);
        int status = 0;
        if (signal == SIGCHLD) {
            if (::waitpid(measuring, &status, WNOHANG) == measuring)
                return WIFEXITED(status) ? WEXITSTATUS(status) : 1;
            continue;
        }
        if (signal < 0 && errno == EINTR)
            continue;
        std::fprintf(stderr, "zorvane-bench: %s\n", signal == SIGALRM ? "this takes too long" : "ended by a signal");
        ::kill(measuring, SIGKILL);
        ::waitpid(measuring, &status, 0);
        return 1;
    }
}

int run(const Options& options) {
    Settings settings;
    settings.quick = options.quick;
    settings.ownProgram = ownProgram();
    const std::string folder = settings.ownProgram.substr(0, settings.ownProgram.rfind('/'));
    settings.daemonProgram = folder + "/zorvaned";
    if (::access(settings.daemonProgram.c_str(), X_OK) != 0)
        failWithErrno(settings.daemonProgram);
    separateMounts();
    const Scratch scratch(folder.substr(0, folder.rfind('/')) + "/bench-scratch");
    settings.scratch = &scratch;

    sigset_t signals;
    sigset_t before;
    sigemptyset(&signals);
    for (const int signal : {SIGCHLD, SIGALRM, SIGINT, SIGTERM, SIGHUP})
        sigaddset(&signals, signal);
    ::sigprocmask(SIG_BLOCK, &signals, &before);
    // Everything that the measuring process leaves running becomes this one's to wait for.
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
    std::fflush(nullptr);
    const pid_t measuring = ::fork();
    if (measuring < 0)
        failWithErrno("fork");
    if (measuring == 0) {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        ::sigprocmask(SIG_SETMASK, &before, nullptr);
        const int status = measureAndReport(options, settings);
        std::fflush(nullptr);
        ::_exit(status);
    }
    const int status = watch(measuring, signals);
    while (::waitpid(-1, nullptr, 0) > 0 || errno == EINTR) {
    }
    return status;
}

} // namespace

int main(int argumentCount, char** arguments) {
    const Options options = parse(argumentCount, arguments);
    ::umask(022);
    try {
        return run(options);
    } catch (const std::exception& failure) {
        std::fprintf(stderr, "zorvane-bench: %s\n", failure.what());
        return 1;
    }
}
