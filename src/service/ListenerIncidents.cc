// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerIncidents.h"

#include "base/Format.h"

#include <chrono>
#include <exception>
#include <string>

namespace zor::platform {

namespace {

std::string lineOf(ListenerIncident incident, std::int64_t about, std::uint64_t requestId) {
    const auto number = static_cast<long long>(about);
    const auto request = static_cast<unsigned long long>(requestId);
    switch (incident) {
    case ListenerIncident::tooManyConnections:
        return formatted("Connection refused, too many connections: uid %lld", number);
    case ListenerIncident::outOfDescriptors:
        return formatted("Connection refused, out of descriptors or memory: errno %lld", number);
    case ListenerIncident::unknownPeer:
        return formatted("Connection refused, the kernel does not tell the peer: errno %lld", number);
    case ListenerIncident::foreignSender:
        return formatted("Connection ended, bytes came from a process that did not connect: pid %lld", number);
    case ListenerIncident::brokenFrame:
        return formatted("Connection ended, it sent something that is no request: pid %lld", number);
    case ListenerIncident::tooMuchInput:
        return formatted("Connection ended, too many bytes of unfinished requests: uid %lld", number);
    case ListenerIncident::tooMuchOutput:
        return formatted("Connection ended, too many bytes of unread replies: uid %lld, request %llu", number, request);
    case ListenerIncident::unwritableReply:
        return formatted("A reply could not be written: uid %lld, request %llu", number, request);
    case ListenerIncident::unservable:
        return formatted("Connection ended, its request could not be served: pid %lld", number);
    }
    return {};
}

std::int64_t secondsNow() {
    const auto now = std::chrono::steady_clock::now().time_since_epoch();
    return std::chrono::duration_cast<std::chrono::seconds>(now).count();
}

} // namespace

void ListenerIncidents::happened(ListenerIncident incident, std::int64_t about, std::uint64_t request) noexcept {
    const auto index = static_cast<std::size_t>(incident);
    Kind& kind = kinds_[index];
    const std::uint64_t count = ++kind.count;
    std::int64_t from = kind.tellFromSeconds;
    const std::int64_t now = secondsNow();
    if (!report_ || now < from || !kind.tellFromSeconds.compare_exchange_strong(from, now + lineEvery_.count()))
        return;
    const std::uint64_t told = kind.countTold.exchange(count);
    try {
        std::string line = lineOf(incident, about, request);
        if (count > told + 1)
            line += formatted(" (and %llu more before)", static_cast<unsigned long long>(count - told - 1));
        report_(line);
    } catch (const std::exception&) {
        return; // the next line of this kind is due in a while
    }
}

std::uint64_t ListenerIncidents::count(ListenerIncident incident) const {
    return kinds_[static_cast<std::size_t>(incident)].count;
}

} // namespace zor::platform
