// SPDX-License-Identifier: Apache-2.0
#include "support/FaultDisk.h"

#include <cstring>
#include <exception>
#include <unistd.h>

namespace zor::support {

using platform::MutexLock;

std::string Fault::describe() const {
    std::string text = "fault point " + std::to_string(point) + " as ";
    switch (kind) {
    case FaultKind::stop:
        return text + "a stop";
    case FaultKind::exit:
        return text + "an exit";
    case FaultKind::error:
        break;
    }
    return text + ::strerrorname_np(error) + (span == FaultSpan::once ? " once" : " from then on");
}

void FaultDisk::arm(const Fault& fault) {
    const MutexLock lock(mutex_);
    fault_ = fault;
    armed_ = true;
    met_ = false;
    counted_ = 0;
}

void FaultDisk::disarm() {
    const MutexLock lock(mutex_);
    armed_ = false;
}

bool FaultDisk::met() const {
    const MutexLock lock(mutex_);
    return met_;
}

DiskCallInfo FaultDisk::metCall() const {
    const MutexLock lock(mutex_);
    return metCall_;
}

int FaultDisk::pass(DiskCall call, std::string subject) {
    const MutexLock lock(mutex_);
    if (armed_ && !stopped_) {
        const DiskCallInfo info{call, std::move(subject)};
        if (fault_.filter && !fault_.filter(info))
            return 0;
        ++counted_;
        if (counted_ < fault_.point || (counted_ > fault_.point && fault_.span == FaultSpan::once))
            return 0;
        if (!met_)
            metCall_ = info;
        met_ = true;
        if (fault_.kind == FaultKind::error)
            return -fault_.error;
        if (fault_.kind == FaultKind::exit)
            ::_exit(exitStatus);
        stopped_ = true;
    }
    if (!stopped_)
        return 0;
    if (std::uncaught_exceptions() > 0)
        return -EIO;
    throw ProcessStopped{};
}

namespace {
std::string fromTo(const char* from, const char* to) {
    return std::string(from) + " -> " + to;
}
} // namespace

int FaultDisk::makeDirectory(int directory, const char* name, mode_t mode) {
    const int fault = pass(DiskCall::makeDirectory, name);
    return fault != 0 ? fault : inner_.makeDirectory(directory, name, mode);
}

int FaultDisk::createFile(int directory, const char* name, mode_t mode) {
    const int fault = pass(DiskCall::createFile, name);
    return fault != 0 ? fault : inner_.createFile(directory, name, mode);
}

int FaultDisk::makeSymbolicLink(const char* target, int directory, const char* name) {
    const int fault = pass(DiskCall::makeSymbolicLink, name);
    return fault != 0 ? fault : inner_.makeSymbolicLink(target, directory, name);
}

int FaultDisk::makeHardLink(int fromDirectory, const char* from, int toDirectory, const char* to) {
    const int fault = pass(DiskCall::makeHardLink, fromTo(from, to));
    return fault != 0 ? fault : inner_.makeHardLink(fromDirectory, from, toDirectory, to);
}

int FaultDisk::makeFifo(int directory, const char* name, mode_t mode) {
    const int fault = pass(DiskCall::makeFifo, name);
    return fault != 0 ? fault : inner_.makeFifo(directory, name, mode);
}

int FaultDisk::rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
    const int fault = pass(DiskCall::rename, fromTo(from, to));
    return fault != 0 ? fault : inner_.rename(fromDirectory, from, toDirectory, to, flags);
}

int FaultDisk::unlinkFile(int directory, const char* name) {
    const int fault = pass(DiskCall::unlinkFile, name);
    return fault != 0 ? fault : inner_.unlinkFile(directory, name);
}

int FaultDisk::removeDirectory(int directory, const char* name) {
    const int fault = pass(DiskCall::removeDirectory, name);
    return fault != 0 ? fault : inner_.removeDirectory(directory, name);
}

int FaultDisk::changeMode(int fd, mode_t mode) {
    const int fault = pass(DiskCall::changeMode);
    return fault != 0 ? fault : inner_.changeMode(fd, mode);
}

int FaultDisk::changeOwner(int fd, uid_t uid, gid_t gid) {
    const int fault = pass(DiskCall::changeOwner);
    return fault != 0 ? fault : inner_.changeOwner(fd, uid, gid);
}

int FaultDisk::setTimes(int fd, const timespec& access, const timespec& modification) {
    const int fault = pass(DiskCall::setTimes);
    return fault != 0 ? fault : inner_.setTimes(fd, access, modification);
}

int FaultDisk::setAttribute(int fd, const char* name, std::span<const std::uint8_t> value) {
    const int fault = pass(DiskCall::setAttribute, name);
    return fault != 0 ? fault : inner_.setAttribute(fd, name, value);
}

int FaultDisk::setInodeFlags(int fd, int flags) {
    const int fault = pass(DiskCall::setInodeFlags);
    return fault != 0 ? fault : inner_.setInodeFlags(fd, flags);
}

int FaultDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    int result = pass(DiskCall::write);
    if (result == 0 && bytes.size() >= 2) {
        const std::size_t half = bytes.size() / 2;
        result = inner_.write(fd, bytes.first(half));
        bytes = bytes.subspan(half);
        if (result == 0)
            result = pass(DiskCall::write, "(second half)");
    }
    return result != 0 ? result : inner_.write(fd, bytes);
}

int FaultDisk::cloneData(int from, int to) {
    const int fault = pass(DiskCall::cloneData);
    return fault != 0 ? fault : inner_.cloneData(from, to);
}

ssize_t FaultDisk::copyData(int from, int to, std::size_t bytesMax) {
    const int fault = pass(DiskCall::copyData);
    return fault != 0 ? fault : inner_.copyData(from, to, bytesMax);
}

int FaultDisk::sync(int fd) {
    const int fault = pass(DiskCall::sync);
    return fault != 0 ? fault : inner_.sync(fd);
}

int FaultDisk::syncFileSystem(int fd) {
    const int fault = pass(DiskCall::syncFileSystem);
    return fault != 0 ? fault : inner_.syncFileSystem(fd);
}

int FaultDisk::orderData(int fd) {
    const int fault = pass(DiskCall::orderData);
    return fault != 0 ? fault : inner_.orderData(fd);
}

} // namespace zor::support
