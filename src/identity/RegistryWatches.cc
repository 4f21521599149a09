// SPDX-License-Identifier: Apache-2.0
#include "identity/RegistryWatches.h"

#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"

#include <algorithm>
#include <chrono>
#include <climits>
#include <fcntl.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::platform {

namespace {

/// A file system that takes longer, and is not dead, makes its program unknown until it has answered.
constexpr std::chrono::milliseconds patienceOfPeers{1000};

/// The regular file that is open, or that lies at a path, whose last link is followed. The numbers that tell a file
/// apart never change, so its file system need not be asked for that.
std::optional<FileId> regularFile(int directory, const char* path, int flags) {
    struct statx status{};
    if (::statx(directory, path, flags | AT_STATX_DONT_SYNC, STATX_INO | STATX_TYPE, &status) != 0 ||
        !S_ISREG(status.stx_mode))
        return std::nullopt;
    return FileId{.device = makedev(status.stx_dev_major, status.stx_dev_minor), .inode = status.stx_ino};
}

/// The path without links; empty when it leads nowhere.
std::string resolved(const std::string& path) {
    const FileDescriptor file(::open(path.c_str(), O_PATH | O_CLOEXEC));
    if (!file.valid())
        return {};
    char buffer[PATH_MAX];
    const std::string link = "/proc/self/fd/" + std::to_string(file.get());
    const ssize_t bytes = ::readlink(link.c_str(), buffer, sizeof buffer);
    return bytes > 0 ? std::string(buffer, static_cast<std::size_t>(bytes)) : std::string();
}

void watchNameAt(const std::string& path, int inotify, std::uint32_t events, RegisteredExecutables::Found& watched) {
    const std::size_t slash = path.rfind('/');
    const FileDescriptor parent(::open(path.substr(0, slash + 1).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const auto number = parent.valid() ? watchDirectory(inotify, parent.get(), events) : Errno::last();
    if (number)
        watched.watches.push_back({.number = *number, .name = path.substr(slash + 1)});
    else
        watched.watchedAll = false;
}

RegisteredExecutables::Found lookAt(const std::string& path) {
    return {.file = regularFile(AT_FDCWD, path.c_str(), 0), .watches = {}};
}

RegisteredExecutables::Found watchAndLookAt(const std::string& path, int inotify, std::uint32_t events) {
    RegisteredExecutables::Found watched{.file = {}, .watches = {}, .watchedAll = true};
    // Watches come first: what changes after the look is then told.
    watchNameAt(path, inotify, events, watched);
    if (const std::string target = resolved(path); !target.empty() && target != path)
        watchNameAt(target, inotify, events, watched);
    watched.file = lookAt(path).file;
    return watched;
}

} // namespace

std::shared_ptr<RegisteredExecutables::Question> RegisteredExecutables::questionOf(const std::string& path) {
    const MutexLock held(mutex_);
    std::shared_ptr<Question>& question = questions_[path];
    if (!question)
        question = std::make_shared<Question>();
    return question;
}

std::optional<FileId> RegisteredExecutables::fileAt(const std::string& path) {
    const auto remembered = openRemembered(path.c_str());
    if (remembered)
        return regularFile(remembered->get(), "", AT_EMPTY_PATH);
    if (remembered.error() == ENOENT)
        return std::nullopt;
    const auto found = questionOf(path)->ask([path] { return lookAt(path); }, patienceOfPeers);
    return found ? found->file : std::nullopt;
}

std::optional<RegisteredExecutables::Found>
RegisteredExecutables::watch(const std::string& path, const std::shared_ptr<const FileDescriptor>& inotify,
                             std::uint32_t events, std::chrono::milliseconds patience) {
    return questionOf(path)->ask([path, inotify, events] { return watchAndLookAt(path, inotify->get(), events); },
                                 patience);
}

namespace {

constexpr std::uint32_t nameEvents =
    IN_CREATE | IN_DELETE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE_SELF | IN_MOVE_SELF;
constexpr std::uint32_t contentEvents = nameEvents | IN_CLOSE_WRITE | IN_MODIFY | IN_ATTRIB;

/// A look at the registry waits for one dead file system; those after it have had that time.
constexpr std::chrono::milliseconds patience{1000};
constexpr std::chrono::milliseconds patienceAfterOne{10};

std::shared_ptr<const FileDescriptor> newInotify() {
    return std::make_shared<const FileDescriptor>(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
}

} // namespace

RegistryWatches::RegistryWatches(const SystemRoot& root) : root_(root), inotify_(newInotify()) {}

RegistryWatches::Noticed RegistryWatches::take() {
    Noticed most = Noticed::nothing;
    if (!inotify_->valid()) {
        // None could be had for want of something: everything is watched and read anew as soon as one can.
        inotify_ = newInotify();
        return inotify_->valid() ? Noticed::registry : most;
    }
    readInotify(inotify_->get(), [&](const inotify_event& event, std::string_view name) {
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
    complete_ = inotify_->valid();
    silent_ = 0;
}

void RegistryWatches::end() {
    for (const auto& [number, interest] : interests_) {
        if (!interestsNew_.contains(number))
            (void)::inotify_rm_watch(inotify_->get(), number);
    }
    interests_.swap(interestsNew_);
    interestsNew_.clear();
}

RegistryWatches::Interest* RegistryWatches::watch(int directory, std::uint32_t events, Noticed kind) {
    const auto number = watchDirectory(inotify_->get(), directory, events | IN_MASK_ADD);
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

std::optional<RegisteredExecutables::Found> RegistryWatches::watchExecutable(const std::string& path,
                                                                             RegisteredExecutables& executables) {
    auto found = executables.watch(path, inotify_, nameEvents | IN_MASK_ADD, silent_ > 0 ? patienceAfterOne : patience);
    if (!found || !found->watchedAll)
        complete_ = false;
    if (!found) {
        ++silent_;
        return found;
    }
    for (const RegisteredExecutables::Watch& watch : found->watches) {
        Interest& interest = interestsNew_[watch.number];
        interest.kind = std::max(interest.kind, Noticed::executables);
        interest.names.insert(watch.name);
    }
    return found;
}

} // namespace zor::platform
