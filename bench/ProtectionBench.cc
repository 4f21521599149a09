// SPDX-License-Identifier: Apache-2.0
// Changing the data-protection class of a container with many files, the device being unlocked, against a bare walk
// that changes the same attributes back.
#include "Benchmarks.h"
#include "ContentTree.h"
#include "TreeFloor.h"

#include "ipc/Protocol.h"

#include <fcntl.h>
#include <fstream>
#include <functional>

namespace zor::bench {

namespace {

constexpr const char* identifier = "com.example.application.protected";
constexpr int relaxed = 3; // what a container has from the beginning
constexpr int strict = 1;

Frame changeTo(int protectionClass) {
    return containerFrame(ipc::Command::setDataProtection, identifier, ContainerClass::dataApplication,
                          {{std::string(ipc::keys::dataProtectionClass), protectionClass}});
}

/// Says that the device is unlocked, as whoever manages the lock does, rather than leave the file out.
void unlock(const std::string& runtimeDirectory) {
    std::ofstream file(runtimeDirectory + "/" + std::string(ipc::lockStateFile));
    file << "0\n";
    file.close();
    if (!file)
        throw Failure("the lock state cannot be written");
}

} // namespace

std::vector<Figure> measureProtection(const Settings& settings) {
    const int files = settings.rounds(100'000, 20'000);
    const Place place(*settings.scratch, "protection", {.bytes = std::uint64_t{1} << 30, .inodes = 150'000});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {});
    unlock(daemon.socketDirectory());
    Client client = daemon.connect();
    const Container container = makeContainer(client, identifier, ContainerClass::dataApplication);
    const ContentTree tree(container.path + "/Documents/content", {.files = files});
    const platform::FileDescriptor directory(::open(tree.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const char* attribute = protectionAttributeOn(directory.get());
    tree.initializeAttributes(attribute, '0' + relaxed);
    writeOut(place.path());

    const auto compare = [&](const std::function<void()>& before) {
        Pairs pairs;
        for (int round = -1; round < 5; ++round) {
            before();
            const auto begin = Clock::now();
            (void)succeed(client, changeTo(strict));
            const double seconds = secondsSince(begin);
            const double floor = tree.setAttributes(attribute, '0' + strict, '0' + relaxed);
            (void)succeed(client, changeTo(relaxed)); // of the directories alone, and of the record
            if (round < 0)
                continue;
            pairs.measured.push_back(seconds);
            pairs.floor.push_back(floor);
        }
        return pairs;
    };
    const auto figure = [&](const Pairs& pairs, const char* name, std::string what, std::string remark) {
        return Figure{.name = name,
                      .what = std::move(what),
                      .measured = text("%.0f ms", pairs.measuredMedian() * 1e3),
                      .floor = text("%.0f ms", pairs.floorMedian() * 1e3),
                      .value = pairs.ratio(),
                      .unit = "x",
                      .goal = 1.15,
                      .remark = std::move(remark),
                      .numbers = {{"seconds", pairs.measuredMedian()}, {"floorSeconds", pairs.floorMedian()}}};
    };
    const Pairs settled = compare([] {});
    const Pairs fresh = compare([&] { unlock(daemon.socketDirectory()); });
    return {figure(settled, "protection.change", text("class change of %d files", files),
                   text("%.2f us for each file, of the floor %.2f; on ", settled.measuredMedian() * 1e6 / files,
                        settled.floorMedian() * 1e6 / files) +
                       place.description()),
            figure(fresh, "protection.fresh", text("class change of %d files, right after an unlock", files),
                   "the lock state was told just before")};
}

} // namespace zor::bench
