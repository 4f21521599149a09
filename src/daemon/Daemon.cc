// SPDX-License-Identifier: Apache-2.0
#include "daemon/Daemon.h"

#include "ipc/Protocol.h"
#include "os/SystemRoot.h"
#include "service/ServiceListener.h"

namespace zor {

namespace {

struct LogSize {
    unsigned fileCount;
    std::size_t fileBytesMax;
};
constexpr LogSize internalLogSize{4, 262'144};
constexpr LogSize logSize{1, 102'400};

} // namespace

int Daemon::run() {
    const Reporter report(composition_.log(), "main");
    const platform::Platform& platform = composition_.platform();
    auto startUp = platform.transactions.hold();
    openLog();
    if (!startQueues()) {
        report.write(logLevelError, "Can't create dispatch queues. Exiting.");
        return -1;
    }
    setUp();
    if (composition_.store().setup.stopped()) {
        report.write(logLevelNotice, "Told to end before the setup was done; the next start goes on");
        return 0;
    }
    followLockState();
    evaluateLockState();
    if (!startUpcallServer()) {
        report.write(logLevelError, "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting.");
        return -1;
    }
    startUp.reset();
    if (options_.beforeClients)
        options_.beforeClients();
    if (startListener() && options_.ready)
        options_.ready();
    platform.runLoop.run();
    platform.listener.stop();
    return 0;
}

void Daemon::openLog() {
    const platform::Platform& platform = composition_.platform();
    const FileURL file = composition_.configuration().logDirectory().appendingFile(platform::names::logFile);
    if (!platform.log.open(ipc::serviceName, options_.logLevel))
        platform.log.writeToSystemLog(logLevelError,
                                      formatted("Failed to set up rotating logs at path %s", file.c_str()));
    const LogSize size = platform.internalBuild.isInternalBuild() ? internalLogSize : logSize;
    platform.log.enableDiskLogging(file.path(), size.fileCount, size.fileBytesMax);
    if (composition_.log().writes(logLevelDebug))
        composition_.log().write(logLevelDebug, "main", "zorvaned built at %s %s started", __DATE__, __TIME__);
}

bool Daemon::startQueues() {
    const platform::Platform& platform = composition_.platform();
    return platform.deathRowQueue.start() && platform.lockStateQueue.start();
}

void Daemon::setUp() {
    const Log& log = composition_.log();
    const Reporter report(log, "main");
    const platform::Platform& platform = composition_.platform();
    const auto& client = composition_.sharedClientConnection();
    SetupReport& setup = composition_.store().setup;
    setup.setSurroundings({.progress = options_.settingUp, .stopWanted = options_.stopWanted});
    if (options_.containersPerUser)
        composition_.store().limits.containersMaxPerUser = *options_.containersPerUser;
    if (const auto homeWasOpen = composition_.configuration().closeHomeDirectory(); !homeWasOpen)
        report.write(logLevelError, "%s", homeWasOpen.error().text().c_str());
    else if (*homeWasOpen)
        report.write(logLevelNotice, "Closed the daemon's home directory, which others could read");
    const platform::BootMarker::State marker = platform.bootMarker.look();
    if (marker.foreign)
        report.write(logLevelError, "Semaphore %s belongs to somebody else; it counts as absent",
                     platform.bootMarker.name().c_str());
    if (!marker.present) {
        report.write(logLevelNotice, "zorvaned performing first boot initialization");
        client->rebootContainerManagerSetup();
        if (const Errno failure = setup.stopped() ? Errno() : platform.bootMarker.make())
            log.write(logLevelError, "set_first_boot_work_completed", "Failed to create semaphore %s: %s",
                      platform.bootMarker.name().c_str(), failure.text());
    }
    if (!setup.stopped())
        client->containerManagerSetup();
    setup.setSurroundings({});
}

void Daemon::followLockState() {
    const platform::Platform& platform = composition_.platform();
    if (const Errno error = platform.lockState.registerForChanges(platform.runLoop, [this] { evaluateLockState(); }))
        composition_.log().write(logLevelError, "main", "%s failed for %s: %d",
                                 platform.lockState.registrationCallName(), platform.lockState.notificationName(),
                                 error.number());
}

void Daemon::evaluateLockState() {
    const platform::Platform& platform = composition_.platform();
    const int state = platform.lockState.currentState();
    if (composition_.log().writes(logLevelDebug))
        composition_.log().write(logLevelDebug, "ostrandd_notification_callback", "LockState=%d", state);
    if (state == platform::DeviceLockState::locked) {
        if (lastLockState_ != platform::DeviceLockState::locked)
            platform.lockStateQueue.suspend();
        lastLockState_ = platform::DeviceLockState::locked;
    } else if (state == platform::DeviceLockState::unlocked) {
        if (lastLockState_ == platform::DeviceLockState::locked)
            platform.lockStateQueue.resume();
        lastLockState_ = platform::DeviceLockState::unlocked;
    }
}

bool Daemon::startUpcallServer() {
    const platform::Platform& platform = composition_.platform();
    const Reporter report(composition_.log(), "ZORKernServerStart");
    if (const Errno failure = platform.upcallPort.checkIn()) {
        report.write(logLevelError, "%s: %s", platform.upcallPort.checkInCallName(), failure.text());
        return false;
    }
    UpcallServer& server = composition_.upcallServer();
    const bool serving = platform.upcallPort.serve(
        platform.runLoop, [&server](const platform::UpcallPacket& packet) { return server.answer(packet); });
    if (!serving)
        report.write(logLevelError, "%s failed", platform.upcallPort.sourceCallName());
    return serving;
}

bool Daemon::startListener() {
    const platform::Platform& platform = composition_.platform();
    Dispatcher& dispatcher = composition_.dispatcher();
    const bool listening =
        platform.listener.resume([&dispatcher](platform::PeerConnection& connection, platform::ServiceEvent& event) {
            dispatcher.ZORProcessIpsiEvent(connection, event);
        });
    if (!listening)
        composition_.log().write(logLevelError, "main", "unable to start ipsi service!");
    return listening;
}

namespace {
/// Questions in the time that the manager waits: a pool that is late once is asked again before it is too late.
constexpr int questions = 4;
} // namespace

void Watchdog::start(std::optional<std::chrono::microseconds> patience) {
    if (!patience)
        return;
    every_ = std::chrono::ceil<std::chrono::milliseconds>(*patience / questions);
    feed();
}

void Watchdog::feed() {
    if (poolAnswers_())
        (void)notify_.send("WATCHDOG=1\nSTATUS=" + describe_());
    timer_.set(every_);
}

} // namespace zor
