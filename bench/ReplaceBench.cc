// SPDX-License-Identifier: Apache-2.0
// Putting a new bundle container in the place of an old one, with all syncs, against the bare system calls that move
// the same things in the same order; and what a bundle takes, asked for the second time, against a lookup.
#include "Benchmarks.h"
#include "RoundTripPairs.h"
#include "Writers.h"

#include <chrono>
#include <fcntl.h>
#include <filesystem>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::bench {

namespace {

using platform::FileDescriptor;

constexpr ContainerClass containerClass = ContainerClass::bundleApplication;
constexpr const char* identifier = "com.example.application.replaced";
constexpr std::size_t journalBytes = 700; // about what four paths take
constexpr std::size_t metadataBytes = 400;

void must(long result) {
    if (result < 0)
        failWithErrno("the floor of replacing");
}

/// Two places for containers, and the daemon's three for what is on its way.
class ReplaceFloor {
public:
    explicit ReplaceFloor(const std::string& place) : path_(place + "/floor") {
        for (FileDescriptor* directory : {&live_, &fresh_, &staging_, &journals_, &dead_}) {
            const std::string path = path_ + "/" + std::to_string(next_++);
            std::filesystem::create_directories(path);
            directory->reset(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
            must(directory->get());
        }
        makeContainer(live_, old_);
    }

    /// Makes a new container and puts it in the place of the last one; the microseconds that the second took.
    double replace() {
        const std::string fresh = std::to_string(next_++);
        makeContainer(fresh_, fresh);
        const auto begin = Clock::now();
        const std::string journal = fresh + ".plist";
        writeNew(journals_, ".new-" + journal, journalBytes);
        must(::renameat(journals_.get(), (".new-" + journal).c_str(), journals_.get(), journal.c_str()));
        must(::fsync(journals_.get()));
        must(::renameat(live_.get(), old_.c_str(), staging_.get(), fresh.c_str()));
        must(::renameat(fresh_.get(), fresh.c_str(), live_.get(), fresh.c_str()));
        moveToDead(staging_, fresh, "a" + fresh);
        moveToDead(journals_, journal, "b" + fresh);
        must(::fsync(live_.get()));
        const double microseconds = secondsSince(begin) * 1e6;
        old_ = fresh;
        return microseconds;
    }

private:
    static void writeNew(const FileDescriptor& directory, const std::string& name, std::size_t bytes) {
        const FileDescriptor file(
            ::openat(directory.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        const std::string content(bytes, 'z');
        must(::write(file.get(), content.data(), content.size()));
        must(::fsync(file.get()));
    }
    void makeContainer(const FileDescriptor& directory, const std::string& name) const {
        must(::mkdirat(directory.get(), name.c_str(), 0755));
        writeNew(directory, name + "/metadata", metadataBytes);
        must(::fsync(directory.get()));
    }
    void moveToDead(const FileDescriptor& from, const std::string& name, const std::string& own) const {
        must(::mkdirat(dead_.get(), own.c_str(), 0700));
        must(::renameat(from.get(), name.c_str(), dead_.get(), (own + "/" + name).c_str()));
    }

    const std::string path_;
    FileDescriptor live_, fresh_, staging_, journals_, dead_;
    int next_ = 0;
    std::string old_ = "first";
};

template <typename Maker>
std::vector<double> block(Maker& maker, int count) {
    std::vector<double> microseconds;
    for (int i = 0; i < count; ++i)
        microseconds.push_back(maker.replace());
    return microseconds;
}

double syncsOfReplace(const Settings& settings) {
    constexpr int replaces = 20;
    const Place place(*settings.scratch, "replace-syncs", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    SyncCounter counter;
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on, .syncCounter = &counter});
    if (!counter.works())
        return 0;
    Client client = daemon.connect();
    (void)makeContainer(client, "com.example.first", containerClass, Lifetime::transient);
    const long before = counter.count();
    for (int i = 0; i < replaces; ++i)
        (void)makeContainer(client, text("com.example.%d", i), containerClass, Lifetime::transient);
    const long made = counter.count() - before;
    Replacer replacer(daemon, identifier);
    const long middle = counter.count();
    (void)block(replacer, replaces);
    return static_cast<double>(counter.count() - middle - made) / replaces;
}

Figure replaceFigure(const Settings& settings) {
    const Place place(*settings.scratch, "replace", {.bytes = std::uint64_t{512} << 20, .inodes = 65536});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on});
    Replacer replacer(daemon, identifier);
    ReplaceFloor floor(place.path());
    const int each = settings.rounds(20, 10);
    const RoundTripPairs pairs = roundTripsInTurns(
        settings.rounds(15, 7), [&] { return block(replacer, each); }, [&] { return block(floor, each); });
    return {.name = "replace.durable",
            .what = "replace, durable, p50",
            .measured = text("%.0f us", pairs.blocks.measuredMedian()),
            .floor = text("%.0f us", pairs.blocks.floorMedian()),
            .value = pairs.blocks.ratio(),
            .unit = "x",
            .goal = 1.25,
            .remark = text("%.2f syncs each, of the floor 3; on ", syncsOfReplace(settings)) + place.description(),
            .numbers = {{"p50us", pairs.blocks.measuredMedian()}, {"floorP50us", pairs.blocks.floorMedian()}}};
}

/// A little longer than the daemon waits for a bundle's last change.
constexpr std::chrono::seconds bundleSettled{11};

Figure bundleUsageFigure(const Settings& settings) {
    const Place place(*settings.scratch, "bundle", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    const int processor = measuringProcessor();
    const Daemon daemon(settings, place.path(), {.processor = processor});
    Client client = daemon.connect();
    const Container bundle = makeContainer(client, identifier, containerClass);
    const Frame usage = containerFrame(ipc::Command::getDiskUsage, identifier, containerClass,
                                       {{std::string(ipc::keys::uuid), bundle.uuid}});
    const Frame lookup = containerRequest(identifier, containerClass, Create::no);
    // Sooner a bundle counts as being filled, and is measured by every query.
    std::this_thread::sleep_for(bundleSettled);
    (void)succeed(client, usage);
    const auto answer = [&](const Frame& request) {
        const auto reply = client.exchange(request);
        return Frame(reply.begin(), reply.end());
    };
    const Frame used = answer(usage);
    const Frame found = answer(lookup);
    mustSucceed(found, true);
    if (replyOf(used).unsignedInteger(ipc::keys::replyError) != ipc::replySuccess)
        throw Failure("a bundle was not measured");
    const int requests = settings.rounds(2000, 1000);
    const Pinned pinned(processor);
    Figure figure = roundTripsInTurns(
                        settings.rounds(31, 11), [&] { return roundTrips(client, usage, used, requests); },
                        [&] { return roundTrips(client, lookup, found, requests); })
                        .figure("usage.bundle", "usage of a bundle, second query, against a lookup", 1.3, usage, used);
    return figure;
}

} // namespace

std::vector<Figure> measureReplace(const Settings& settings) {
    return {replaceFigure(settings), bundleUsageFigure(settings)};
}

} // namespace zor::bench
