// SPDX-License-Identifier: Apache-2.0
#include "PassedSockets.h"

#include "Descriptors.h"

#include <charconv>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>

namespace zorvanerun {

namespace {

/// More sockets than any unit has; each is a descriptor of every process on the way.
constexpr int socketsMax = 128;
/// Names of 255 bytes, as a service manager lets them be, for each.
constexpr std::size_t namesBytesMax = std::size_t{socketsMax} * 256;

std::unexpected<Failure> failed(std::string what, std::string advice) {
    return std::unexpected(Failure{.what = std::move(what), .advice = std::move(advice)});
}

} // namespace

Result<PassedSockets> PassedSockets::ofCaller() {
    PassedSockets passed;
    const char* const process = std::getenv("LISTEN_PID");
    const char* const count = std::getenv("LISTEN_FDS");
    const char* const names = std::getenv("LISTEN_FDNAMES");
    if (!process || !count || std::to_string(::getpid()) != process)
        return passed;
    const char* const end = count + std::strlen(count);
    const auto [last, error] = std::from_chars(count, end, passed.count);
    if (error != std::errc() || last != end || passed.count < 0 || passed.count > socketsMax ||
        (names && std::strlen(names) > namesBytesMax))
        return failed("LISTEN_FDS=" + std::string(count) +
                          " is no number of sockets that can be passed on, or their "
                          "names are too long",
                      "pass at most " + std::to_string(socketsMax) + " sockets");
    for (int fd = firstPassed; fd < firstPassed + passed.count; ++fd)
        if (::fcntl(fd, F_GETFD) < 0)
            return failed("LISTEN_FDS=" + std::string(count) + ", but descriptor " + std::to_string(fd) +
                              " is not open",
                          "pass as many sockets as it says, or leave it away");
    if (names)
        passed.names = names;
    return passed;
}

Result<void> PassedSockets::judgeKinds(Network network) const {
    for (int fd = firstPassed; fd < firstPassed + count; ++fd)
        if (const char* const why = whyPassedRefused(fd, network))
            return failed("the passed descriptor " + std::to_string(fd) + " " + why,
                          "pass Unix sockets that listen or are connected, or pipes with names; for a socket of the "
                          "network, add --network host: a program can connect it to anything there");
    return {};
}

Result<void> PassedSockets::judgeAllowed(std::optional<bool> allowed, const std::string& identifier) const {
    if (count == 0 || allowed.value_or(false))
        return {};
    const std::string what = std::to_string(count) + " sockets were passed for " + identifier + ", and ";
    if (!allowed)
        return failed(
            what + "zorvaned does not say whether that is allowed: it is older than this program",
            "start the zorvaned that came with this program (systemctl restart zorvaned), or take the sockets "
            "away from the unit");
    return failed(what + "no entry of the registry allows that",
                  "give an entry of etc/zorvane/identities.d with that Identifier the key PassedSockets, or take the "
                  "sockets away from the unit");
}

std::vector<std::string> PassedSockets::environment() const {
    std::vector<std::string> variables;
    if (count > 0)
        variables.push_back("LISTEN_FDS=" + std::to_string(count));
    if (count > 0 && !names.empty())
        variables.push_back("LISTEN_FDNAMES=" + names);
    return variables;
}

} // namespace zorvanerun
