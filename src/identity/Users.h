// SPDX-License-Identifier: Apache-2.0
// The users of the device: which numbers own containers, and which users have an account.
#pragma once

#include "base/Mutex.h"
#include "ipc/UserNumbers.h"
#include "os/FileChanges.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <cstdint>
#include <expected>
#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace zor::platform {

// The configuration of a system root, and what it says of users: read once, when a daemon starts or a tool looks.
//
// A user who can write the file can give the installer's containers to anybody, so one that others than root and the
// daemon's user can write is refused. Any thread.

/// A user id as it stands, or that of a name in the root's user database; else in words what is wrong. Any thread.
[[nodiscard]] std::expected<std::uint32_t, std::string> userNumberOf(const SystemRoot& root, const std::string& text);

/// The numbers, those of ipc::UserNumbers where there is no file. Else one line that says what is wrong, in which file,
/// and what to do.
[[nodiscard]] std::expected<ipc::ConfiguredUsers, std::string> configuredUsers(const SystemRoot& root,
                                                                               const PasswordDatabase& passwords);

// The users of the device: the system's own database on "/", DIR/etc/passwd on any other root. Any thread.
//
// The system's database is asked each time. The file is opened each time, and read again when its stamp is another one;
// a start asks for dozens of users, most of whom have no account.

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
