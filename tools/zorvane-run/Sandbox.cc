// SPDX-License-Identifier: Apache-2.0
#include "Sandbox.h"

#include "Inside.h"
#include "Staging.h"

#include <algorithm>
#include <set>
#include <string_view>
#include <unistd.h>

namespace zorvanerun {

namespace {

constexpr const char* keysFile = "/proc/keys";

void append(std::vector<std::string>& to, std::initializer_list<std::string> more) {
    to.insert(to.end(), more);
}

/// The directories above a mount, made so that everybody may pass: the maker's own way is to close them.
void makeParents(std::vector<std::string>& arguments, const std::string& path, std::set<std::string>& made) {
    for (std::size_t end = path.find('/', 1); end != path.npos; end = path.find('/', end + 1))
        if (made.insert(path.substr(0, end)).second)
            append(arguments, {"--perms", "0755", "--dir", path.substr(0, end)});
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

std::vector<std::string> sandboxArguments(const Options& options, const std::vector<Mount>& mounts,
                                          const ToldContainers& told, const Notifications& notifications,
                                          InsideHandles handles) {
    std::vector<std::string> arguments = {
        options.bubblewrap, "--unshare-pid", "--unshare-ipc", "--unshare-uts", "--new-session", "--cap-drop", "ALL"};
    if (options.network == Network::none)
        arguments.emplace_back("--unshare-net");
    for (const char* capability : {"CAP_SETUID", "CAP_SETGID", "CAP_SETPCAP"})
        append(arguments, {"--cap-add", capability});
    append(arguments, {"--proc", "/proc", "--dev", "/dev"});
    // The keys of all processes of the user, by name.
    if (::access(keysFile, F_OK) == 0)
        append(arguments, {"--ro-bind", "/dev/null", keysFile});
    const std::vector<std::string> socket = notifications.arguments();
    arguments.insert(arguments.end(), socket.begin(), socket.end());
    std::set<std::string> made = {"/proc", "/dev"};
    for (std::size_t i = 0; i < memoryPlaces.size(); ++i) {
        append(arguments, {"--bind", stagedMemoryPath(i), memoryPlaces[i]});
        made.insert(memoryPlaces[i]);
    }
    for (std::size_t i = 0; i < mounts.size(); ++i) {
        const Mount& mount = mounts[i];
        makeParents(arguments, mount.path, made);
        if (mount.linkTarget.empty())
            append(arguments, {mount.isContainer() ? "--bind" : "--ro-bind", stagedPath(i), mount.path});
        else
            append(arguments, {"--symlink", mount.linkTarget, mount.path});
    }
    append(arguments,
           {"--", "/proc/self/fd/" + std::to_string(handles.program), insideOption, std::to_string(handles.channel),
            std::to_string(options.user), networkName(options.network), told.data});
    arguments.insert(arguments.end(), options.command.begin(), options.command.end());
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
    return environment;
}

} // namespace zorvanerun
