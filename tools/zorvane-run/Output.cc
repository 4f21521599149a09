// SPDX-License-Identifier: Apache-2.0
#include "Output.h"

#include "Sandbox.h"

#include <algorithm>
#include <cstdio>
#include <nlohmann/json.hpp>

namespace zorvanerun {

namespace {

// Names are bytes; what is not UTF-8 is shown as a replacement character rather than ending the program. In ASCII: some
// characters beyond it steer terminals, and programs read either form.
std::string dumped(const nlohmann::json& document) {
    return document.dump(2, ' ', true, nlohmann::json::error_handler_t::replace);
}

/// As zorvanectl's: a key may come with the same number; one that goes or means something else raises it.
constexpr int jsonVersion = 1;

nlohmann::json asJson(const Options& options, const std::vector<Mount>& mounts, const ToldContainers& told) {
    nlohmann::json list = nlohmann::json::array();
    for (const Mount& mount : mounts) {
        nlohmann::json row = {{"kind", kindName(mount.kind)}, {"path", mount.path}, {"writable", mount.isContainer()}};
        if (mount.isContainer())
            row["identifier"] = mount.identifier;
        if (!mount.linkTarget.empty())
            row["linkTarget"] = mount.linkTarget;
        list.push_back(std::move(row));
    }
    return {{"version", jsonVersion},
            {"identifier", options.identifier},
            {"user", options.user},
            {"home", told.data},
            {"temporary", told.temporary},
            {"network", networkName(options.network)},
            {"program", options.command},
            {"mounts", std::move(list)},
            {"environment", sandboxEnvironment(options, told)}};
}

} // namespace

int sayFailure(const Options& options, const Failure& failure) {
    if (options.json)
        std::fprintf(
            stderr, "%s\n",
            dumped({{"version", jsonVersion},
                    {"error",
                     {{"kind", "local"},
                      {"message", failure.what},
                      {"advice", failure.advice},
                      {"while", options.identifier.empty() ? "read the command line" : "run " + options.identifier},
                      {"exitCode", exitFailure}}}})
                .c_str());
    else
        std::fprintf(stderr, "zorvane-run: %s\n  What to do: %s.\n", printable(failure.what).c_str(),
                     printable(failure.advice).c_str());
    return exitFailure;
}

bool outputReached() {
    if (std::fflush(stdout) == 0 && std::ferror(stdout) == 0)
        return true;
    std::fputs("zorvane-run: standard output cannot be written to\n", stderr);
    return false;
}

int showPlan(const Options& options, const std::vector<Mount>& mounts, const ToldContainers& told) {
    if (options.json) {
        std::printf("%s\n", dumped(asJson(options, mounts, told)).c_str());
        return outputReached() ? exitDone : exitFailure;
    }
    std::printf("%s would run as user %u, in %s, with %s network and\n", printable(options.command.front()).c_str(),
                options.user, printable(told.data).c_str(), options.network == Network::host ? "the host's" : "no");
    std::size_t width = 0;
    for (const Mount& mount : mounts)
        width = std::max(width, printable(mount.identifier).size());
    for (const Mount& mount : mounts) {
        const char* access = mount.isContainer() ? "write" : "read";
        const std::string target = mount.linkTarget.empty() ? "" : " -> " + mount.linkTarget;
        std::printf("  %-5s  %-17s  %-*s  %s%s\n", access, kindName(mount.kind), static_cast<int>(width),
                    printable(mount.identifier).c_str(), printable(mount.path).c_str(), printable(target).c_str());
    }
    return outputReached() ? exitDone : exitFailure;
}

} // namespace zorvanerun
