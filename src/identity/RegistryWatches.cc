// SPDX-License-Identifier: Apache-2.0
#include "identity/RegistryWatches.h"

#include "os/Inotify.h"
#include "os/Names.h"
#include "os/Openat2.h"

#include <algorithm>
#include <climits>
#include <fcntl.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr std::uint32_t nameEvents =
    IN_CREATE | IN_DELETE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE_SELF | IN_MOVE_SELF;
constexpr std::uint32_t contentEvents = nameEvents | IN_CLOSE_WRITE | IN_MODIFY | IN_ATTRIB;

/// The path without its last link, if it ends in one; empty when there is nothing of that name.
std::string resolved(const std::string& path) {
    const FileDescriptor file(::open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file.valid())
        return {};
    char buffer[PATH_MAX];
    const std::string link = "/proc/self/fd/" + std::to_string(file.get());
    const ssize_t bytes = ::readlink(link.c_str(), buffer, sizeof buffer);
    return bytes > 0 ? std::string(buffer, static_cast<std::size_t>(bytes)) : std::string();
}

} // namespace

RegistryWatches::RegistryWatches(const SystemRoot& root)
    : root_(root), inotify_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {}

RegistryWatches::Noticed RegistryWatches::take() {
    Noticed most = Noticed::nothing;
    if (!inotify_.valid()) {
        // None could be had for want of something: everything is watched and read anew as soon as one can.
        inotify_.reset(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        return inotify_.valid() ? Noticed::registry : most;
    }
    readInotify(inotify_.get(), [&](const inotify_event& event, std::string_view name) {
        most = std::max(most, judge(event, name));
        followWriters(event, name);
        return true;
    });
    return most;
}

RegistryWatches::Noticed RegistryWatches::judge(const inotify_event& event, std::string_view name) const {
    if ((event.mask & IN_Q_OVERFLOW) != 0)
        return Noticed::registry;
    const auto found = interests_.find(event.wd);
    if ((event.mask & IN_IGNORED) != 0 || found == interests_.end())
        return Noticed::nothing;
    const Interest& interest = found->second;
    const bool isAboutItself = name.empty();
    return interest.everything || isAboutItself || interest.names.contains(name) ? interest.kind : Noticed::nothing;
}

void RegistryWatches::followWriters(const inotify_event& event, std::string_view name) {
    const auto found = interests_.find(event.wd);
    if ((event.mask & IN_Q_OVERFLOW) != 0)
        beingWritten_.clear();
    if (found == interests_.end() || !found->second.everything || name.empty())
        return;
    if ((event.mask & (IN_CREATE | IN_MODIFY)) != 0)
        beingWritten_.emplace(name);
    else if ((event.mask & (IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE)) != 0)
        if (const auto writer = beingWritten_.find(name); writer != beingWritten_.end())
            beingWritten_.erase(writer);
}

void RegistryWatches::begin() {
    interestsNew_.clear();
    complete_ = inotify_.valid();
}

void RegistryWatches::end() {
    for (const auto& [number, interest] : interests_) {
        if (!interestsNew_.contains(number))
            (void)::inotify_rm_watch(inotify_.get(), number);
    }
    interests_.swap(interestsNew_);
    interestsNew_.clear();
}

RegistryWatches::Interest* RegistryWatches::watch(int directory, std::uint32_t events, Noticed kind) {
    const auto number = watchDirectory(inotify_.get(), directory, events | IN_MASK_ADD);
    if (!number) {
        complete_ = false;
        return nullptr;
    }
    Interest& interest = interestsNew_[*number];
    interest.kind = std::max(interest.kind, kind);
    return &interest;
}

void RegistryWatches::watchRegistry() {
    // The root, etc, etc/zorvane, etc/zorvane/identities.d: each but the first may come later than the daemon.
    const std::string_view whole = names::identityDirectory;
    std::string path = ".";
    for (std::size_t next = 0;;) {
        const auto directory = openBeneath(root_.descriptor(), path.c_str(), O_PATH | O_DIRECTORY);
        if (!directory)
            return;
        const bool isLast = next == std::string_view::npos;
        Interest* const interest = watch(directory->get(), isLast ? contentEvents : nameEvents, Noticed::registry);
        if (interest)
            interest->everything = isLast;
        if (isLast)
            return;
        const std::size_t slash = whole.find('/', next);
        if (interest)
            interest->names.emplace(whole.substr(next, slash - next));
        path = whole.substr(0, slash);
        next = slash == std::string_view::npos ? slash : slash + 1;
    }
}

void RegistryWatches::watchExecutable(const std::string& path) {
    watchNameAt(path);
    const std::string target = resolved(path);
    if (!target.empty() && target != path)
        watchNameAt(target);
}

void RegistryWatches::watchNameAt(const std::string& path) {
    const std::size_t slash = path.rfind('/');
    const FileDescriptor parent(::open(path.substr(0, slash + 1).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!parent.valid()) {
        complete_ = false;
        return;
    }
    if (Interest* const interest = watch(parent.get(), nameEvents, Noticed::executables))
        interest->names.insert(path.substr(slash + 1));
}

} // namespace zor::platform
