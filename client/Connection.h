// SPDX-License-Identifier: Apache-2.0
// One stream to the daemon: requests out, replies in, told apart by their ids. One thread at a time.
#pragma once

#include "os/FileDescriptor.h"
#include "plist/Value.h"
#include "zorvane/Client.h"

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

namespace zorvane {

using Clock = std::chrono::steady_clock;

class [[gnu::visibility("hidden")]] Client::Connection {
public:
    enum class Service { commands, status };
    [[nodiscard]] static Result<Connection> open(const ConnectOptions& options, Service service);

    /// Sends a request and waits for its reply; a "ReplyError" other than success is the error. Replies to other
    /// requests that come first are kept.
    [[nodiscard]] Result<zor::plist::Dictionary> call(const zor::plist::Dictionary& request);
    /// The same for several that do not wait for each other, within the time of one: one wait for all.
    [[nodiscard]] std::vector<Result<zor::plist::Dictionary>>
    callTogether(std::span<const zor::plist::Dictionary> requests);
    /// The next frame, whatever its id.
    struct Reply {
        std::uint64_t id = 0;
        zor::plist::Dictionary content;
    };
    [[nodiscard]] Result<Reply> receive();
    /// Starts the time of a call; 0 is for ever.
    void startTime(std::uint32_t milliseconds);
    /// That of calls that walk no tree.
    [[nodiscard]] std::uint32_t timeoutMilliseconds() const;
    /// The same error, with what can be found out about it.
    [[nodiscard]] Error explained(const Error& error) const;

private:
    Connection(zor::platform::FileDescriptor socket, const ConnectOptions& options)
        : socket_(std::move(socket)), options_(options) {}
    Result<zor::plist::Dictionary> exchange(const zor::plist::Dictionary& request);
    Result<zor::plist::Dictionary> judged(Result<zor::plist::Dictionary> reply) const;
    Result<std::uint64_t> send(const zor::plist::Dictionary& request);
    Result<zor::plist::Dictionary> replyTo(std::uint64_t id);
    Result<void> readAll(std::uint8_t* bytes, std::size_t count);
    /// Whether a time limit or an interruption ends a wait: then it is poll that waits.
    [[nodiscard]] bool pollWaits() const { return deadline_ || options_.interruptDescriptor >= 0; }
    Result<void> waitFor(short events);
    /// The time for a connect before it is tried again; 0 is for ever.
    [[nodiscard]] std::uint32_t connectMilliseconds() const;

    zor::platform::FileDescriptor socket_;
    ConnectOptions options_;
    Clock::time_point connected_ = Clock::now();
    /// The fields of the call that goes on.
    std::uint32_t limitMilliseconds_ = 0;
    std::optional<Clock::time_point> deadline_;
    bool interrupted_ = false;
    std::uint64_t lastId_ = 0;
    std::map<std::uint64_t, zor::plist::Dictionary> early_;
};

} // namespace zorvane
