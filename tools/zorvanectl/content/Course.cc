// SPDX-License-Identifier: Apache-2.0
#include "Course.h"

#include "ItemRules.h"

#include <algorithm>
#include <cerrno>
#include <sys/statvfs.h>

namespace zorvanectl::content {

namespace {

/// A twentieth of the file system is left to others, but no more than this.
constexpr std::uint64_t reserveBytesMax = std::uint64_t{1} << 30;
constexpr std::uint64_t reserveShare = 20;
// How much may be written between two looks at the file system: half of what is left to write, within these.
constexpr std::uint64_t bytesBetweenChecksMin = std::uint64_t{64} << 10;
constexpr std::uint64_t bytesBetweenChecksMax = std::uint64_t{16} << 20;
constexpr std::uint64_t itemsBetweenChecks = 1024;

} // namespace

Course::Course(int place, const volatile std::sig_atomic_t& stop, Report report)
    : place_(place), stop_(stop), report_(std::move(report)) {}

Outcome<void> Course::addItem() {
    if (++progress_.items > itemsMax)
        return refused("the source holds more than " + std::to_string(itemsMax) + " items");
    if (progress_.items - itemsAtCheck_ >= itemsBetweenChecks)
        if (auto room = checkRoom(); !room)
            return room;
    report();
    return checkStopped();
}

Outcome<void> Course::addBytes(std::uint64_t bytes) {
    progress_.bytes += bytes;
    if (progress_.bytes >= bytesAtNextCheck_)
        if (auto room = checkRoom(); !room)
            return room;
    report();
    return checkStopped();
}

Outcome<void> Course::checkRoom() {
    itemsAtCheck_ = progress_.items;
    struct statvfs status{};
    if (::fstatvfs(place_, &status) != 0)
        return failed("the store's file system cannot be examined", zor::Errno::last());
    const std::uint64_t unit = status.f_frsize;
    const std::uint64_t available = status.f_bavail * unit;
    const std::uint64_t reserve = std::min(reserveBytesMax, status.f_blocks * unit / reserveShare);
    if (available < reserve)
        return lacksRoom("the store's file system would be left with too little space");
    bytesAtNextCheck_ =
        progress_.bytes + std::clamp((available - reserve) / 2, bytesBetweenChecksMin, bytesBetweenChecksMax);
    // File systems that make inodes as they are needed say that there are none.
    if (status.f_files != 0 && status.f_favail < status.f_files / reserveShare)
        return lacksRoom("the store's file system would be left with too few inodes");
    return {};
}

Outcome<void> Course::checkStopped() const {
    if (stopped())
        return failed("it was interrupted");
    return {};
}

void Course::report() {
    if (!report_)
        return;
    const std::uint64_t read = readBytes_ != 0 ? readBytes_ : progress_.bytes;
    progress_.share =
        expectedBytes_ == 0 ? 0 : std::min(1.0, static_cast<double>(read) / static_cast<double>(expectedBytes_));
    report_(progress_);
}

} // namespace zorvanectl::content
