// SPDX-License-Identifier: Apache-2.0
// A process that decodes an archive and sends records (ArchiveRecord.h), for a reader that may be root.
//
// Archives are hostile and their decoders large. So the decoding is done where a mistake in it is worth nothing: in a
// process that holds the archive and the pipe and can do nothing but read the one and write to the other (Powerless.h).
// It ends with its parent, and with this object.
//
// Read are tar of all dialects, zip, cpio and 7-Zip, compressed by what the library undoes itself. Forms for which it
// would run other programs, or read other files that the archive names, are left out.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"

#include <sys/types.h>

namespace zorvanectl::content {

class Decoder {
public:
    /// `archive` is a regular file, open for reading at its beginning. In a process with one thread.
    [[nodiscard]] static Outcome<Decoder> start(int archive);
    Decoder(Decoder&& other) noexcept;
    Decoder& operator=(Decoder&&) = delete;
    ~Decoder();

    [[nodiscard]] int records() const { return records_.get(); }

private:
    Decoder(pid_t pid, zor::platform::FileDescriptor records) : pid_(pid), records_(std::move(records)) {}

    pid_t pid_;
    zor::platform::FileDescriptor records_;
};

} // namespace zorvanectl::content
