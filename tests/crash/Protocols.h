// SPDX-License-Identifier: Apache-2.0
// Small ways to change a disk, some sound and some known to be wrong, on which the fault and power-cut tools prove that
// they tell one from the other.
#pragma once

#include "platform/Disk.h"
#include "platform/FileDescriptor.h"

#include <fcntl.h>
#include <span>
#include <string>
#include <vector>

namespace zor::support {

inline platform::FileDescriptor openBelow(const std::string& directory) {
    return platform::FileDescriptor(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

/// One step of a protocol that gives the file "f" the new content through the file ".t".
enum class Step {
    createTemporary,
    createInPlace,
    writeNew,
    setMode,
    syncFile,
    orderFile,
    syncDirectory,
    syncBystander,
    syncAll,
    unlinkOld,
    renameOver,
};

inline constexpr mode_t newMode = 0644;
inline const std::string oldContent = "old content";
inline const std::string newContent = "the new content, which is longer";

/// Runs the steps in `directory`, which holds "f" and "bystander". The first error ends it; ".t" goes when it was left.
inline int runSteps(platform::Disk& disk, int directory, const std::vector<Step>& steps) {
    struct Leftover {
        platform::Disk& disk;
        int directory;
        bool isThere = false;
        ~Leftover() {
            if (isThere)
                disk.unlinkFile(directory, ".t");
        }
    } leftover{disk, directory};
    platform::FileDescriptor file;
    const platform::FileDescriptor bystander(::openat(directory, "bystander", O_RDONLY | O_CLOEXEC));
    for (const Step step : steps) {
        int result = 0;
        switch (step) {
        case Step::createTemporary:
            result = disk.createFile(directory, ".t", newMode);
            file.reset(result);
            leftover.isThere = result >= 0;
            break;
        case Step::createInPlace:
            file.reset(::openat(directory, "f", O_RDWR | O_CLOEXEC));
            break;
        case Step::writeNew:
            result = disk.write(file.get(),
                                std::span(reinterpret_cast<const std::uint8_t*>(newContent.data()), newContent.size()));
            break;
        case Step::setMode:
            result = disk.changeMode(file.get(), newMode);
            break;
        case Step::syncFile:
            result = disk.sync(file.get());
            break;
        case Step::orderFile:
            result = disk.orderData(file.get());
            break;
        case Step::syncDirectory:
            result = disk.sync(directory);
            break;
        case Step::syncBystander:
            result = disk.sync(bystander.get());
            break;
        case Step::syncAll:
            result = disk.syncFileSystem(directory);
            break;
        case Step::unlinkOld:
            result = disk.unlinkFile(directory, "f");
            break;
        case Step::renameOver:
            result = disk.rename(directory, ".t", directory, "f", 0);
            leftover.isThere = leftover.isThere && result != 0;
            break;
        }
        if (result < 0)
            return result;
    }
    return 0;
}

} // namespace zor::support
