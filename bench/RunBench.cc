// SPDX-License-Identifier: Apache-2.0
// Starting a program in its sandbox, from the start of zorvane-run to the program's end, against bubblewrap alone with
// the same mounts and namespaces.
#include "Benchmarks.h"

#include "ipc/Protocol.h"
#include "store/ZOREntitlementMapping.h"

#include <array>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <unistd.h>

namespace zor::bench {

namespace {

constexpr const char* identifier = "com.example.application.run";
constexpr const char* bubblewrap = "/usr/bin/bwrap";
constexpr const char* program = "/bin/true";

void registerGroups(const Daemon& daemon) {
    Client client = daemon.connect();
    const auto reply = client.exchange(requestFrame({
        {std::string(ipc::keys::command), static_cast<std::uint64_t>(ipc::Command::processEntitlements)},
        {std::string(ipc::keys::identifier), identifier},
        {std::string(ipc::keys::entitlements),
         plist::Dictionary{{std::string(entitlementKeys::applicationGroups), plist::Array{"group.one", "group.two"}}}},
    }));
    if (replyOf(reply).unsignedInteger(ipc::keys::replyError) != ipc::replySuccess)
        throw Failure("a registration failed");
}

std::vector<std::string> launch(const std::string& launcher, const std::string& root) {
    return {launcher, "--root", root, "--identifier", identifier, "--user", std::to_string(userId), "--", program};
}

/// A program's standard output; a failure unless it ends well.
std::string outputOf(const std::vector<std::string>& command) {
    std::string line;
    for (const std::string& word : command)
        line += "'" + word + "' ";
    std::FILE* output = ::popen(line.c_str(), "re");
    if (!output)
        failWithErrno("popen");
    std::string text;
    std::array<char, 4096> buffer{};
    while (const std::size_t count = std::fread(buffer.data(), 1, buffer.size(), output))
        text.append(buffer.data(), count);
    if (::pclose(output) != 0)
        throw Failure(command.front() + " failed");
    return text;
}

/// Bubblewrap with the mounts that the launcher says it would make.
std::vector<std::string> bareCommand(std::vector<std::string> launcherCommand) {
    launcherCommand.insert(launcherCommand.begin() + 1, {"--dry-run", "--json"});
    const auto plan = nlohmann::json::parse(outputOf(launcherCommand));
    std::vector<std::string> command = {bubblewrap,      "--unshare-pid", "--unshare-ipc", "--unshare-uts",
                                        "--unshare-net", "--new-session", "--proc",        "/proc",
                                        "--dev",         "/dev",          "--tmpfs",       "/tmp"};
    for (const auto& mount : plan.at("mounts")) {
        const std::string path = mount.at("path");
        if (mount.contains("linkTarget"))
            command.insert(command.end(), {"--symlink", mount.at("linkTarget"), path});
        else
            command.insert(command.end(), {mount.at("writable") ? "--bind" : "--ro-bind", path, path});
    }
    command.insert(command.end(), {"--", program});
    return command;
}

} // namespace

std::vector<Figure> measureRun(const Settings& settings) {
    Figure figure{.name = "run.start",
                  .what = "a program started by zorvane-run, p50",
                  .measured = "",
                  .floor = "",
                  .unit = "x",
                  .goal = 1.5,
                  .remark = "needs root and bubblewrap"};
    const std::string launcher = settings.daemonProgram.substr(0, settings.daemonProgram.rfind('/')) + "/zorvane-run";
    if (::geteuid() != 0 || ::access(bubblewrap, X_OK) != 0 || ::access(launcher.c_str(), X_OK) != 0)
        return {figure};
    const Place place(*settings.scratch, "run", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    admitProgram(place.path(), "run",
                 {{"Identifier", "com.veltra.zorvane-run"},
                  {"Executable", launcher},
                  {"KernelAgent", true},
                  {"Entitlements", plist::Dictionary()}});
    const Daemon daemon(settings, place.path(), {});
    registerGroups(daemon);
    const auto command = launch(launcher, place.path());
    const auto bare = bareCommand(command);
    Pairs pairs;
    const int runs = settings.rounds(100, 30);
    for (int run = -2; run < runs; ++run) {
        const double measured = runProgram(command) * 1e3;
        const double floor = runProgram(bare) * 1e3;
        if (run < 0) // warms up, and makes the containers
            continue;
        pairs.measured.push_back(measured);
        pairs.floor.push_back(floor);
    }
    figure.measured = text("%.2f ms", pairs.measuredMedian());
    figure.floor = text("%.2f ms", pairs.floorMedian());
    figure.value = pairs.ratio();
    figure.remark =
        "the floor is bubblewrap with the same mounts and namespaces; a data and two group containers, /bin/true";
    figure.numbers = {{"p50ms", pairs.measuredMedian()}, {"floorP50ms", pairs.floorMedian()}};
    return {figure};
}

} // namespace zor::bench
