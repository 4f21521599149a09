// SPDX-License-Identifier: Apache-2.0
// A hidden directory in a container, closed to the container's owner, in which its content is put together.
//
// The owner may write to the container while root does. Below this directory nobody but the writer can: it belongs to
// the writer and has mode 0700, so what lies in it may have its final owner and mode from the beginning. The owner can
// move it, or put something else in its place; the descriptor stays the one that was made, checked to be empty and
// ours. Only when all is there are its items moved up, each in the place of what has its name in the container.
//
// A stop in the middle leaves the hidden directory, and an object that is not raised leaves it too: the container is
// thrown away then. One thread.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"

#include <string>

namespace zorvanectl::content {

class SealedDirectory {
public:
    /// `container` is an open directory and stays open as long as this object.
    [[nodiscard]] static Outcome<SealedDirectory> make(zor::platform::Disk& disk, int container);

    [[nodiscard]] int get() const { return directory_.get(); }
    /// Moves the items up, and removes the directory.
    [[nodiscard]] Outcome<void> raise();

private:
    SealedDirectory(zor::platform::Disk& disk, int container) : disk_(&disk), container_(container) {}
    [[nodiscard]] Outcome<void> raiseItem(const char* name);

    zor::platform::Disk* disk_;
    int container_;
    std::string name_;
    zor::platform::FileDescriptor directory_;
};

} // namespace zorvanectl::content
