// SPDX-License-Identifier: Apache-2.0
#include "support/FaultDisk.h"

#include <cstring>
#include <exception>
#include <iterator>

namespace zor::support {

using platform::MutexLock;

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

Errno FaultDisk::faultOf(const DiskCallInfo& info) {
    const MutexLock lock(mutex_);
    if (armed_ && !stopped_) {
        if (fault_.filter && !fault_.filter(info))
            return Errno();
        ++counted_;
        if (counted_ < fault_.point || (counted_ > fault_.point && fault_.span == FaultSpan::once))
            return Errno();
        if (!met_)
            metCall_ = info;
        met_ = true;
        if (fault_.kind == FaultKind::error)
            return Errno(fault_.error);
        stopped_ = true;
    }
    if (!stopped_)
        return Errno();
    if (std::uncaught_exceptions() > 0)
        return Errno(EIO);
    throw ProcessStopped{};
}

Errno FaultDisk::intercept(const DiskCallInfo& info, const Make& make) {
    if (before)
        before(info);
    TRY(faultOf(info));
    return make();
}

Errno FaultDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    if (bytes.size() < 2)
        return InterceptedDisk::write(fd, bytes);
    const std::size_t half = bytes.size() / 2;
    TRY(InterceptedDisk::write(fd, bytes.first(half)));
    return intercept({DiskCall::write, "(second half)", fd}, [&] { return inner().write(fd, bytes.subspan(half)); });
}

const char* nameOf(DiskCall call) {
    static constexpr const char* names[] = {"makeDirectory", "createFile",     "makeSymbolicLink", "makeHardLink",
                                            "makeFifo",      "rename",         "unlinkFile",       "removeDirectory",
                                            "changeMode",    "changeOwner",    "setTimes",         "setAttribute",
                                            "setInodeFlags", "write",          "cloneData",        "copyData",
                                            "sync",          "syncFileSystem", "orderData"};
    static_assert(std::size(names) == static_cast<std::size_t>(DiskCall::orderData) + 1);
    return names[static_cast<std::size_t>(call)];
}

std::string DiskCallInfo::describe() const {
    return subject.empty() ? nameOf(call) : std::string(nameOf(call)) + " " + subject;
}

std::string FaultOutcome::describe() const {
    return "fault point " + std::to_string(fault.point) + " as " +
           (fault.kind == FaultKind::stop ? "a stop" : ::strerrorname_np(fault.error)) +
           (fault.span == FaultSpan::once ? "" : " from then on") + (met ? " at " + call : " (not met)");
}

} // namespace zor::support
