// SPDX-License-Identifier: Apache-2.0
// One of each role of the platform, on Linux: what a daemon runs on. Made by main, or by a test over a root of its own;
// several can live in one process, over different roots.
//
// The order of the members is the order in which they come into being; they go the other way round.
#pragma once

#include "daemon/Platform.h"
#include "device/DataProtection.h"
#include "device/DeviceQueries.h"
#include "device/FileCrashAnnotation.h"
#include "device/FileTerminationAssertionService.h"
#include "device/LinkSandboxUserState.h"
#include "identity/IdentityRegistry.h"
#include "identity/LinuxPeer.h"
#include "identity/Users.h"
#include "ipc/UserNumbers.h"
#include "os/LinuxDisk.h"
#include "os/RotatingLog.h"
#include "os/RunLoop.h"
#include "os/SerialWorkQueue.h"
#include "os/ServiceManager.h"
#include "os/SystemRoot.h"
#include "service/SeqpacketUpcallPort.h"
#include "service/ServiceListener.h"

#include <expected>
#include <memory>
#include <string>

namespace zor::platform {

class LinuxPlatform {
public:
    struct Options {
        std::string rootDirectory = "/";
        RotatingLog::Foreground foreground = RotatingLog::Foreground::no;
        /// On "/" they are on, whatever is asked for.
        Syncs syncs = Syncs::on;
        PassedSockets passed;
        ListenerLimits listenerLimits;
    };

    /// Opens the root, makes the runtime directory, takes the daemon's lock, reads which users own containers and
    /// writes that down for clients; nothing is served yet. The error is one line that says what stood in the way.
    [[nodiscard]] static std::expected<std::unique_ptr<LinuxPlatform>, std::string> open(Options options);
    ~LinuxPlatform();
    LinuxPlatform(const LinuxPlatform&) = delete;
    LinuxPlatform& operator=(const LinuxPlatform&) = delete;

    [[nodiscard]] Platform roles();

    [[nodiscard]] const SystemRoot& root() const { return root_; }
    [[nodiscard]] const ipc::ConfiguredUsers& users() const { return users_; }
    [[nodiscard]] RunLoop& runLoop() { return runLoop_; }
    [[nodiscard]] ServiceListener& listener() { return listener_; }
    [[nodiscard]] LinuxPeerIdentity& peers() { return peers_; }
    [[nodiscard]] SemaphoreBootMarker& bootMarker() { return bootMarker_; }
    [[nodiscard]] RotatingLog& log() { return log_; }
    [[nodiscard]] PassedSockets& passedSockets() { return passed_; }

    /// Stops the listener and finishes the queues: from then on nothing calls into the objects that were built on the
    /// roles. To be called before those go.
    void finish();

private:
    LinuxPlatform(SystemRoot root, DaemonLock lock, ipc::ConfiguredUsers users, Options options);
    [[nodiscard]] ListenerOptions listenerOptions(const ListenerLimits& limits);

    SystemRoot root_;
    DaemonLock lock_;
    const ipc::ConfiguredUsers users_;
    PassedSockets passed_;
    LinuxDisk disk_;
    RotatingLog log_;
    RunLoop runLoop_;
    LinuxInternalBuildQuery internalBuild_{root_};
    LinuxSystemVersionQuery systemVersion_{root_};
    LinuxPasswordDatabase passwords_{root_};
    FileDeviceLockState lockState_{root_};
    XattrProtectionClass protection_{disk_, lockState_};
    LinkSandboxUserState sandbox_{root_, disk_};
    FileTerminationAssertionService assertions_{root_, disk_};
    FileCrashAnnotation crash_{root_, disk_};
    SemaphoreBootMarker bootMarker_{root_};
    ServiceTransactions transactions_;
    IdentityRegistry registry_;
    LinuxPeerIdentity peers_;
    SeqpacketUpcallPort upcallPort_;
    ServiceListener listener_;
    SerialWorkQueue deathRowQueue_;
    SerialWorkQueue lockStateQueue_;
};

} // namespace zor::platform
