// SPDX-License-Identifier: Apache-2.0
// A directory installed as a bundle with zorvanectl, against cp -a of it and a sync of the file system.
#include "Benchmarks.h"
#include "ContentTree.h"

#include "platform/Service.h"

#include <filesystem>

namespace zor::bench {

namespace {

constexpr ContainerClass containerClass = ContainerClass::bundleApplication;

/// The container goes again, and what it held with it.
void checkAndDelete(const Daemon& daemon, const std::string& identifier) {
    Client client = daemon.connect();
    const auto found = succeed(client, containerRequest(identifier, containerClass, Create::no));
    if (!std::filesystem::exists(*found.string(ipc::keys::replyPath) + "/0000/00/file-0000000.data"))
        throw Failure("zorvanectl installed something else");
    (void)succeed(client, containerFrame(ipc::Command::deleteContainer, identifier, containerClass));
    (void)succeed(client, requestFrame({{std::string(ipc::keys::command),
                                         static_cast<std::uint64_t>(ipc::Command::deleteContainersOnDeathRow)}}));
}

} // namespace

std::vector<Figure> measureInstall(const Settings& settings) {
    const int files = settings.rounds(20'000, 4'000);
    const std::size_t fileBytes = (std::size_t{1} << 30) / 20'000;
    const std::string tool = settings.daemonProgram.substr(0, settings.daemonProgram.rfind('/')) + "/zorvanectl";
    const Place place(*settings.scratch, "install", {.bytes = std::uint64_t{4} << 30, .inodes = 131072});
    prepareRoot(settings, place.path());
    admitProgram(place.path(), "zorvanectl",
                 {{"Identifier", "com.veltra.zorvanectl"},
                  {"Executable", tool},
                  {"Entitlements", plist::Dictionary{{std::string(platform::entitlementKeys::allowed), true}}}});
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on});
    const ContentTree source(place.path() + "/source", {.files = files, .fileBytes = fileBytes});
    const std::string copy = place.path() + "/copy";
    Pairs pairs;
    for (int round = 0; round < settings.rounds(3, 2); ++round) {
        const std::string identifier = text("com.example.application.installed.%d", round);
        writeOut(place.path());
        pairs.measured.push_back(runProgram({tool, "--root", place.path(), "install", "--class", "bundle-app", "--yes",
                                             "--progress", "none", identifier, source.path()}));
        checkAndDelete(daemon, identifier);
        writeOut(place.path());
        const auto begin = Clock::now();
        (void)runProgram({"cp", "-a", source.path(), copy});
        writeOut(place.path());
        pairs.floor.push_back(secondsSince(begin));
        std::filesystem::remove_all(copy);
    }
    return {{.name = "install",
             .what = text("install of %.0f MiB in %d files, against cp -a and sync",
                          static_cast<double>(fileBytes) * files / (1 << 20), files),
             .measured = text("%.2f s", pairs.measuredMedian()),
             .floor = text("%.2f s", pairs.floorMedian()),
             .value = pairs.ratio(),
             .unit = "x",
             .goal = 1.1,
             .remark = "on " + place.description(),
             .numbers = {{"seconds", pairs.measuredMedian()}, {"floorSeconds", pairs.floorMedian()}}}};
}

} // namespace zor::bench
