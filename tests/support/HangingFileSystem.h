// SPDX-License-Identifier: Apache-2.0
// A file system (FUSE) that its server never answers for, as any user may mount one where fusermount lets him; or not
// from some moment on.
#pragma once

#include "os/FileDescriptor.h"

#include <string>
#include <sys/types.h>
#include <thread>

namespace zor::support {

class HangingFileSystem {
public:
    /// On a directory or a file. `server` is the user who is said to serve it.
    HangingFileSystem(std::string at, uid_t server);
    /// Who waits for it then gets an error.
    ~HangingFileSystem();
    HangingFileSystem(const HangingFileSystem&) = delete;
    HangingFileSystem& operator=(const HangingFileSystem&) = delete;

    /// False where such mounts are not permitted.
    [[nodiscard]] bool mounted() const { return mounted_; }

    /// From here on it is an empty directory of `owner`'s in which nothing can be made, until it falls silent.
    void answer(uid_t owner);
    void fallSilent() { answering_ = {}; }

private:
    const std::string at_;
    platform::FileDescriptor device_;
    bool mounted_ = false;
    std::jthread answering_;
};

} // namespace zor::support
