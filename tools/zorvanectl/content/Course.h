// SPDX-License-Identifier: Apache-2.0
// How far an installation has come, and whether it may go on: not after a signal, not beyond what a container may hold,
// and not when the store's file system would be left with too little for everybody else.
//
// The last is what stops a few kilobytes that unpack to terabytes before the disk is full. One thread.
#pragma once

#include "Failure.h"

#include <csignal>
#include <cstdint>
#include <functional>

namespace zorvanectl::content {

struct Progress {
    std::uint64_t items = 0;
    /// The bytes of files, as written.
    std::uint64_t bytes = 0;
    /// The share of what the source holds, 0 to 1.
    double share = 0;
};

class Course {
public:
    using Report = std::function<void(const Progress&)>;

    /// `place` lies on the file system that is written to. `stop` is set by a signal handler.
    Course(int place, const volatile std::sig_atomic_t& stop, Report report);

    /// One more item, or one more piece of a file. A failure: not to go on.
    [[nodiscard]] Outcome<void> addItem();
    [[nodiscard]] Outcome<void> addBytes(std::uint64_t bytes);
    /// Before anything was written, and now and then.
    [[nodiscard]] Outcome<void> checkRoom();
    [[nodiscard]] bool stopped() const { return stop_ != 0; }
    [[nodiscard]] Outcome<void> checkStopped() const;

    /// The source's content is `bytes` long; without this call the share stays 0.
    void expectBytes(std::uint64_t bytes) { expectedBytes_ = bytes; }
    /// So much of it has been read, where that is not what was written.
    void readTo(std::uint64_t bytes) { readBytes_ = bytes; }

    [[nodiscard]] const Progress& progress() const { return progress_; }

private:
    void report();

    const int place_;
    const volatile std::sig_atomic_t& stop_;
    const Report report_;
    Progress progress_;
    std::uint64_t expectedBytes_ = 0;
    std::uint64_t readBytes_ = 0;
    std::uint64_t bytesAtNextCheck_ = 0;
    std::uint64_t itemsAtCheck_ = 0;
};

} // namespace zorvanectl::content
