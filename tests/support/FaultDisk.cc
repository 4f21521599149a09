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

int FaultDisk::faultOf(const DiskCallInfo& info) {
    const MutexLock lock(mutex_);
    if (armed_ && !stopped_) {
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

ssize_t FaultDisk::intercept(const DiskCallInfo& info, const Make& make) {
    const int fault = faultOf(info);
    return fault != 0 ? fault : make();
}

int FaultDisk::write(int fd, std::span<const std::uint8_t> bytes) {
    if (bytes.size() < 2)
        return InterceptedDisk::write(fd, bytes);
    const std::size_t half = bytes.size() / 2;
    if (const int result = InterceptedDisk::write(fd, bytes.first(half)); result != 0)
        return result;
    return static_cast<int>(
        intercept({DiskCall::write, "(second half)", fd}, [&] { return inner().write(fd, bytes.subspan(half)); }));
}

} // namespace zor::support
