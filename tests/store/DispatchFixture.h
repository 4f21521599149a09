// SPDX-License-Identifier: Apache-2.0
// Messages to the dispatcher of a world, from a peer whose identity is in the test's hand.
#pragma once

#include "platform/Service.h"
#include "world/World.h"

#include <gtest/gtest.h>

namespace zor::test {

namespace powers = platform::entitlementKeys;

inline constexpr pid_t peerPid = 4711;
inline constexpr const char* handler = "ZORProcessIpsiEvent";
inline constexpr const char* admission = "checkEntitlementsAndInitClientObject";

inline const char* const appGroups = "com.veltra.security.application-groups";
inline const char* const systemGroups = "com.veltra.security.system-groups";
inline const char* const systemContainer = "com.veltra.security.system-container";

class FakePeer final : public platform::Peer {
public:
    [[nodiscard]] platform::Identity identify(Explain) override { return identity; }
    [[nodiscard]] pid_t pid() const override { return identity.pid; }
    [[nodiscard]] uid_t kernelUserId() const override { return identity.effectiveUserId; }
    platform::Identity identity;
};

class FakeConnection final : public platform::PeerConnection {
public:
    platform::Peer& peer() override { return peer_; }
    void cancel() override { ++cancelled; }
    FakePeer peer_;
    int cancelled = 0;
};

class FakeReply final : public platform::ReplyChannel {
public:
    void send(const plist::Dictionary& reply) override {
        const platform::MutexLock held(mutex_);
        replies_.push_back(reply);
    }
    [[nodiscard]] std::vector<plist::Dictionary> replies() const {
        const platform::MutexLock held(mutex_);
        return replies_;
    }

private:
    mutable platform::Mutex mutex_;
    std::vector<plist::Dictionary> replies_ ZOR_GUARDED_BY(mutex_);
};

inline std::shared_ptr<const platform::IdentityGrant> grant(std::optional<std::string> identifier,
                                                            std::optional<plist::Dictionary> entitlements) {
    return std::make_shared<platform::IdentityGrant>(
        platform::IdentityGrant{.identifier = std::move(identifier), .entitlements = std::move(entitlements)});
}

inline const plist::Dictionary noPowers{};
inline const plist::Dictionary everything{{std::string(powers::allowed), true}};

class Dispatch : public testing::Test {
protected:
    Dispatch() {
        world.write(groupMarkerPath, "");
        world.load();
        as(grant("com.example", noPowers));
        world.log.take();
    }
    void as(std::shared_ptr<const platform::IdentityGrant> granted, std::uint32_t userId = mobile) {
        connection.peer_.identity = {
            .pid = peerPid, .effectiveUserId = userId, .grant = std::move(granted), .explanation = "a.plist: why"};
    }
    void handle(platform::ServiceEvent event) { world.services().dispatcher().ZORProcessIpsiEvent(connection, event); }
    /// The one reply; the connection must have stayed open.
    plist::Dictionary request(const plist::Dictionary& message) {
        const auto channel = std::make_shared<FakeReply>();
        handle({.kind = platform::ServiceEvent::Kind::message, .request = message, .reply = channel});
        for (int i = 0; i < 5000 && channel->replies().empty() && connection.cancelled == 0; ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        world.drainDeathRow();
        EXPECT_EQ(connection.cancelled, 0);
        EXPECT_EQ(channel->replies().size(), 1U);
        return channel->replies().empty() ? plist::Dictionary() : channel->replies()[0];
    }
    /// The connection must end, and nothing be answered.
    void expectRefused(const plist::Dictionary& message) {
        const auto channel = std::make_shared<FakeReply>();
        world.log.take();
        handle({.kind = platform::ServiceEvent::Kind::message, .request = message, .reply = channel});
        EXPECT_EQ(std::exchange(connection.cancelled, 0), 1);
        EXPECT_TRUE(channel->replies().empty());
    }
    static std::uint64_t errorOf(const plist::Dictionary& reply) {
        return reply.unsignedInteger("ReplyError").value_or(0);
    }
    /// Makes a container by the peer's request; its UUID.
    plist::Data makeContainer(const char* identifier, std::uint64_t containerClass = 2, bool transient = false) {
        const plist::Dictionary reply = request({{"ContainerClass", containerClass},
                                                 {"UserID", containerClass == 1 ? 33 : 501},
                                                 {"Identifier", identifier},
                                                 {"CreateIfNecessary", true},
                                                 {"Transient", transient}});
        return reply.data("ReplyUUID") ? *reply.data("ReplyUUID") : plist::Data();
    }
    void asInstaller() { as(grant("installer", everything), 0); }
    static support::LogLine missing(const std::string& identifier, std::string_view entitlement) {
        return {3, admission,
                "connection attempt from pid 4711 (" + identifier +
                    ") missing required entitlement: " + std::string(entitlement)};
    }

    World world;
    FakeConnection connection;
};

} // namespace zor::test
