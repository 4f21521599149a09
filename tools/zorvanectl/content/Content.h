// SPDX-License-Identifier: Apache-2.0
// Puts an archive, or what is in a directory, into a new container.
//
// All of it is put together in a hidden directory that nobody else can reach (SealedDirectory.h), moved up when it is
// whole, and synced. The rest of the container, its standard subdirectories, stays unless the content has the same
// name. A failure, or a stop at any point, leaves a container that is good for nothing but being thrown away.
//
// The source may belong to somebody hostile and change meanwhile; the container's owner may change the container. One
// thread.
#pragma once

#include "Course.h"
#include "Failure.h"
#include "Holders.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"

#include <csignal>
#include <functional>
#include <string>

namespace zorvanectl::content {

/// An open archive or directory.
class Source {
public:
    /// A path of the caller's own; openForInstallation says how far it is followed.
    [[nodiscard]] static Outcome<Source> open(const std::string& path);
    /// An archive that comes in there, to its end. It is kept in a file without a name in /var/tmp meanwhile: archives
    /// have their directory at the end, and are larger than memory.
    [[nodiscard]] static Outcome<Source> ofStandardInput();

    [[nodiscard]] bool isDirectory() const { return isDirectory_; }
    [[nodiscard]] int get() const { return file_.get(); }
    [[nodiscard]] const Holders& holders() const { return holders_; }
    [[nodiscard]] std::uint64_t bytes() const { return bytes_; }

private:
    zor::platform::FileDescriptor file_;
    Holders holders_;
    bool isDirectory_ = false;
    std::uint64_t bytes_ = 0; // of the archive's file
};

enum class Phase { copying, syncing };

struct Observer {
    /// Called often while copying.
    std::function<void(Phase, const Progress&)> progressed;
    /// The share is wanted, which costs a look at everything in a directory.
    bool wantsShare = false;
};

/// `container` is open for reading. Returns what came in; the content is on the disk then.
[[nodiscard]] Outcome<Progress> putContent(zor::platform::Disk& disk, int container, const Source& source,
                                           const Observer& observer, const volatile std::sig_atomic_t& stop);

} // namespace zorvanectl::content
