// SPDX-License-Identifier: Apache-2.0
// zorvaned: the options, the platform, the services over it, then the daemon's life until it is told to stop.
#include "daemon/Composition.h"
#include "daemon/Daemon.h"
#include "daemon/Options.h"
#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/NotifySocket.h"
#include "platform/linux/SignalDescriptor.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>

namespace {

using namespace zor;

/// Two arenas serve the few threads that run at once; one for each thread that ever was would keep memory for ever.
constexpr int mallocArenas = 2;

void prepareProcess() {
    ::umask(022);
    ::mallopt(M_ARENA_MAX, mallocArenas);
    std::signal(SIGPIPE, SIG_IGN);
    rlimit files{};
    if (::getrlimit(RLIMIT_NOFILE, &files) == 0) {
        files.rlim_cur = files.rlim_max; // a connection takes two or three
        ::setrlimit(RLIMIT_NOFILE, &files);
    }
}

platform::Syncs syncsFromEnvironment() {
    const char* wanted = std::getenv("ZORVANE_DURABILITY");
    return wanted && std::strcmp(wanted, "none") == 0 ? platform::Syncs::off : platform::Syncs::on;
}

/// Ends the run loop on SIGTERM or SIGINT, as soon as nothing is under way.
class StopOnSignal {
public:
    explicit StopOnSignal(platform::LinuxPlatform& platform)
        : loop_(platform.runLoop()), transactions_(platform.roles().transactions) {
        transactions_.onIdle([this] { stopIfWanted(); });
        loop_.watch(signals_.get(), [this] {
            while (signals_.take())
                wanted_ = true;
            stopIfWanted();
        });
    }

private:
    void stopIfWanted() {
        if (wanted_ && transactions_.count() == 0)
            loop_.stop();
    }

    platform::SignalDescriptor signals_{SIGTERM, SIGINT};
    platform::EpollRunLoop& loop_;
    platform::ServiceTransactions& transactions_;
    std::atomic<bool> wanted_{false};
};

} // namespace

int main(int argumentCount, char** arguments) {
    const auto options = parseDaemonOptions(argumentCount, arguments);
    if (!options) {
        std::fputs(options.error().text.c_str(), options.error().exitStatus == 0 ? stdout : stderr);
        return options.error().exitStatus;
    }
    prepareProcess();

    using platform::RotatingLog;
    auto platform = platform::LinuxPlatform::open({
        .rootDirectory = options->rootDirectory,
        .foreground = options->foreground ? RotatingLog::Foreground::yes : RotatingLog::Foreground::no,
        .syncs = syncsFromEnvironment(),
        .passed = platform::PassedSockets::ofEnvironment(),
    });
    if (!platform) {
        std::fprintf(stderr, "zorvaned: %s\n", platform.error().c_str());
        return 1;
    }
    if (options->forgetBoot)
        (*platform)->bootMarker().forget();

    const StopOnSignal stop(**platform);
    Composition composition((*platform)->roles());
    const auto notify = platform::NotifySocket::ofEnvironment();
    Daemon daemon(composition, {.logLevel = options->logLevel, .ready = [&] { (void)notify.send("READY=1"); }});
    const int status = daemon.run();
    (void)notify.send("STOPPING=1");
    (*platform)->finish();
    return status;
}
