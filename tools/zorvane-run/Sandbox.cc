// SPDX-License-Identifier: Apache-2.0
#include "Sandbox.h"

#include "Inside.h"
#include "Staging.h"

#include <algorithm>
#include <string_view>
#include <unistd.h>

namespace zorvanerun {

namespace {

constexpr const char* keysFile = "/proc/keys";

void append(std::vector<std::string>& to, std::initializer_list<std::string> more) {
    to.insert(to.end(), more);
}

std::string linesOf(const std::map<std::string, std::string>& groups) {
    std::string lines;
    for (const auto& [identifier, path] : groups)
        lines += (lines.empty() ? "" : "\n") + identifier + "\t" + path;
    return lines;
}

/// How to speak to a person; nothing else of the caller's is the program's business.
bool isPassedOn(std::string_view variable) {
    constexpr std::string_view names[] = {"LANG=", "LANGUAGE=", "TERM=", "TZ="};
    return variable.starts_with("LC_") ||
           std::ranges::any_of(names, [&](std::string_view name) { return variable.starts_with(name); });
}

} // namespace

std::vector<std::string> makerCommand(const Options& options, const PassedSockets& passed, InsideHandles handles) {
    std::vector<std::string> command = {options.bubblewrap,
                                        "--args",
                                        std::to_string(handles.arguments),
                                        "--",
                                        "/proc/self/fd/" + std::to_string(handles.program),
                                        insideOption,
                                        std::to_string(handles.channel),
                                        std::to_string(options.user),
                                        networkName(options.network),
                                        std::to_string(passed.count)};
    command.insert(command.end(), options.command.begin(), options.command.end());
    return command;
}

std::vector<std::string> sandboxArguments(const Options& options, const ToldContainers& told,
                                          const Notifications& notifications, const PassedSockets& passed) {
    // The other namespaces are those that it is started in.
    std::vector<std::string> arguments = {"--unshare-pid", "--new-session", "--cap-drop", "ALL"};
    for (const char* capability : {"CAP_SETUID", "CAP_SETGID", "CAP_SETPCAP"})
        append(arguments, {"--cap-add", capability});
    // Each mount in it has its flags; the maker would take the devices away.
    append(arguments, {"--dev-bind", stagedRoot, "/", "--proc", "/proc"});
    // The keys of all processes of the user, by name.
    if (::access(keysFile, F_OK) == 0)
        append(arguments, {"--ro-bind", "/dev/null", keysFile});
    const std::vector<std::string> socket = notifications.arguments();
    arguments.insert(arguments.end(), socket.begin(), socket.end());
    std::vector<std::string> environment = sandboxEnvironment(options, told);
    for (const auto& more : {notifications.environment(), passed.environment()})
        environment.insert(environment.end(), more.begin(), more.end());
    for (const std::string& variable : environment) {
        const std::size_t end = variable.find('=');
        append(arguments, {"--setenv", variable.substr(0, end), variable.substr(end + 1)});
    }
    return arguments;
}

std::vector<std::string> sandboxEnvironment(const Options& options, const ToldContainers& told) {
    std::vector<std::string> environment = {
        "HOME=" + told.data,
        "TMPDIR=" + told.temporary,
        "PATH=/usr/local/bin:/usr/bin:/bin",
        "ZORVANE_IDENTIFIER=" + options.identifier,
        "ZORVANE_APP_GROUPS=" + linesOf(told.applicationGroups),
        "ZORVANE_SYSTEM_GROUPS=" + linesOf(told.systemGroups),
    };
    if (told.systemContainer)
        environment.push_back("ZORVANE_SYSTEM_CONTAINER=" + *told.systemContainer);
    for (char** variable = ::environ; variable && *variable; ++variable)
        if (isPassedOn(*variable))
            environment.emplace_back(*variable);
    // The last of a name counts.
    environment.insert(environment.end(), options.environment.begin(), options.environment.end());
    return environment;
}

} // namespace zorvanerun
