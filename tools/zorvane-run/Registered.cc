// SPDX-License-Identifier: Apache-2.0
#include "Registered.h"

#include "platform/Errno.h"
#include "zorvane/Client.h"

namespace zorvanerun {

namespace {

constexpr std::uint32_t answerMilliseconds = 30'000;

Failure failureOf(const zorvane::Error& error, const std::string& what) {
    using Kind = zorvane::Error::Kind;
    Failure failure{.what = what + ": " + error.message, .advice = {}};
    switch (error.kind) {
    case Kind::unreachable:
        failure.advice = "start the daemon (systemctl start zorvaned), or name its root with --root";
        break;
    case Kind::refused:
        failure.advice = "register this program as the kernel's agent: an entry like the example zorvane-run.plist in "
                         "etc/zorvane/identities.d, see zorvane-run(8)";
        break;
    case Kind::timedOut:
        failure.advice = "look at the daemon's log (zorvaned.log)";
        break;
    case Kind::protocol:
        failure.advice = "check that daemon and program are of one version";
        break;
    case Kind::daemon:
        failure.what += " (code " + std::to_string(error.code) + ")";
        failure.advice = zorvane::errorText(error.code).advice;
        break;
    }
    return failure;
}

std::string registerCommand(const Options& options, const std::string& rest) {
    const std::string root = options.root == "/" ? "" : "--root " + options.root + " ";
    return "register it: zorvanectl " + root + "entitlements set " + options.identifier + " " + rest +
           " (with all else that the identifier is entitled to: what is set takes the place of what was)";
}

/// Those named, each of which has to be registered; all that are registered when none is named.
Result<std::set<std::string>> choose(const zorvane::Client::GroupPaths& registered,
                                     const std::vector<std::string>& named, const char* kind, const char* option,
                                     const Options& options) {
    std::set<std::string> chosen(named.begin(), named.end());
    for (const std::string& group : chosen)
        if (!registered.contains(group))
            return std::unexpected(
                Failure{.what = group + " is no " + kind + " group that is registered for " + options.identifier,
                        .advice = registerCommand(options, std::string(option) + " " + group)});
    if (named.empty())
        for (const auto& [group, path] : registered)
            chosen.insert(group);
    return chosen;
}

Result<bool> chooseSystemContainer(bool registered, const Options& options) {
    if (options.systemContainer && *options.systemContainer != options.identifier)
        return std::unexpected(Failure{
            .what = "the system container of " + *options.systemContainer + " cannot be given to " + options.identifier,
            .advice = "name the identifier itself: a system container has one owner. What several share is a "
                      "system group's"});
    if (registered || !options.systemContainer)
        return registered;
    return std::unexpected(Failure{.what = "no system container is registered for " + options.identifier,
                                   .advice = registerCommand(options, "--system-container")});
}

} // namespace

Result<WantedContainers> chooseContainers(const Options& options, const PassedSockets& passed) {
    const std::string what = "cannot look for the groups and the system container of " + options.identifier;
    auto client = zorvane::Client::connect({.root = options.root, .timeoutMilliseconds = answerMilliseconds});
    if (!client)
        return std::unexpected(failureOf(client.error(), what));
    const auto shared = client->sharedContainers(options.user, options.identifier);
    if (!shared)
        return std::unexpected(failureOf(shared.error(), what));
    TRY(passed.judgeAllowed(shared->passedSockets, options.identifier));
    auto applicationGroups =
        TRY(choose(shared->applicationGroups, options.applicationGroups, "application", "--app-group", options));
    auto systemGroups = TRY(choose(shared->systemGroups, options.systemGroups, "system", "--system-group", options));
    const bool systemContainer = TRY(chooseSystemContainer(shared->systemContainer.has_value(), options));
    return WantedContainers{.applicationGroups = std::move(applicationGroups),
                            .systemGroups = std::move(systemGroups),
                            .systemContainer = systemContainer};
}

} // namespace zorvanerun
