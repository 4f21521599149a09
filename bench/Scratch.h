// SPDX-License-Identifier: Apache-2.0
// The place of a run's work: one directory beside the build, and in it file systems that were made for the run.
//
// Nothing of it may stay, however the run ends. Mounts are made in a mount namespace of the run's own, on loop devices
// that let go of their image when they are unmounted, and the image loses its name at once: when the last process of
// the run has ended, the kernel has cleaned up. The directory's own content is removed by the process that
// watches over the run, or by the next run. One run at a time.
#pragma once

#include "os/FileDescriptor.h"

#include <cstdint>
#include <memory>
#include <string>

namespace zor::bench {

/// The directory of the run; made, emptied and held for this process by a lock.
class Scratch {
public:
    explicit Scratch(std::string directory);
    /// Empties and removes it. Every process that used it has ended.
    ~Scratch();
    Scratch(const Scratch&) = delete;
    Scratch& operator=(const Scratch&) = delete;

    [[nodiscard]] const std::string& path() const { return path_; }

private:
    void empty() const;

    const std::string path_;
    platform::FileDescriptor held_;
};

/// Gives this process and its children mounts of their own. Without the right to, fresh file systems become
/// directories.
void separateMounts();

/// A place to work in that goes with this object: a fresh file system where that is possible, else a fresh directory.
class Place {
public:
    struct Size {
        std::uint64_t bytes = 0;
        std::uint64_t inodes = 0;
    };
    Place(const Scratch& scratch, const std::string& name, Size size);
    ~Place();
    Place(const Place&) = delete;
    Place& operator=(const Place&) = delete;

    [[nodiscard]] const std::string& path() const { return path_; }
    /// A description for the report.
    [[nodiscard]] const std::string& description() const { return description_; }

private:
    bool mountFresh(const std::string& image, Size size);

    const std::string path_;
    std::string description_;
    bool mounted_ = false;
};

/// Writes out the file system of `path`: what was made before is not to be written while something is measured.
void writeOut(const std::string& path);
/// The same, and drops what the kernel keeps of any disk in memory. False when this process
/// may not.
bool dropCaches(const std::string& path);

} // namespace zor::bench
