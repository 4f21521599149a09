// SPDX-License-Identifier: Apache-2.0
// Measuring and removing a container with many files, against bare walks over the same tree and, for comparison, the
// programs that do it for everybody.
#include "Benchmarks.h"
#include "ContentTree.h"

#include <filesystem>

namespace zor::bench {

namespace {

constexpr ContainerClass containerClass = ContainerClass::dataApplication;
/// A block; of one file in four, since to write all of them would take most of a run.
constexpr std::size_t fileBytes = 1000;
/// The items of a new container besides its content.
constexpr std::uint64_t bytesOfContainerMax = std::uint64_t{1} << 20;

Container makeIn(const Daemon& daemon, const std::string& identifier) {
    Client client = daemon.connect();
    return makeContainer(client, identifier, containerClass);
}

struct Filled {
    Filled(const Daemon& daemon, const std::string& identifier, int files)
        : container(makeIn(daemon, identifier)),
          tree(container.path + "/Documents/content", {.files = files, .fileBytes = fileBytes, .contentEvery = 4}),
          usageRequest(containerFrame(ipc::Command::getDiskUsage, identifier, containerClass,
                                      {{std::string(ipc::keys::uuid), container.uuid}})) {}

    double usageSeconds(Client& client, std::uint64_t expected) const {
        const auto begin = Clock::now();
        const auto reply = succeed(client, usageRequest);
        const double seconds = secondsSince(begin);
        const std::uint64_t bytes = reply.unsignedInteger(ipc::keys::replyDiskUsage).value_or(0);
        if (bytes < expected || bytes > expected + bytesOfContainerMax)
            throw Failure("the daemon measured something else than the floor");
        return seconds;
    }

    const Container container;
    const ContentTree tree;
    const Frame usageRequest;
};

Figure figureOf(const Pairs& pairs, const char* name, std::string what, double goal, std::string remark = {}) {
    return {.name = name,
            .what = std::move(what),
            .measured = text("%.0f ms", pairs.measuredMedian() * 1e3),
            .floor = text("%.0f ms", pairs.floorMedian() * 1e3),
            .value = pairs.ratio(),
            .unit = "x",
            .goal = goal,
            .remark = std::move(remark),
            .numbers = {{"seconds", pairs.measuredMedian()}, {"floorSeconds", pairs.floorMedian()}}};
}

std::vector<Figure> measureUsage(const Settings& settings, const Place& place, const Daemon& daemon,
                                 const Filled& filled) {
    Client client = daemon.connect();
    const std::string& path = filled.container.path;
    Pairs walk;
    Pairs du;
    for (int round = -1; round < settings.rounds(9, 5); ++round) {
        const ContentTree::Usage floor = filled.tree.measure();
        const double seconds = filled.usageSeconds(client, floor.bytes);
        const double peer = runProgram({"du", "-s", path});
        if (round < 0)
            continue;
        walk.measured.push_back(seconds);
        walk.floor.push_back(floor.seconds);
        du.measured.push_back(seconds);
        du.floor.push_back(peer);
    }
    const int files = filled.tree.files();
    std::vector<Figure> figures = {figureOf(walk, "usage.warm", text("usage of %d files, warm", files), 1.1),
                                   figureOf(du, "usage.du", text("usage of %d files, warm, against du", files), 0.65)};
    Pairs cold;
    const std::uint64_t bytes = filled.tree.measure().bytes;
    for (int round = 0; round < settings.rounds(3, 1) && dropCaches(place.path()); ++round) {
        cold.measured.push_back(filled.usageSeconds(client, bytes));
        dropCaches(place.path());
        (void)runProgram({"du", "-s", "/dev/null"}); // its own pages are not what is measured
        cold.floor.push_back(runProgram({"du", "-s", path}));
    }
    figures.push_back(figureOf(cold, "usage.cold", text("usage of %d files, from the disk, against du", files), 1.1));
    if (cold.measured.empty()) {
        figures.back().value.reset();
        figures.back().remark = "only root may drop the kernel's caches";
    }
    return figures;
}

/// From the request to delete the container until death row is empty.
double removalSeconds(Client& client, const std::string& identifier, const std::string& path) {
    const Frame deletion = containerFrame(ipc::Command::deleteContainer, identifier, containerClass);
    const Frame emptying = requestFrame(
        {{std::string(ipc::keys::command), static_cast<std::uint64_t>(ipc::Command::deleteContainersOnDeathRow)}});
    const auto begin = Clock::now();
    (void)succeed(client, deletion);
    (void)succeed(client, emptying);
    const double seconds = secondsSince(begin);
    if (std::filesystem::exists(path))
        throw Failure("a container was not removed");
    return seconds;
}

} // namespace

std::vector<Figure> measureTree(const Settings& settings) {
    const int files = settings.rounds(200'000, 20'000);
    const Place place(*settings.scratch, "tree", {.bytes = std::uint64_t{4} << 30, .inodes = 500'000});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {});
    const auto identifier = [](int round) { return text("com.example.application.tree.%d", round); };
    std::vector<Figure> figures;
    Pairs removal;
    double peer = 0;
    for (int round = 0; round < settings.rounds(1, 3); ++round) {
        const Filled filled(daemon, identifier(round), files);
        if (round == 0)
            figures = measureUsage(settings, place, daemon, filled);
        const ContentTree floor(place.path() + "/floor", {.files = files, .fileBytes = fileBytes, .contentEvery = 4});
        writeOut(place.path());
        Client deleting = daemon.connect();
        removal.measured.push_back(removalSeconds(deleting, identifier(round), filled.container.path));
        writeOut(place.path());
        removal.floor.push_back(floor.remove());
    }
    {
        const ContentTree tree(place.path() + "/floor", {.files = files, .fileBytes = fileBytes, .contentEvery = 4});
        writeOut(place.path());
        peer = runProgram({"rm", "-rf", tree.path()});
    }
    figures.push_back(figureOf(removal, "removal", text("death-row removal of %d files", files), 0.7,
                               text("rm -rf takes %.0f ms; on ", peer * 1e3) + place.description()));
    return figures;
}

} // namespace zor::bench
