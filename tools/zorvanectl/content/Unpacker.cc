// SPDX-License-Identifier: Apache-2.0
#include "Unpacker.h"

#include "ItemRules.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "zorvane/Text.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <limits>
#include <sys/stat.h>
#include <unistd.h>

namespace zorvanectl::content {

using zor::platform::FileDescriptor;
using zor::platform::openBeneathOnMount;

namespace {

constexpr mode_t accessBits = 0777;
constexpr mode_t impliedDirectoryMode = 0755;

std::string_view textOf(std::span<const std::uint8_t> bytes) {
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

std::unexpected<Failure> refusedItem(std::string_view name, std::string_view reason) {
    return refused(refusal(name, reason));
}

} // namespace

Outcome<std::uint32_t> Unpacker::unpack(int records) {
    for (;;) {
        const auto head = TRY(take(records, sizeof(Record)));
        Record record;
        std::memcpy(&record, head.data(), sizeof record);
        const bool named = record.kind == RecordKind::entry;
        if (record.first > recordBytesMax || record.second > (named ? recordBytesMax - record.first : 0))
            return failed("the archive's decoder sends nonsense");
        const auto bytes = TRY(take(records, std::size_t{record.first} + record.second));
        course_.readTo(record.readBytes);
        Outcome<void> done;
        switch (record.kind) {
        case RecordKind::entry:
            done = finishFile();
            if (done)
                done = beginEntry(record, textOf(bytes.first(record.first)), textOf(bytes.subspan(record.first)));
            break;
        case RecordKind::data:
            done = writeData(record, bytes);
            break;
        case RecordKind::end:
            done = finishFile();
            if (done)
                return record.flags;
            break;
        case RecordKind::failure:
            return refused("the archive cannot be read: " + zorvane::printable(std::string(textOf(bytes))));
        default:
            return failed("the archive's decoder sends nonsense");
        }
        TRY(std::move(done));
    }
}

/// At least so many bytes lie in the buffer then.
Outcome<void> Unpacker::fill(int records, std::size_t bytes) {
    if (buffer_.size() - begin_ < bytes) {
        std::memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
        end_ -= begin_;
        begin_ = 0;
    }
    while (end_ - begin_ < bytes) {
        const ssize_t count = ::read(records, buffer_.data() + end_, buffer_.size() - end_);
        TRY(course_.checkStopped());
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return failed("the archive's decoder cannot be read", zor::Errno::last());
        if (count == 0)
            return refused("the archive's decoder ended too early: the archive asks for too much, or breaks it");
        end_ += static_cast<std::size_t>(count);
    }
    return {};
}

/// Good until the next call.
Outcome<std::span<const std::uint8_t>> Unpacker::take(int records, std::size_t bytes) {
    TRY(fill(records, bytes));
    const std::span<const std::uint8_t> taken = std::span(buffer_).subspan(begin_, bytes);
    begin_ += bytes;
    return taken;
}

Outcome<void> Unpacker::beginEntry(const Record& record, std::string_view name, std::string_view target) {
    auto plain = plainName(name);
    if (!plain)
        return refusedItem(name, plain.error());
    entry_ = {.record = record, .name = std::move(*plain), .target = std::string(target)};
    if (target.find('\0') != target.npos)
        return refusedItem(name, "its target holds a NUL");
    const bool hardLink = (record.flags & recordHardLink) != 0;
    if (entry_.name.empty()) {
        // The top is the container itself.
        if (hardLink || !S_ISDIR(record.mode))
            return refusedItem(name, "the container itself can only be a directory");
        return {};
    }
    const mode_t mode = hardLink ? S_IFREG : static_cast<mode_t>(record.mode);
    if (const auto why = whyRefused({.name = entry_.name, .mode = mode, .linkTarget = target}))
        return refusedItem(entry_.name, *why);
    const Place place = TRY(placeOf(entry_.name));
    Outcome<void> made;
    if (hardLink)
        made = makeHardLink(place);
    else if (S_ISDIR(mode))
        made = makeDirectory(place.directory, place.name, (mode & accessBits) | S_IRWXU);
    else if (S_ISLNK(mode))
        made = makeSymbolicLink(place);
    else
        made = makeFile(place);
    return made ? course_.addItem() : made;
}

Outcome<Unpacker::Place> Unpacker::placeOf(const std::string& name) {
    const std::size_t slash = name.rfind('/');
    const std::string parent = slash == name.npos ? "." : name.substr(0, slash);
    const std::string last = slash == name.npos ? name : name.substr(slash + 1);
    if (!parent_.valid() || parent != parentPath_) {
        constexpr int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW;
        auto opened = openBeneathOnMount(directory_, parent.c_str(), flags);
        if (!opened && opened.error() == ENOENT) {
            TRY(makeParents(parent));
            opened = openBeneathOnMount(directory_, parent.c_str(), flags);
        }
        if (!opened)
            return cannotMake(opened.error());
        parent_ = std::move(*opened);
        parentPath_ = parent;
    }
    return Place{.directory = parent_.get(), .name = last};
}

Outcome<void> Unpacker::makeParents(const std::string& path) {
    FileDescriptor current;
    for (std::size_t begin = 0; begin < path.size();) {
        const std::size_t end = std::min(path.find('/', begin), path.size());
        const std::string name = path.substr(begin, end - begin);
        begin = end + 1;
        const int parent = current.valid() ? current.get() : directory_;
        auto below = openBeneathOnMount(parent, name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
        if (!below && below.error() == ENOENT) {
            TRY(makeDirectory(parent, name, impliedDirectoryMode));
            TRY(course_.addItem());
            below = openBeneathOnMount(parent, name.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
        }
        if (!below)
            return cannotMake(below.error());
        current = std::move(*below);
    }
    return {};
}

Outcome<void> Unpacker::makeDirectory(int parent, const std::string& name, mode_t mode) {
    if (const zor::Errno error = disk_.makeDirectory(parent, name.c_str(), 0700); error && error != EEXIST)
        return cannotMake(error);
    const auto directory = openBeneathOnMount(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return cannotMake(directory.error() == ENOTDIR || directory.error() == ELOOP ? zor::Errno(EEXIST)
                                                                                     : directory.error());
    if (const zor::Errno error = disk_.changeOwner(directory->get(), owner_.user, owner_.group))
        return cannotMake(error);
    if (const zor::Errno error = disk_.changeMode(directory->get(), mode))
        return cannotMake(error);
    return {};
}

Outcome<void> Unpacker::makeFile(const Place& place) {
    auto file = disk_.createFile(place.directory, place.name.c_str(), 0600);
    if (!file)
        return cannotMake(file.error());
    file_ = std::move(*file);
    fileEnd_ = 0;
    return {};
}

Outcome<void> Unpacker::writeData(const Record& record, std::span<const std::uint8_t> bytes) {
    if (bytes.empty())
        return {};
    if (!file_.valid())
        return failed("the archive's decoder sends data of no file");
    if (record.offset < fileEnd_ || record.offset > std::numeric_limits<std::int64_t>::max() - record.first)
        return refusedItem(entry_.name, "its data is out of order");
    if (record.offset > fileEnd_ && ::lseek(file_.get(), record.offset, SEEK_SET) < 0)
        return cannotMake(zor::Errno::last());
    if (const zor::Errno error = disk_.write(file_.get(), bytes))
        return cannotMake(error);
    fileEnd_ = record.offset + static_cast<std::int64_t>(bytes.size());
    return course_.addBytes(bytes.size());
}

Outcome<void> Unpacker::finishFile() {
    if (!file_.valid())
        return {};
    const FileDescriptor file = std::move(file_);
    const Record& record = entry_.record;
    const bool hasSize = (record.flags & recordHasSize) != 0;
    if (hasSize && (record.offset < 0 || record.offset < fileEnd_))
        return refusedItem(entry_.name, "it is longer than it says");
    if (hasSize && record.offset > fileEnd_) {
        // It ends with a hole; its last byte gives it its length.
        constexpr std::array<std::uint8_t, 1> zero{};
        if (::lseek(file.get(), record.offset - 1, SEEK_SET) < 0)
            return cannotMake(zor::Errno::last());
        if (const zor::Errno error = disk_.write(file.get(), zero))
            return cannotMake(error);
    }
    if (const zor::Errno error = disk_.changeOwner(file.get(), owner_.user, owner_.group))
        return cannotMake(error);
    if (const zor::Errno error = disk_.changeMode(file.get(), static_cast<mode_t>(record.mode) & accessBits))
        return cannotMake(error);
    if ((record.flags & recordHasTime) == 0)
        return {};
    const timespec time{.tv_sec = record.timeSeconds,
                        .tv_nsec = static_cast<long>(std::min<std::uint32_t>(record.timeNanoseconds, 999'999'999))};
    if (const zor::Errno error = disk_.setTimes(file.get(), time, time))
        return cannotMake(error);
    return {};
}

Outcome<void> Unpacker::makeSymbolicLink(const Place& place) {
    if (const zor::Errno error = disk_.makeSymbolicLink(entry_.target.c_str(), place.directory, place.name.c_str()))
        return cannotMake(error);
    const FileDescriptor link(::openat(place.directory, place.name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    if (!link.valid())
        return cannotMake(zor::Errno::last());
    const zor::Errno error = disk_.changeOwner(link.get(), owner_.user, owner_.group);
    return error ? cannotMake(error) : Outcome<void>();
}

Outcome<void> Unpacker::makeHardLink(const Place& place) {
    const auto target = plainName(entry_.target);
    if (!target)
        return refusedItem(entry_.name, "a hard link that leads out of the archive: " + target.error());
    const std::size_t slash = target->rfind('/');
    const std::string parent = slash == target->npos ? "." : target->substr(0, slash);
    const std::string name = slash == target->npos ? *target : target->substr(slash + 1);
    struct stat status{};
    const auto directory = openBeneathOnMount(directory_, parent.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (!directory || ::fstatat(directory->get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0 ||
        !S_ISREG(status.st_mode))
        return refusedItem(entry_.name, "a hard link to what is no file earlier in the archive");
    if (const zor::Errno error =
            disk_.makeHardLink(directory->get(), name.c_str(), place.directory, place.name.c_str()))
        return cannotMake(error);
    const bool hasData = (entry_.record.flags & recordHasSize) != 0 && entry_.record.offset > 0;
    if (!hasData)
        return {};
    // Some forms keep the data of a file with the last of its names.
    if (status.st_size != 0)
        return refusedItem(entry_.name, "the data of its file comes twice");
    auto file = openBeneathOnMount(place.directory, place.name.c_str(), O_WRONLY | O_NOFOLLOW);
    if (!file)
        return cannotMake(file.error());
    file_ = std::move(*file);
    fileEnd_ = 0;
    return {};
}

std::unexpected<Failure> Unpacker::cannotMake(zor::Errno error) const {
    if (error == EEXIST)
        return refusedItem(entry_.name, "it comes twice");
    if (error == ENOTDIR || error == ELOOP)
        return refusedItem(entry_.name, "it lies below something that is no directory");
    return failed(zorvane::printable(entry_.name) + " cannot be written", error);
}

} // namespace zorvanectl::content
