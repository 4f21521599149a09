// SPDX-License-Identifier: Apache-2.0
#include "Writers.h"

namespace zor::bench {

namespace {

namespace keys = ipc::keys;

constexpr ContainerClass containerClass = ContainerClass::bundleApplication;

} // namespace

Frame registration(const std::string& identifier, plist::Dictionary entitlements, plist::Dictionary options) {
    return requestFrame({
        {std::string(keys::command), static_cast<std::uint64_t>(ipc::Command::processEntitlements)},
        {std::string(keys::identifier), identifier},
        {std::string(keys::entitlements), std::move(entitlements)},
        {std::string(keys::optionsDictionary), std::move(options)},
    });
}

Replacer::Replacer(const Daemon& daemon, std::string identifier)
    : identifier_(std::move(identifier)), client_(daemon.connect()),
      old_(makeContainer(client_, identifier_, containerClass)) {}

double Replacer::replace() {
    const Container fresh = makeContainer(client_, identifier_, containerClass, Lifetime::transient);
    const Frame request =
        requestFrame({{std::string(ipc::keys::command), static_cast<std::uint64_t>(ipc::Command::replaceContainer)},
                      {std::string(ipc::keys::oldContainerUUID), old_.uuid},
                      {std::string(ipc::keys::oldContainerClass), static_cast<std::uint64_t>(containerClass)},
                      {std::string(ipc::keys::oldIdentifier), identifier_},
                      {std::string(ipc::keys::oldContainerUserId), userOf(containerClass)},
                      {std::string(ipc::keys::newContainerUUID), fresh.uuid},
                      {std::string(ipc::keys::newContainerClass), static_cast<std::uint64_t>(containerClass)},
                      {std::string(ipc::keys::newIdentifier), identifier_},
                      {std::string(ipc::keys::newContainerUserId), userOf(containerClass)}});
    const auto begin = Clock::now();
    const auto reply = client_.exchange(request);
    const double microseconds = secondsSince(begin) * 1e6;
    if (replyOf(reply).unsignedInteger(ipc::keys::replyError) != ipc::replySuccess)
        throw Failure("a container was not replaced");
    old_ = fresh;
    return microseconds;
}

} // namespace zor::bench
