// SPDX-License-Identifier: Apache-2.0
#include "Content.h"

#include "Decoder.h"
#include "ItemRules.h"
#include "SealedDirectory.h"
#include "Unpacker.h"
#include "fs/Trees.h"
#include "platform/Errno.h"
#include "zorvane/Text.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <fcntl.h>
#include <optional>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace zorvanectl::content {

using zor::platform::FileDescriptor;

namespace {

/// A tar ends with empty blocks. One that was cut between two entries lacks them, and its reader would not notice.
constexpr std::size_t tarBlockBytes = 512;

Outcome<void> checkTarEnd(int archive, std::uint64_t bytes) {
    std::array<char, tarBlockBytes> block{};
    if (bytes < block.size() || ::pread(archive, block.data(), block.size(),
                                        static_cast<off_t>(bytes - block.size())) != static_cast<ssize_t>(block.size()))
        return refused("the archive's end cannot be read");
    if (std::ranges::any_of(block, [](char byte) { return byte != 0; }))
        return refused("the archive has no end: it was cut");
    return {};
}

Outcome<void> unpack(zor::platform::Disk& disk, const SealedDirectory& sealed, const Source& source, Owner owner,
                     Course& course) {
    course.expectBytes(source.bytes());
    const Decoder decoder = TRY(Decoder::start(source.get()));
    const std::uint32_t end = TRY(Unpacker(disk, sealed.get(), owner, course).unpack(decoder.records()));
    return (end & recordUncompressedTar) != 0 ? checkTarEnd(source.get(), source.bytes()) : Outcome<void>();
}

/// Copies a directory, and keeps why an item was refused.
class DirectoryCopy {
public:
    DirectoryCopy(const struct stat& container, const Source& source, Course& course)
        : container_(container), holders_(source.holders()), course_(course) {}

    [[nodiscard]] Outcome<void> copy(zor::platform::Disk& disk, const Source& source, const SealedDirectory& sealed) {
        const zor::fs::ContentRules rules{
            .owner = container_.st_uid,
            .group = container_.st_gid,
            .admit = [this](const zor::fs::WalkEntry& entry, int item,
                            const char* target) { return admit(entry, item, target); },
            .copied = [this](std::uint64_t bytes) { return answer(course_.addBytes(bytes)); },
            .failed = [this](const zor::fs::WalkEntry& entry, zor::Errno error) { fail(entry, error); }};
        const zor::Errno error = zor::fs::copyContent(disk, source.get(), sealed.get(), rules);
        if (!error)
            return {};
        return failure_ ? std::unexpected(*failure_) : failed("the source cannot be copied", error);
    }

private:
    zor::Errno admit(const zor::fs::WalkEntry& entry, int item, const char* target) {
        if (entry.status.st_dev == container_.st_dev && entry.status.st_ino == container_.st_ino)
            return answer(refused("the source holds the container itself"));
        const std::string name = entry.path();
        if (const auto why =
                whyRefused({.name = name, .mode = entry.status.st_mode, .linkTarget = target ? target : ""}))
            return answer(refused(refusal(name, *why)));
        if (const auto why = holders_.whyRefused(entry.depth, entry.status, item))
            return answer(refused(refusal(name, *why)));
        if (S_ISDIR(entry.status.st_mode))
            holders_.enter(entry.depth, entry.status);
        return answer(course_.addItem());
    }

    zor::Errno answer(const Outcome<void>& outcome) {
        if (outcome)
            return zor::Errno();
        failure_ = outcome.error();
        return zor::Errno(ECANCELED);
    }

    void fail(const zor::fs::WalkEntry& entry, zor::Errno error) {
        if (failure_)
            return;
        const std::string name = entry.depth == 0 ? "the source" : zorvane::printable(entry.path());
        if (entry.onOtherFileSystem)
            failure_ = refused(name + " lies on another file system than the source").error();
        else
            failure_ = failed(name + " cannot be copied", error).error();
    }

    const struct stat& container_;
    Holders holders_;
    Course& course_;
    std::optional<Failure> failure_;
};

} // namespace

Outcome<Source> Source::open(const std::string& path) {
    Source source;
    source.file_ = TRY(openForInstallation(path, source.holders_));
    struct stat status{};
    if (::fstat(source.file_.get(), &status) != 0)
        return failed(zorvane::printable(path) + " cannot be opened", zor::Errno::last());
    if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode))
        return failed(zorvane::printable(path) + " is neither a directory nor a file");
    source.isDirectory_ = S_ISDIR(status.st_mode);
    source.bytes_ = static_cast<std::uint64_t>(status.st_size);
    return source;
}

Outcome<Source> Source::ofStandardInput() {
    constexpr const char* place = "/var/tmp";
    constexpr mode_t mode = 0600;
    if (::isatty(STDIN_FILENO) != 0)
        return failed("standard input is a terminal, and no archive");
    Source source;
    source.file_.reset(::open(place, O_TMPFILE | O_RDWR | O_CLOEXEC, mode));
    if (!source.file_.valid())
        return failed(std::string("an archive from standard input cannot be kept in ") + place, zor::Errno::last());
    std::vector<char> buffer(std::size_t{1} << 20);
    for (;;) {
        const ssize_t count = ::read(STDIN_FILENO, buffer.data(), buffer.size());
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return failed("standard input cannot be read", zor::Errno::last());
        if (count == 0)
            break;
        for (ssize_t done = 0; done < count;) {
            const ssize_t written =
                ::write(source.file_.get(), buffer.data() + done, static_cast<std::size_t>(count - done));
            if (written < 0 && errno == EINTR)
                continue;
            if (written <= 0)
                return failed(std::string("an archive from standard input cannot be kept in ") + place,
                              zor::Errno::last());
            done += written;
        }
        source.bytes_ += static_cast<std::uint64_t>(count);
    }
    if (source.bytes_ == 0)
        return failed("standard input is empty, and no archive");
    if (::lseek(source.file_.get(), 0, SEEK_SET) != 0)
        return failed("the archive cannot be read from its beginning", zor::Errno::last());
    return source;
}

Outcome<Progress> putContent(zor::platform::Disk& disk, int container, const Source& source, const Observer& observer,
                             const volatile std::sig_atomic_t& stop) {
    struct stat status{};
    if (::fstat(container, &status) != 0)
        return failed("the container cannot be examined", zor::Errno::last());
    const auto report = [&](Phase phase, const Progress& progress) {
        if (observer.progressed)
            observer.progressed(phase, progress);
    };
    Course course(container, stop, [&](const Progress& progress) { report(Phase::copying, progress); });
    TRY(course.checkRoom());
    SealedDirectory sealed = TRY(SealedDirectory::make(disk, container));
    Outcome<void> done;
    if (source.isDirectory()) {
        if (observer.wantsShare)
            course.expectBytes(zor::fs::diskUsage(source.get(), {}, {}).bytes);
        done = DirectoryCopy(status, source, course).copy(disk, source, sealed);
    } else {
        done = unpack(disk, sealed, source, {.user = status.st_uid, .group = status.st_gid}, course);
    }
    if (done)
        done = sealed.raise();
    report(Phase::syncing, course.progress());
    if (done)
        if (const zor::Errno error = disk.syncFileSystem(container))
            done = failed("the content cannot be brought to the disk", error);
    if (done)
        done = course.checkStopped();
    TRY(std::move(done));
    return course.progress();
}

} // namespace zorvanectl::content
