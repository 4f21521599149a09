// SPDX-License-Identifier: Apache-2.0
// A file system (FUSE) that its server never answers for, as any user may mount one where fusermount lets him; or not
// from some moment on.
#pragma once

#include "os/FileDescriptor.h"

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <linux/fuse.h>
#include <poll.h>
#include <string>
#include <sys/mount.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::support {

class HangingFileSystem {
public:
    /// On a directory or a file. `server` is the user who is said to serve it.
    HangingFileSystem(std::string at, uid_t server)
        : at_(std::move(at)), device_(::open("/dev/fuse", O_RDWR | O_CLOEXEC)) {
        struct stat status{};
        if (!device_.valid() || ::lstat(at_.c_str(), &status) != 0)
            return;
        char options[128];
        std::snprintf(options, sizeof options, "fd=%d,rootmode=%o,user_id=%u,group_id=%u,allow_other", device_.get(),
                      S_ISDIR(status.st_mode) ? 040755U : 0100644U, server, server);
        mounted_ = ::mount(at_.c_str(), at_.c_str(), "fuse", MS_NOSUID | MS_NODEV, options) == 0;
    }
    /// A call that waits for the file system then gets an error.
    ~HangingFileSystem() {
        fallSilent();
        device_.reset();
        // A container that was deleted has taken the mount in it along.
        std::ifstream mounts("/proc/self/mounts");
        std::string rest;
        for (std::string source, place; mounts >> source >> place && std::getline(mounts, rest);)
            if (source == at_)
                ::umount2(place.c_str(), MNT_DETACH);
    }

    /// False where such mounts are not permitted.
    [[nodiscard]] bool mounted() const { return mounted_; }

    /// From here on it is an empty directory of `owner`'s in which nothing can be made, until it falls silent.
    void answer(uid_t owner) {
        answering_ = std::jthread([device = device_.get(), owner](const std::stop_token& stop) {
            std::array<char, std::size_t{1} << 18> bytes;
            while (!stop.stop_requested()) {
                pollfd waiting{.fd = device, .events = POLLIN, .revents = 0};
                fuse_in_header asked{};
                if (::poll(&waiting, 1, 1) != 1 ||
                    ::read(device, bytes.data(), bytes.size()) < static_cast<ssize_t>(sizeof asked))
                    continue;
                std::memcpy(&asked, bytes.data(), sizeof asked);
                if (asked.opcode == FUSE_FORGET || asked.opcode == FUSE_BATCH_FORGET)
                    continue;
                struct {
                    fuse_out_header header{};
                    union {
                        fuse_init_out init;
                        fuse_attr_out attributes;
                    } body{};
                } reply;
                reply.header.unique = asked.unique;
                std::size_t bodyBytes = 0;
                if (asked.opcode == FUSE_INIT) {
                    reply.body.init = {
                        .major = FUSE_KERNEL_VERSION, .minor = FUSE_KERNEL_MINOR_VERSION, .max_write = 4096};
                    bodyBytes = sizeof reply.body.init;
                } else if (asked.opcode == FUSE_GETATTR) {
                    reply.body.attributes = {
                        .attr = {.ino = asked.nodeid, .mode = S_IFDIR | 0755, .nlink = 2, .uid = owner, .gid = owner}};
                    bodyBytes = sizeof reply.body.attributes;
                } else {
                    reply.header.error = asked.opcode == FUSE_LOOKUP ? -ENOENT : -ENOSYS;
                }
                reply.header.len = static_cast<std::uint32_t>(sizeof reply.header + bodyBytes);
                (void)!::write(device, &reply, reply.header.len);
            }
        });
    }
    void fallSilent() { answering_ = {}; }

private:
    const std::string at_;
    platform::FileDescriptor device_;
    bool mounted_ = false;
    std::jthread answering_;
};

} // namespace zor::support
