// SPDX-License-Identifier: Apache-2.0
// The files that the identity registry depends on: the programs that its entries name, and the notices of changes of
// those and of the registry itself.
#pragma once

#include "base/Mutex.h"
#include "identity/RegistryFiles.h"
#include "os/BoundedQuestion.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <sys/inotify.h>
#include <vector>

namespace zor::platform {

// The files that the registry's entries name. An entry may name one below a directory that a user owns, who may mount a
// file system there that never answers: each is asked for with patience, so that nobody else's entry waits for it.
//
// The kernel's memory of names answers at once, and asks no file system. Only a path that it does not know whole is
// looked for on a thread of its own; one whose file system is silent costs one thread, and counts as no file until the
// answer comes. Any thread.

class RegisteredExecutables {
public:
    /// One name in a watched directory.
    struct Watch {
        int number = -1;
        std::string name;
    };
    struct Found {
        /// The regular file that the path names; links are followed.
        std::optional<FileId> file;
        /// The places where a change of that would be told: beside the path, and beside the file that its last link
        /// names.
        std::vector<Watch> watches;
        /// False when one of them is not watched.
        bool watchedAll = false;
    };

    /// Nothing when the file system does not answer.
    [[nodiscard]] std::optional<FileId> fileAt(const std::string& path) ZOR_EXCLUDES(mutex_);
    /// The same, and adds watches for `events` to the inotify descriptor. None: no answer within `patience`.
    [[nodiscard]] std::optional<Found> watch(const std::string& path,
                                             const std::shared_ptr<const FileDescriptor>& inotify, std::uint32_t events,
                                             std::chrono::milliseconds patience) ZOR_EXCLUDES(mutex_);

private:
    using Question = BoundedQuestion<Found>;
    [[nodiscard]] std::shared_ptr<Question> questionOf(const std::string& path) ZOR_EXCLUDES(mutex_);

    Mutex mutex_;
    /// One for each path that was ever not remembered: as many as entries ever named.
    std::map<std::string, std::shared_ptr<Question>, std::less<>> questions_ ZOR_GUARDED_BY(mutex_);
};

// The change notices that the identity registry lives by: of its directory and those above it, and of the directories
// that the registered executables lie in. One thread at a time.

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
