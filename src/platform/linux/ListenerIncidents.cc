// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/ListenerIncidents.h"

#include <chrono>
#include <string>

namespace zor::platform {

namespace {

constexpr std::array<const char*, listenerIncidentKinds> words = {
    "Connection refused, too many connections: uid ",
    "Connection refused, out of descriptors or memory: errno ",
    "Connection refused, the kernel does not tell the peer: errno ",
    "Connection ended, bytes came from a process that did not connect: pid ",
    "Connection ended, it sent something that is no request: pid ",
    "Connection ended, too many bytes of unfinished requests: uid ",
    "Connection ended, too many bytes of unread replies: uid ",
    "A reply could not be written: pid ",
};

std::int64_t secondsNow() {
    const auto now = std::chrono::steady_clock::now().time_since_epoch();
    return std::chrono::duration_cast<std::chrono::seconds>(now).count() + 1;
}

} // namespace

void ListenerIncidents::happened(ListenerIncident incident, std::int64_t about) {
    const auto index = static_cast<std::size_t>(incident);
    Kind& kind = kinds_[index];
    const std::uint64_t count = ++kind.count;
    std::int64_t last = kind.toldAtSeconds;
    const std::int64_t now = secondsNow();
    if (!report_ || last == now || !kind.toldAtSeconds.compare_exchange_strong(last, now))
        return;
    const std::uint64_t told = kind.countTold.exchange(count);
    std::string line = words[index] + std::to_string(about);
    if (count > told + 1)
        line += " (and " + std::to_string(count - told - 1) + " more before)";
    report_(line);
}

std::uint64_t ListenerIncidents::count(ListenerIncident incident) const {
    return kinds_[static_cast<std::size_t>(incident)].count;
}

} // namespace zor::platform
