// SPDX-License-Identifier: Apache-2.0
// The change notices that the identity registry lives by: of its directory and those above it, and of the directories
// that the registered executables lie in. One thread at a time.
#pragma once

#include "identity/RegisteredExecutables.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <sys/inotify.h>

namespace zor::platform {

class RegistryWatches {
public:
    explicit RegistryWatches(const SystemRoot& root);

    /// Readable when there are notices; -1 when the system gave none.
    [[nodiscard]] int descriptor() const { return inotify_->get(); }
    /// False when a change may come without a notice.
    [[nodiscard]] bool isComplete() const { return complete_; }

    enum class Noticed { nothing, executables, registry };
    /// Takes what is pending, without waiting.
    [[nodiscard]] Noticed take();

    /// A file of the registry's directory that was made or written to, and has not been closed by its writer since.
    [[nodiscard]] bool isBeingWritten(const std::string& name) const { return beingWritten_.contains(name); }

    // A new set of watches: begin, then whatever is to be watched, then end, which drops what is watched no more.
    // Watches that are in both sets never pause.
    void begin();
    void watchRegistry();
    /// The regular file at the path, as it is once changes of it are told. None: its file system does not answer.
    std::optional<RegisteredExecutables::Found> watchExecutable(const std::string& path,
                                                                RegisteredExecutables& executables);
    void end();

private:
    /// The names that matter in one directory, or everything.
    struct Interest {
        Noticed kind = Noticed::nothing;
        bool everything = false;
        std::set<std::string, std::less<>> names;
    };

    [[nodiscard]] Interest* watch(int directory, std::uint32_t events, Noticed kind);
    [[nodiscard]] Noticed judge(const inotify_event& event, std::string_view name) const;
    void followWriters(const inotify_event& event, std::string_view name);

    const SystemRoot& root_;
    /// Shared with looks that may not come back.
    std::shared_ptr<const FileDescriptor> inotify_;
    bool complete_ = true;
    std::map<int, Interest> interests_;
    std::map<int, Interest> interestsNew_;
    /// Paths in the set that is being made whose file system did not answer.
    unsigned silent_ = 0;
    std::set<std::string, std::less<>> beingWritten_;
};

} // namespace zor::platform
