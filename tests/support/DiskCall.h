// SPDX-License-Identifier: Apache-2.0
// The calls of platform::Disk as values, for those that count, filter or record them.
#pragma once

#include <cstdint>
#include <string>

namespace zor::support {

enum class DiskCall : std::uint8_t {
    makeDirectory,
    createFile,
    makeSymbolicLink,
    makeHardLink,
    makeFifo,
    rename,
    unlinkFile,
    removeDirectory,
    changeMode,
    changeOwner,
    setTimes,
    setAttribute,
    setInodeFlags,
    write,
    cloneData,
    copyData,
    sync,
    syncFileSystem,
    orderData,
};

const char* nameOf(DiskCall call);

/// A call about to be made.
struct DiskCallInfo {
    DiskCall call = DiskCall::sync;
    /// The name it acts on, "FROM -> TO" for two, or empty for one on a descriptor.
    std::string subject;
    /// The directory of the (first) name, or the descriptor.
    int fd = -1;

    [[nodiscard]] std::string describe() const;
};

/// What a loop over fault points or power cuts found. An empty complaint is a pass.
struct LoopReport {
    /// Points or states that were judged.
    std::size_t examined = 0;
    std::string complaint;
};

} // namespace zor::support
