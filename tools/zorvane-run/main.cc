// SPDX-License-Identifier: Apache-2.0
// zorvane-run: runs a program as a user in a sandbox that holds the containers of its identifier. A device's service
// manager calls it as root.
//
// A kill leaves the containers that were made so far, each whole; the sandbox ends with this process.
#include "Assertion.h"
#include "Descriptors.h"
#include "Inside.h"
#include "Mounts.h"
#include "Notifications.h"
#include "Options.h"
#include "Output.h"
#include "PassedSockets.h"
#include "Registered.h"
#include "Sandbox.h"
#include "Staging.h"
#include "Supervisor.h"
#include "Upcall.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <malloc.h>
#include <unistd.h>
#include <utility>

namespace {

using namespace zorvanerun;

/// Names with control characters could not be told apart in the environment's lists, one line for each.
bool hasControlCharacters(const WantedContainers& wanted, const std::string& identifier) {
    const auto isPlain = [](const std::string& text) { return printable(text) == text; };
    return !isPlain(identifier) || !std::ranges::all_of(wanted.applicationGroups, isPlain) ||
           !std::ranges::all_of(wanted.systemGroups, isPlain);
}

/// The things that the sandbox is made from.
struct Prepared {
    ToldContainers told;
    std::vector<Mount> mounts;
};

Result<Prepared> prepare(const Root& root, const Options& options, const PassedSockets& passed) {
    const WantedContainers wanted = TRY(chooseContainers(options, passed));
    if (hasControlCharacters(wanted, options.identifier))
        return std::unexpected(
            Failure{.what = "an identifier holds control characters", .advice = "register groups under other names"});
    ToldContainers told = TRY(askForContainers(root, options, wanted));
    auto mounts = TRY(openMounts(root, options, told));
    return Prepared{.told = std::move(told), .mounts = std::move(mounts)};
}

/// Looks for an assertion before anything is made, and again when all is: that may have taken minutes. A launch that
/// waited then prepares anew, for the containers may be others by now.
Result<int> start(const Options& options) {
    // Before anything is opened that could be taken for one of them.
    const PassedSockets passed = TRY(PassedSockets::ofCaller());
    Notifications notifications = TRY(Notifications::ofCaller());
    if (const char* const failed = leaveMountNamespace())
        return std::unexpected(noSandbox(failed));
    const Root root = TRY(Root::open(options.root));
    TRY(passed.judgeKinds(options.network));
    (void)TRY(awaitFreedom(root, options));
    Supervisor supervisor = TRY(Supervisor::begin(options, passed));
    for (;;) {
        const Prepared prepared = TRY(prepare(root, options, passed));
        if (TRY(awaitFreedom(root, options)) == Freedom::waitedFor)
            continue;
        const char* failed = stage(prepared.mounts);
        if (!failed)
            failed = notifications.appear();
        if (failed)
            return std::unexpected(noSandbox(failed));
        const auto arguments = sandboxArguments(options, prepared.told, notifications, passed);
        return supervisor.run(arguments, std::move(notifications));
    }
}

Result<int> run(const Options& options) {
    if (::geteuid() != 0)
        return std::unexpected(
            Failure{.what = "this needs root: only root may ask for the containers of others, and become user " +
                            std::to_string(options.user),
                    .advice = "call it from the service manager, or with sudo"});
    if (!zor::platform::fillStandardDescriptors() || !closeOnExecFrom(STDERR_FILENO + 1))
        return std::unexpected(Failure{.what = "cannot set up this process's descriptors",
                                       .advice = "use a kernel of 5.11 or newer, and mount /dev"});
    if (auto why = whyStandardDescriptorRefused(options.network); !why.empty() && !options.dryRun)
        return std::unexpected(
            Failure{.what = std::move(why) + ", which would lead the program out of its sandbox",
                    .advice = "give it a file, a pipe, a terminal or /dev/null; for a socket of the network, add "
                              "--network host"});
    if (!options.dryRun)
        return start(options);
    const Root root = TRY(Root::open(options.root));
    const Prepared prepared = TRY(prepare(root, options, {}));
    return showPlan(options, prepared.mounts, prepared.told);
}

/// A command line that cannot be parsed may still say how that is to be told.
int sayEnd(const OptionsEnd& end, int argumentCount, char** arguments) {
    if (end.exitCode == exitDone) {
        std::fputs(end.text.c_str(), stdout);
        return outputReached() ? exitDone : exitFailure;
    }
    Options options;
    options.json = std::any_of(arguments, arguments + argumentCount,
                               [](const char* word) { return std::strcmp(word, "--json") == 0; });
    return sayFailure(options, {.what = end.text, .advice = "see 'zorvane-run --help'"});
}

} // namespace

int main(int argumentCount, char** arguments) {
    if (argumentCount > 1 && std::strcmp(arguments[1], insideOption) == 0)
        ::_exit(runInside(argumentCount, arguments)); // there is nothing to be tidied up in the sandbox
    std::signal(SIGXFSZ, SIG_IGN);                    // a file that may not grow is an error to be told, not an end
    ::mallopt(M_ARENA_MAX, 1);                        // the threads that ask file systems are few and short
    const auto options = parseOptions(argumentCount, arguments);
    if (!options)
        return sayEnd(options.error(), argumentCount, arguments);
    const auto exitCode = run(*options);
    return exitCode ? *exitCode : sayFailure(*options, exitCode.error());
}
