// SPDX-License-Identifier: Apache-2.0
// The least that a client of the daemon needs: requests as bytes made beforehand, and one round trip at a time. The
// client of the floor is the same, so that what it costs is on both sides of a ratio.
#pragma once

#include "base/ContainerClass.h"
#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "plist/Value.h"

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace zor::bench {

using Frame = std::vector<std::uint8_t>;

/// The user of all containers here but bundles.
constexpr std::uint32_t userId = 501;
/// The user of a class's containers here.
[[nodiscard]] constexpr std::uint32_t userOf(ContainerClass containerClass) {
    return isBundleClass(containerClass) ? ipc::UserNumbers().installer : userId;
}

/// A whole frame of a request.
[[nodiscard]] Frame requestFrame(const plist::Dictionary& request);
enum class Create { no, yes };
/// A whole frame: find the container, or make it.
[[nodiscard]] Frame containerRequest(const std::string& identifier, ContainerClass containerClass, Create create);
/// The same of an action on a container that is named by user, class and identifier, with what else it takes.
[[nodiscard]] Frame containerFrame(ipc::Command command, const std::string& identifier, ContainerClass containerClass,
                                   plist::Dictionary rest = {});

class Client {
public:
    /// Connects to the socket `name` in a directory. A failure when nobody listens.
    Client(const std::string& directory, std::string_view name);

    [[nodiscard]] int descriptor() const { return socket_.get(); }
    void send(std::span<const std::uint8_t> frame);
    /// The next whole frame; valid until the next call.
    std::span<const std::uint8_t> receive();
    std::span<const std::uint8_t> exchange(std::span<const std::uint8_t> frame) {
        send(frame);
        return receive();
    }

private:
    platform::FileDescriptor socket_;
    Frame buffer_;
};

/// How long each of `count` exchanges took, in microseconds. Another reply than `reply` is a failure.
[[nodiscard]] std::vector<double> roundTrips(Client& client, const Frame& request, const Frame& reply, int count);

/// The dictionary in a reply frame.
[[nodiscard]] plist::Dictionary replyOf(std::span<const std::uint8_t> frame);
/// A failure unless the reply says that the command did what it was asked, on a container that was there or not.
void mustSucceed(std::span<const std::uint8_t> frame, bool existed);
/// The reply to a request; a failure unless the command did what it was asked.
plist::Dictionary succeed(Client& client, const Frame& request);

struct Container {
    std::string path;
    plist::Value uuid;
};
enum class Lifetime { live, transient };
/// Makes one, which is not there yet.
Container makeContainer(Client& client, const std::string& identifier, ContainerClass containerClass,
                        Lifetime lifetime = Lifetime::live);

} // namespace zor::bench
