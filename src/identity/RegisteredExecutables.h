// SPDX-License-Identifier: Apache-2.0
// The files that the registry's entries name. An entry may name one below a directory that a user owns, who may mount a
// file system there that never answers: each is asked for with patience, so that nobody else's entry waits for it.
//
// The kernel's memory of names answers at once, and asks no file system. Only a path that it does not know whole is
// looked for on a thread of its own; one whose file system is silent costs one thread, and counts as no file until the
// answer comes. Any thread.
#pragma once

#include "base/Mutex.h"
#include "identity/RegistryFiles.h"
#include "os/BoundedQuestion.h"
#include "os/FileDescriptor.h"

#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zor::platform {

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

} // namespace zor::platform
