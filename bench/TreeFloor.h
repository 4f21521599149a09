// SPDX-License-Identifier: Apache-2.0
// The floor of making a container: the bare system calls for the same tree (a data container of a mobile user), on open
// directories, with everything else worked out beforehand. With syncs: the file, the container and the directory that
// it was moved into.
#pragma once

#include "os/FileDescriptor.h"

#include <string>
#include <vector>

namespace zor::bench {

/// The attribute in which the daemon keeps protection classes: the second where this process may not use the first.
[[nodiscard]] const char* protectionAttributeOn(int directory);

class TreeFloor {
public:
    enum class Syncs { off, on };
    /// Works in new directories below `place`.
    TreeFloor(const std::string& place, Syncs syncs);
    /// Makes one more tree; microseconds that it took.
    double create();

private:
    void makeTree(const char* name);

    const Syncs syncs_;
    const bool changesOwner_;
    const std::vector<unsigned char> content_;
    const char* attribute_;
    platform::FileDescriptor staging_;
    platform::FileDescriptor live_;
    int next_ = 0;
};

} // namespace zor::bench
