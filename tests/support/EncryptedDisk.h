// SPDX-License-Identifier: Apache-2.0
// A small ext4 file system in a file, with one directory that is encrypted; its key comes and goes as the test says.
#pragma once

#include <string>

namespace zor::support {

class EncryptedDisk {
public:
    /// Mounts it at `mountPoint`, a directory that is made if missing. Where that cannot be (not root, no loop device,
    /// a kernel without this encryption) the disk is not there, and `missing()` says why.
    explicit EncryptedDisk(const std::string& mountPoint);
    ~EncryptedDisk();
    EncryptedDisk(const EncryptedDisk&) = delete;
    EncryptedDisk& operator=(const EncryptedDisk&) = delete;

    [[nodiscard]] const std::string& missing() const { return missing_; }
    /// The encrypted directory; the key is there at first.
    [[nodiscard]] std::string directory() const { return mountPoint_ + "/encrypted"; }
    /// Whether the kernel did it. To take the key away nothing in the directory may be open.
    bool takeKeyAway();
    bool giveKey();

private:
    std::string make();

    const std::string mountPoint_;
    std::string identifier_; // of the key, 16 bytes
    bool mounted_ = false;
    std::string missing_;
};

} // namespace zor::support
