// SPDX-License-Identifier: Apache-2.0
// The composition root: every service, made once and in the order of what it calls, over one platform and one system
// root.
//
// Nothing below this reaches for a process-wide object; what is shared is handed down by reference. So a second daemon,
// or a test with its own root, can live in the same process. Destruction goes the other way round.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "daemon/Dispatcher.h"
#include "daemon/Operations.h"
#include "daemon/Platform.h"
#include "daemon/RefusalLimiter.h"
#include "daemon/ZORClientConnection.h"
#include "fs/Durability.h"
#include "fs/ZORFileManager.h"
#include "os/RunLoop.h"
#include "store/Configuration.h"
#include "store/ReplaceJournal.h"
#include "store/ZORContainerCache.h"
#include "store/ZORWhitelist.h"
#include "upcall/UpcallServer.h"

#include <memory>
#include <optional>

namespace zor {

class Composition {
public:
    /// `probe` says how a file system orders what is not synced; tests put their own in its place.
    explicit Composition(platform::Platform platform, fs::Durability::Probe probe = fs::orderingOfFileSystem);
    /// Says what the log has left out so far.
    ~Composition() { refusals_.reportAll(); }
    Composition(const Composition&) = delete;
    Composition& operator=(const Composition&) = delete;

    [[nodiscard]] const platform::Platform& platform() const { return platform_; }
    [[nodiscard]] const Log& log() const { return log_; }
    [[nodiscard]] ZORFileManager& defaultManager() { return fileManager_; }
    [[nodiscard]] ZORGlobalConfiguration& configuration() { return configuration_; }

    // Made when they are first asked for, which is after the log is open: reading the entitlement file belongs to the
    // start of the work. The thread that starts the daemon makes the first call.
    [[nodiscard]] Operations& store();
    [[nodiscard]] Dispatcher& dispatcher();
    [[nodiscard]] UpcallServer& upcallServer();
    [[nodiscard]] UpcallServer::Needs upcallNeeds();
    /// The daemon's own client.
    [[nodiscard]] const std::shared_ptr<ZORClientConnection>& sharedClientConnection();
    [[nodiscard]] ZOREntitlementMapping& entitlements() { return store().entitlements; }
    [[nodiscard]] ZORGroupManager& groups() { return store().groups; }
    [[nodiscard]] ZORContainerCache& cache() { return cache_; }
    [[nodiscard]] ZORLocks& locks() { return locks_; }
    [[nodiscard]] const ZORWhitelist& whitelist() { return store().whitelist; }

private:
    struct Late;
    Late& late();
    [[nodiscard]] UpcallServer::Needs upcallNeeds(Operations& operations);
    void sayLeftOut(uid_t uid, std::uint64_t lines) const;

    platform::Platform platform_;
    Log log_;
    platform::RefusalLimiter refusals_;
    platform::LoopTimer refusalsEnd_;
    ExceptionBoundary boundary_;
    UserIdentity users_;
    ZORLocks locks_;
    ZORFileManager fileManager_;
    fs::Durability durability_;
    ZORGlobalConfiguration configuration_;
    ZORContainerCache cache_;
    WaitingReplaces replaces_;

    struct Late {
        explicit Late(Composition& composition);
        Operations operations;
        std::shared_ptr<ZORClientConnection> sharedClientConnection;
        Dispatcher dispatcher;
        UpcallServer upcallServer;
    };
    std::optional<Late> late_;
};

} // namespace zor
