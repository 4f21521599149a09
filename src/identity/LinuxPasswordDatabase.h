// SPDX-License-Identifier: Apache-2.0
// The users of the device: the system's own database on "/", DIR/etc/passwd on any other root. Any thread.
//
// The system's database is asked each time. The file is opened each time, and read again when its stamp is another one;
// a start asks for dozens of users, most of whom have no account.
#pragma once

#include "base/Mutex.h"
#include "os/FileStamp.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

namespace zor::platform {

class LinuxPasswordDatabase final : public PasswordDatabase {
public:
    explicit LinuxPasswordDatabase(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] ErrnoOr<PasswordEntry> entryForUserId(std::uint32_t uid) const override;
    [[nodiscard]] ErrnoOr<PasswordEntry> entryForName(std::string_view name) const override;

private:
    /// The file as it was read; a home is as the file names it.
    struct Content {
        FileStamp stamp;
        std::vector<PasswordEntry> entries;
    };
    using Matches = std::function<bool(const PasswordEntry&)>;

    [[nodiscard]] ErrnoOr<PasswordEntry> findInFile(const Matches& matches) const ZOR_EXCLUDES(mutex_);
    /// `named`, with its home below the root; ENOENT when that is no absolute path.
    [[nodiscard]] ErrnoOr<PasswordEntry> entryOf(PasswordEntry named) const;

    const SystemRoot& root_;
    mutable Mutex mutex_;
    mutable std::shared_ptr<const Content> content_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
