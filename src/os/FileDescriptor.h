// SPDX-License-Identifier: Apache-2.0
// Owner of one file descriptor. Closing ignores errors on purpose: nothing that must be durable relies on close.
#pragma once

#include <unistd.h>
#include <utility>

namespace zor::platform {

class FileDescriptor {
public:
    FileDescriptor() = default;
    explicit FileDescriptor(int fd) : fd_(fd) {}
    FileDescriptor(FileDescriptor&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    FileDescriptor& operator=(FileDescriptor&& other) noexcept {
        if (this != &other)
            reset(std::exchange(other.fd_, -1));
        return *this;
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    ~FileDescriptor() { reset(); }

    [[nodiscard]] int get() const { return fd_; }
    [[nodiscard]] bool valid() const { return fd_ >= 0; }
    [[nodiscard]] int release() { return std::exchange(fd_, -1); }
    void reset(int fd = -1) {
        if (fd_ >= 0)
            ::close(fd_);
        fd_ = fd;
    }

private:
    int fd_ = -1;
};

// A program that was started without standard input, output or error.

/// Opens /dev/null in the place of each missing one of the first three descriptors. To be called before anything else
/// is opened: what got one of their numbers would be read, and written to, in their place.
[[nodiscard]] bool fillStandardDescriptors();

} // namespace zor::platform
