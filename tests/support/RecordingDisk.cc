// SPDX-License-Identifier: Apache-2.0
#include "support/RecordingDisk.h"

#include <algorithm>
#include <fcntl.h>
#include <unistd.h>

namespace zor::support {

using platform::MutexLock;

namespace {

void place(Bytes& content, std::uint64_t offset, const Bytes& bytes) {
    if (content.size() < offset + bytes.size())
        content.resize(offset + bytes.size());
    std::copy(bytes.begin(), bytes.end(), content.begin() + static_cast<std::ptrdiff_t>(offset));
}

std::uint64_t writeOffset(int fd) {
    const bool appends = (::fcntl(fd, F_GETFL) & O_APPEND) != 0;
    if (!appends)
        return static_cast<std::uint64_t>(::lseek(fd, 0, SEEK_CUR));
    struct stat status = {};
    ::fstat(fd, &status);
    return static_cast<std::uint64_t>(status.st_size);
}

/// The place at which two descriptions begin to differ; empty when they do not.
std::string firstDifference(const std::string& recorded, const std::string& onDisk) {
    if (recorded == onDisk)
        return "";
    constexpr std::size_t shown = 200;
    const auto at = static_cast<std::size_t>(std::ranges::mismatch(recorded, onDisk).in1 - recorded.begin());
    const std::size_t from = at - std::min(at, shown / 2);
    return "the recorded tree has \"" + recorded.substr(from, shown) + "\" where the disk has \"" +
           onDisk.substr(from, shown) + "\"";
}

} // namespace

bool LoggedOperation::makesInode() const {
    return call == DiskCall::makeDirectory || call == DiskCall::createFile || call == DiskCall::makeSymbolicLink ||
           call == DiskCall::makeFifo;
}

bool LoggedOperation::changesNames() const {
    return makesInode() || call == DiskCall::makeHardLink || call == DiskCall::rename || call == DiskCall::unlinkFile ||
           call == DiskCall::removeDirectory;
}

bool LoggedOperation::changesInode() const {
    return call == DiskCall::changeMode || call == DiskCall::changeOwner || call == DiskCall::setAttribute;
}

bool LoggedOperation::touches(InodeId id) const {
    const bool changes = changesNames() || changesInode() || writes() || call == DiskCall::orderData;
    return changes && (inode == id || directory == id || toDirectory == id || replaced == id);
}

std::string LoggedOperation::describe() const {
    std::string text = nameOf(call) + (" of " + std::to_string(inode)) + " " + attribute;
    if (changesNames())
        text += std::to_string(directory) + "/" + name;
    if (call == DiskCall::rename)
        text += " -> " + std::to_string(toDirectory) + "/" + toName;
    if (writes())
        text += std::to_string(value.content.size()) + " bytes at " + std::to_string(offset);
    return text;
}

void apply(const LoggedOperation& operation, FileTree& tree) {
    const auto entriesOf = [&](InodeId id) -> std::map<std::string, InodeId>& { return tree.inodes.at(id).entries; };
    if (operation.call == DiskCall::rename) {
        entriesOf(operation.directory).erase(operation.name);
        if (operation.exchanges)
            entriesOf(operation.directory)[operation.name] = operation.replaced;
        entriesOf(operation.toDirectory)[operation.toName] = operation.inode;
    } else if (operation.call == DiskCall::unlinkFile || operation.call == DiskCall::removeDirectory) {
        entriesOf(operation.directory).erase(operation.name);
    } else if (operation.changesNames()) {
        entriesOf(operation.directory)[operation.name] = operation.inode;
    } else if (operation.call == DiskCall::changeMode) {
        tree.inodes.at(operation.inode).mode = operation.value.mode;
    } else if (operation.call == DiskCall::changeOwner) {
        tree.inodes.at(operation.inode).uid = operation.value.uid;
        tree.inodes.at(operation.inode).gid = operation.value.gid;
    } else if (operation.call == DiskCall::setAttribute) {
        tree.inodes.at(operation.inode).attributes[operation.attribute] = operation.value.content;
    } else if (operation.writes()) {
        place(tree.inodes.at(operation.inode).content, operation.offset, operation.value.content);
    }
}

RecordingDisk::RecordingDisk(platform::Disk& inner, std::string root, std::set<std::string> excluded)
    : InterceptedDisk(inner), root_(std::move(root)), excluded_(std::move(excluded)) {}

void RecordingDisk::start() {
    const MutexLock lock(mutex_);
    log_ = {};
    complaint_.clear();
    log_.start = readTree(root_, excluded_, &known_);
    current_ = log_.start;
    nextId_ = current_.inodes.rbegin()->first + 1;
    recording_ = true;
}

void RecordingDisk::mark() {
    const MutexLock lock(mutex_);
    log_.marks.push_back(log_.operations.size());
}

DiskLog RecordingDisk::log() const {
    const MutexLock lock(mutex_);
    return log_;
}

std::string RecordingDisk::complaint() const {
    const MutexLock lock(mutex_);
    return complaint_ + firstDifference(current_.describe(), readTree(root_, excluded_).describe());
}

InodeId RecordingDisk::find(int fd) {
    struct stat status = {};
    if (!recording_ || ::fstat(fd, &status) != 0)
        return 0;
    const auto found = known_.find({status.st_dev, status.st_ino});
    return found == known_.end() ? 0 : found->second;
}

InodeId RecordingDisk::findEntry(InodeId directory, const std::string& name) const {
    const auto& entries = current_.inodes.at(directory).entries;
    const auto entry = entries.find(name);
    return entry == entries.end() ? 0 : entry->second;
}

RecordingDisk::Place RecordingDisk::place(int directory, std::string_view path) {
    Place place{.directory = find(directory), .name = ""};
    for (std::size_t slash = path.find('/'); slash != std::string_view::npos; slash = path.find('/')) {
        if (place.directory != 0)
            place.directory = findEntry(place.directory, std::string(path.substr(0, slash)));
        path.remove_prefix(slash + 1);
    }
    place.name = path;
    return place;
}

void RecordingDisk::add(LoggedOperation operation) {
    if (operation.inode != 0)
        operation.device = current_.inodes.at(operation.inode).device;
    apply(operation, current_);
    log_.operations.push_back(std::move(operation));
}

void RecordingDisk::addNew(const DiskCallInfo& info) {
    const Place at = place(info.fd, info.subject);
    if (at.directory == 0)
        return;
    struct stat status = {};
    if (::fstatat(info.fd, info.subject.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        complaint_ += "\"" + info.subject + "\" went as soon as it was made; ";
        return;
    }
    const InodeId id = nextId_++;
    // The file system may use the number of an inode that is gone again: the newest one is meant.
    known_[{status.st_dev, status.st_ino}] = id;
    LoggedOperation operation{.call = info.call, .inode = id, .directory = at.directory, .name = at.name};
    operation.value = readInode(info.fd, info.subject.c_str());
    current_.inodes[id] = operation.value;
    add(std::move(operation));
}

void RecordingDisk::addRemoval(const DiskCallInfo& info) {
    const Place at = place(info.fd, info.subject);
    if (at.directory == 0)
        return;
    const InodeId id = findEntry(at.directory, at.name);
    if (id == 0)
        complaint_ += "\"" + info.subject + "\" was removed, which nothing recorded made; ";
    else
        add({.call = info.call, .inode = id, .directory = at.directory, .name = at.name});
}

/// A change of mode or owner, or a sync.
void RecordingDisk::addOnDescriptor(const DiskCallInfo& info) {
    struct stat status = {};
    const InodeId id = find(info.fd);
    if (id == 0 || ::fstat(info.fd, &status) != 0)
        return;
    LoggedOperation operation{.call = info.call, .inode = id};
    operation.value = {.mode = status.st_mode, .uid = status.st_uid, .gid = status.st_gid};
    add(std::move(operation));
}

void RecordingDisk::addData(int to, std::uint64_t offset, Bytes bytes) {
    const InodeId id = find(to);
    if (id == 0 || bytes.empty())
        return;
    LoggedOperation operation{.call = DiskCall::write, .inode = id};
    operation.value.content = std::move(bytes);
    operation.offset = offset;
    add(std::move(operation));
}

Errno RecordingDisk::intercept(const DiskCallInfo& info, const Make& make) {
    const MutexLock lock(mutex_);
    TRY(make());
    const DiskCall call = info.call;
    struct stat synced = {};
    if (LoggedOperation{.call = call}.makesInode())
        addNew(info);
    else if (call == DiskCall::unlinkFile || call == DiskCall::removeDirectory)
        addRemoval(info);
    else if (call == DiskCall::changeMode || call == DiskCall::changeOwner || call == DiskCall::sync ||
             call == DiskCall::orderData)
        addOnDescriptor(info);
    else if (call == DiskCall::syncFileSystem && recording_ && ::fstat(info.fd, &synced) == 0)
        add({.call = call, .device = synced.st_dev});
    // The others have methods of their own, or are not modelled.
    return Errno();
}

Errno RecordingDisk::makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) {
    const MutexLock lock(mutex_);
    TRY(inner().makeHardLink(fromDirectory, from, toDirectory, to));
    const Place source = place(fromDirectory, from);
    const Place link = place(toDirectory, to);
    const InodeId id = source.directory == 0 ? 0 : findEntry(source.directory, source.name);
    if (link.directory != 0 && id != 0)
        add({.call = DiskCall::makeHardLink, .inode = id, .directory = link.directory, .name = link.name});
    else if (link.directory != 0 || source.directory != 0)
        complaint_ += std::string("a link \"") + to + "\" to what is not recorded; ";
    return Errno();
}

Errno RecordingDisk::rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
    const MutexLock lock(mutex_);
    TRY(inner().rename(fromDirectory, from, toDirectory, to, flags));
    const Place source = place(fromDirectory, from);
    const Place destination = place(toDirectory, to);
    if (source.directory == 0 && destination.directory == 0)
        return Errno();
    const InodeId moved = source.directory == 0 ? 0 : findEntry(source.directory, source.name);
    if (moved == 0 || destination.directory == 0) {
        complaint_ += std::string("a move of \"") + from + "\" from or to where nothing is recorded; ";
        return Errno();
    }
    add({.call = DiskCall::rename,
         .inode = moved,
         .directory = source.directory,
         .name = source.name,
         .toDirectory = destination.directory,
         .toName = destination.name,
         .replaced = findEntry(destination.directory, destination.name),
         .exchanges = (flags & RENAME_EXCHANGE) != 0});
    return Errno();
}

Errno RecordingDisk::setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) {
    const MutexLock lock(mutex_);
    const Errno result = inner().setAttribute(fd, name, value);
    const InodeId id = result ? 0 : find(fd);
    if (id == 0)
        return result;
    LoggedOperation operation{.call = DiskCall::setAttribute, .inode = id};
    operation.value.content.assign(value.begin(), value.end());
    operation.attribute = name;
    add(std::move(operation));
    return result;
}

Errno RecordingDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    const MutexLock lock(mutex_);
    const std::uint64_t offset = writeOffset(fd);
    const Errno result = inner().write(fd, bytes);
    const auto end = static_cast<std::uint64_t>(::lseek(fd, 0, SEEK_CUR));
    const std::size_t written = result ? static_cast<std::size_t>(end - std::min(end, offset)) : bytes.size();
    addData(fd, offset, Bytes(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(written)));
    return result;
}

ErrnoOr<std::size_t> RecordingDisk::copyData(int from, int to, std::size_t bytesMax) {
    const MutexLock lock(mutex_);
    const auto source = static_cast<std::uint64_t>(::lseek(from, 0, SEEK_CUR));
    const std::uint64_t offset = writeOffset(to);
    const auto count = inner().copyData(from, to, bytesMax);
    Bytes bytes(count.value_or(0));
    if (::pread(from, bytes.data(), bytes.size(), static_cast<off_t>(source)) != std::ssize(bytes))
        complaint_ += "a copy's source changed meanwhile; ";
    addData(to, offset, std::move(bytes));
    return count;
}

} // namespace zor::support
