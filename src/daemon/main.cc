// SPDX-License-Identifier: Apache-2.0
// zorvaned: the options, the platform, the services over it, then the daemon's life until it is told to stop.
#include "daemon/Composition.h"
#include "daemon/Daemon.h"
#include "daemon/LinuxPlatform.h"
#include "daemon/Options.h"
#include "daemon/Status.h"
#include "identity/AddressSpace.h"
#include "os/FileDescriptor.h"
#include "os/RunLoop.h"
#include "os/ServiceManager.h"
#include "os/SystemRoot.h"
#include "service/StatusSocket.h"
#include "store/StorePlaces.h"

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <malloc.h>
#include <string_view>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

namespace {

using namespace zor;

/// Two arenas serve the few threads that run at once; one for each thread that ever was would keep memory for ever.
constexpr int mallocArenas = 2;

/// Told to the service manager while the setup goes on: it waits this long, in microseconds, for the next word.
/// One item, perhaps a large tree that an old system left on another file system, may take minutes.
constexpr std::string_view setupGoesOn = "EXTEND_TIMEOUT_USEC=600000000\nSTATUS=Putting in order what lies on the disk";

/// False when a standard descriptor is missing and stays so: its number would be some container's or client's.
[[nodiscard]] bool prepareProcess() {
    if (!platform::fillStandardDescriptors())
        return false;
    ::umask(022);
    ::mallopt(M_ARENA_MAX, mallocArenas);
    std::signal(SIGPIPE, SIG_IGN);
    std::signal(SIGXFSZ, SIG_IGN); // a file that may not grow fails the write (EFBIG), not the daemon
    return true;
}

/// As many descriptors as this process can get.
std::size_t raiseDescriptorLimit() {
    rlimit files{};
    if (::getrlimit(RLIMIT_NOFILE, &files) != 0)
        return 0;
    const rlim_t before = std::exchange(files.rlim_cur, files.rlim_max);
    return ::setrlimit(RLIMIT_NOFILE, &files) == 0 ? files.rlim_max : before;
}

void sayIfConnectionsAreFew(const platform::ListenerLimits& limits, std::size_t descriptorsMax, const Log& log) {
    if (limits.connectionsMax < platform::ListenerLimits{}.connectionsMax)
        log.write(logLevelNotice, "main",
                  "At most %zu connections, %zu of one user, for there are %zu descriptors; raise LimitNOFILE= of the "
                  "unit, or ulimit -Hn",
                  limits.connectionsMax, limits.connectionsMaxPerUser, descriptorsMax);
}

platform::Syncs syncsFromEnvironment() {
    const char* wanted = std::getenv("ZORVANE_DURABILITY");
    return wanted && std::strcmp(wanted, "none") == 0 ? platform::Syncs::off : platform::Syncs::on;
}

/// How long the threads that serve clients may take to end. A kill is safe at any moment, so nothing is lost by it.
constexpr unsigned stopSecondsMax = 10;
/// The same for work that is under way, where no service manager kills sooner, as systemd does with the unit.
constexpr unsigned workSecondsMax = 60;

/// Ends the run loop on SIGTERM or SIGINT, as soon as nothing is under way.
class StopOnSignal {
public:
    explicit StopOnSignal(platform::LinuxPlatform& platform)
        : loop_(platform.runLoop()), transactions_(platform.roles().transactions) {
        transactions_.onIdle([this] { stopIfWanted(); });
        loop_.watch(signals_.get(), [this] {
            if (isWanted())
                stopIfWanted();
        });
    }

    /// For who keeps the loop from running. Main thread.
    bool isWanted() {
        while (signals_.take())
            wanted_ = true;
        return wanted_;
    }

private:
    void stopIfWanted() {
        if (!wanted_)
            return;
        // Work or a request that waits for a file system that has died would keep the process for ever.
        const bool isIdle = transactions_.count() == 0;
        std::signal(SIGALRM, [](int) { ::_exit(0); });
        ::alarm(isIdle ? stopSecondsMax : workSecondsMax);
        if (isIdle)
            loop_.stop();
    }

    platform::SignalDescriptor signals_{SIGTERM, SIGINT};
    platform::RunLoop& loop_;
    platform::ServiceTransactions& transactions_;
    std::atomic<bool> wanted_{false};
};

/// The counters that only the platform's own objects keep.
void addPlatformCounters(platform::LinuxPlatform& platform, plist::Dictionary& counters) {
    const platform::ListenerCounters listener = platform.listener().counters();
    counters.set("Connections", listener.connections);
    counters.set("ConnectionsAccepted", listener.connectionsAccepted);
    counters.set("ConnectionsRefused", listener.connectionsRefused);
    counters.set("ConnectionsDropped", listener.connectionsDropped);
    counters.set("Messages", listener.messages);
    counters.set("BrokenFrames", listener.brokenFrames);
    counters.set("ForeignSenders", listener.foreignSenders);
    counters.set("BufferedInputBytes", listener.inputBytes);
    counters.set("BufferedOutputBytes", listener.outputBytes);
    counters.set("ListenerThreads", listener.threads);
    counters.set("ListenerThreadsMost", listener.threadsMost);
    const auto& [numbers, doubts] = platform.users();
    counters.set("Users", plist::Dictionary{{"Installer", numbers.installer},
                                            {"System", numbers.system},
                                            {"First", numbers.first},
                                            {"Last", numbers.last},
                                            {"Doubts", plist::Array(doubts.begin(), doubts.end())}});
}

/// The line that the service manager shows of the daemon.
std::string shortStatus(const platform::SystemRoot& root, const platform::ListenerCounters& counters) {
    return "Serving " + root.canonicalPath() + ": " + std::to_string(counters.messages) + " requests so far, " +
           std::to_string(counters.connections) + " connections";
}

/// The status is a help, not a service: without it the daemon goes on, and says so.
void openStatus(platform::LinuxPlatform& platform, platform::StatusSocket& socket, const Log& log) {
    using namespace zor::platform::names;
    auto passed = platform.passedSockets().take(passedStatusSocket);
    const platform::ListenerAddress address{.directory = platform.root().runtimeDirectory(),
                                            .directoryPath = platform.root().path(runtimeDirectory),
                                            .name = statusSocket};
    if (const Errno failure = passed.valid() ? socket.adopt(std::move(passed)) : socket.open(address))
        log.write(logLevelError, "main", "No status socket: %s", failure.text());
}

} // namespace

int main(int argumentCount, char** arguments) {
    const auto options = parseDaemonOptions(argumentCount, arguments);
    if (!options) {
        std::fputs(options.error().text.c_str(), options.error().exitStatus == 0 ? stdout : stderr);
        return options.error().exitStatus;
    }
    if (!prepareProcess()) {
        std::fputs("zorvaned: standard input, output or error is closed, and there is no /dev/null for it\n", stderr);
        return 1;
    }
    // The child works while this process does, and is gone before the first client is served.
    platform::AddressSpace::beginTrial();

    const std::size_t descriptorsMax = raiseDescriptorLimit();
    const auto limits = platform::ListenerLimits::forDescriptors(descriptorsMax);
    using platform::RotatingLog;
    auto platform = platform::LinuxPlatform::open({
        .rootDirectory = options->rootDirectory,
        .foreground = options->foreground ? RotatingLog::Foreground::yes : RotatingLog::Foreground::no,
        .syncs = syncsFromEnvironment(),
        .passed = platform::PassedSockets::ofEnvironment(),
        .listenerLimits = limits,
    });
    if (!platform) {
        std::fprintf(stderr, "zorvaned: %s\n", platform.error().c_str());
        return 1;
    }
    if (const auto missing = missingOf((*platform)->root()); !missing.empty()) {
        std::fprintf(stderr, "zorvaned: %s\n", lineAboutMissing((*platform)->root(), missing).c_str());
        return 1;
    }
    if (options->forgetBoot)
        (*platform)->bootMarker().forget();

    StopOnSignal stop(**platform);
    Composition composition((*platform)->roles());
    const auto notify = platform::NotifySocket::ofEnvironment();
    Watchdog watchdog((*platform)->runLoop(), notify, [&] { return (*platform)->listener().answers(); },
                      [&] { return shortStatus((*platform)->root(), (*platform)->listener().counters()); });
    Status status(composition, [&](plist::Dictionary& counters) {
        addPlatformCounters(**platform, counters);
        counters.set("LogLinesLost", (*platform)->log().linesLost() + composition.log().linesLost());
    });
    platform::StatusSocket statusSocket(
        (*platform)->peers(), (*platform)->runLoop(),
        [&](platform::Peer& peer, platform::StatusSocket::Detail detail) { return status.forPeer(peer, detail); });
    Daemon daemon(composition, {.logLevel = options->logLevel,
                                .containersPerUser = options->containersPerUser,
                                .beforeClients =
                                    [&] {
                                        (void)platform::AddressSpace::isTold();
                                        sayIfConnectionsAreFew(limits, descriptorsMax, composition.log());
                                        for (const std::string& doubt : (*platform)->users().doubts)
                                            composition.log().writeText(logLevelError, "main", doubt);
                                        openStatus(**platform, statusSocket, composition.log());
                                    },
                                .ready =
                                    [&] {
                                        (void)notify.send("READY=1");
                                        watchdog.start(platform::NotifySocket::watchdogOfEnvironment());
                                    },
                                .settingUp =
                                    [&] {
                                        (void)platform::AddressSpace::isTold();
                                        (void)notify.send(setupGoesOn);
                                    },
                                .stopWanted = [&] { return stop.isWanted(); }});
    const int exitStatus = daemon.run();
    (void)notify.send("STOPPING=1\nSTATUS=Ending what is under way");
    statusSocket.close();
    (*platform)->finish();
    return exitStatus;
}
