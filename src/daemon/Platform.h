// SPDX-License-Identifier: Apache-2.0
// The set of platform roles that one daemon runs on. Every member may be replaced, which is how a test makes a world of
// its own over a temporary root, or hands in a disk that fails.
#pragma once

#include "ipc/UserNumbers.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Process.h"
#include "platform/Service.h"

namespace zor::platform {

class RunLoop;
class ServiceListener;
class SystemRoot;

/// References to objects that outlive whoever holds this.
struct Platform {
    const SystemRoot& root;
    /// The owners of containers on that root.
    ipc::UserNumbers users;
    Disk& disk;
    PlatformLog& log;
    InternalBuildQuery& internalBuild;
    SystemVersionQuery& systemVersion;
    PasswordDatabase& passwords;
    DeviceLockState& lockState;
    FileProtectionClass& protection;
    SandboxUserState& sandbox;
    TerminationAssertionService& assertions;
    CrashAnnotation& crash;
    BootMarker& bootMarker;
    ServiceTransactions& transactions;
    WorkQueue& deathRowQueue;
    WorkQueue& lockStateQueue;
    RunLoop& runLoop;
    PeerIdentity& peers;
    ServiceListener& listener;
    UpcallPort& upcallPort;
};

} // namespace zor::platform
