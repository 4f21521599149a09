// SPDX-License-Identifier: Apache-2.0
#include "device/DataProtection.h"

#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <sys/inotify.h>
#include <sys/mman.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <utility>

namespace zor::platform {

namespace {

constexpr std::size_t stateBytesMax = 32;
/// A shortage that is over by then is hardly noticed, and one that lasts costs next to nothing.
constexpr std::chrono::milliseconds again{100};
/// Somebody waits for an unlock to be seen, and until a lock is seen retries go on; an idle device hardly notices this.
constexpr std::chrono::milliseconds lookEvery{250};
/// A file that was changed twice within one tick of the kernel's clock looks the same after both; one that was left
/// alone for as long as this will not.
constexpr time_t settledSeconds = 1;
constexpr std::uint32_t toldEvents = IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE | IN_CLOSE_WRITE;
/// These alone are half a change, which the loop is not told of; what was read before does not count any more.
constexpr std::uint32_t watchedEvents = toldEvents | IN_MODIFY | IN_ATTRIB;
/// A change that gives no notice (through memory, or another host's on a shared file system) is seen by then.
constexpr std::int64_t keptMilliseconds = 1000;

int parseState(std::string_view text) {
    if (text.ends_with('\n'))
        text.remove_suffix(1);
    int state = FileDeviceLockState::unknown;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), state);
    return error == std::errc() && end == text.data() + text.size() ? state : FileDeviceLockState::unknown;
}

} // namespace

int FileDeviceLockState::currentState() const {
    if (const auto state = keptState())
        return *state;
    // A notice that comes after this is of a change that the look may have missed.
    const std::uint64_t takes = takes_;
    const auto state = look();
    if (!state && state.error() != ENOENT)
        return stateUnread(state.error());
    const MutexLock held(mutex_);
    kept_ = {.state = state.value_or(unlocked),
             .takes = takes,
             .untilMilliseconds = coarseMilliseconds() + keptMilliseconds};
    return kept_->state;
}

std::optional<int> FileDeviceLockState::keptState() const {
    // The order counts. The loop says that it takes notices before it does and when it has: where it took one away
    // between the look that is kept and this question to the queue, the number that is read afterwards is another one,
    // or odd.
    pollfd notices{.fd = notices_, .events = POLLIN, .revents = 0};
    if (notices.fd < 0 || ::poll(&notices, 1, 0) != 0)
        return std::nullopt;
    const std::uint64_t takes = takes_;
    const MutexLock held(mutex_);
    if (!kept_ || takes % 2 != 0 || kept_->takes != takes || coarseMilliseconds() >= kept_->untilMilliseconds)
        return std::nullopt;
    return kept_->state;
}

ErrnoOr<int> FileDeviceLockState::look() const {
    struct stat status{};
    if (::fstatat(root_.runtimeDirectory(), names::lockState, &status, AT_SYMLINK_NOFOLLOW) != 0)
        return Errno::last();
    {
        const MutexLock held(mutex_);
        if (known_ && known_->stamp == stampOf(status))
            return known_->state;
    }
    return readState();
}

ErrnoOr<int> FileDeviceLockState::readState() const {
    const auto file = openBeneath(root_.runtimeDirectory(), names::lockState, O_RDONLY | O_NONBLOCK);
    if (!file)
        return file.error();
    struct stat status{};
    timespec now{};
    const bool examined = ::fstat(file->get(), &status) == 0 && ::clock_gettime(CLOCK_REALTIME, &now) == 0;
    const auto text = readSmallFile(file->get(), stateBytesMax);
    if (!text)
        return text.error();
    const int state = parseState(*text);
    const MutexLock held(mutex_);
    known_.reset();
    if (examined && status.st_ctim.tv_sec + settledSeconds < now.tv_sec)
        known_ = {.stamp = stampOf(status), .state = state};
    return state;
}

int FileDeviceLockState::stateUnread(Errno error) const {
    if (isOwnShortage(error) && again_)
        again_->set(again);
    return unknown;
}

const char* FileDeviceLockState::notificationName() const {
    return names::lockState;
}

Errno FileDeviceLockState::registerForChanges(RunLoop& loop, std::function<void()> changed) {
    loop_ = &loop;
    changed_ = std::move(changed);
    again_.emplace(loop, [this] { lookAgain(); });
    const Errno error = follow();
    if (error)
        again_->set(lookEvery);
    return error;
}

Errno FileDeviceLockState::follow() {
    FileDescriptor inotify(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (!inotify.valid())
        return Errno::last();
    (void)TRY(watchDirectory(inotify.get(), root_.runtimeDirectory(), watchedEvents));
    const bool watched = loop_->watch(inotify.get(), [this] {
        if (takeEvents())
            changed_();
    });
    if (!watched)
        return Errno(ENOMEM);
    inotify_ = std::move(inotify);
    takes_ += 2; // what was kept before had no notices
    notices_ = inotify_.get();
    return Errno();
}

void FileDeviceLockState::lookAgain() {
    // Before the look: what changes after it is then noticed.
    if (!inotify_.valid() && follow())
        again_->set(lookEvery);
    changed_();
}

bool FileDeviceLockState::takeEvents() {
    ++takes_;
    const bool told = readInotify(inotify_.get(), [](const inotify_event& event, std::string_view name) {
        return (event.mask & IN_Q_OVERFLOW) != 0 || ((event.mask & toldEvents) != 0 && name == names::lockState);
    });
    ++takes_;
    return told;
}

namespace {

bool keysGoWithLock(int protectionClass) {
    return protectionClass == 1 || protectionClass == 2;
}

/// Root inside a container often lacks the right that the trusted namespace asks for. The right is the process's, not
/// the file system's, so a file in memory tells, and the disk stays as it is.
const char* chooseAttribute() {
    if (::geteuid() != 0)
        return names::protectionAttributeUser;
    const FileDescriptor probe(::memfd_create("zorvane", MFD_CLOEXEC));
    const bool refused =
        probe.valid() && ::fsetxattr(probe.get(), names::protectionAttribute, "0", 1, 0) != 0 && errno == EPERM;
    return refused ? names::protectionAttributeUser : names::protectionAttribute;
}

} // namespace

XattrProtectionClass::XattrProtectionClass(Disk& disk, const DeviceLockState& lockState)
    : attribute_(chooseAttribute()), disk_(disk), lockState_(lockState) {}

ErrnoOr<int> XattrProtectionClass::classOf(int fd) const {
    return TRY(classIn(fd, attribute_)).value_or(defaultProtectionClass);
}

ErrnoOr<std::optional<int>> XattrProtectionClass::classIn(int fd, const char* attribute) {
    char text[16];
    ssize_t bytes = ::fgetxattr(fd, attribute, text, sizeof text);
    // One that was opened for its path alone is reached by the kernel's link to it.
    if (bytes < 0 && errno == EBADF && fd >= 0)
        bytes = ::getxattr(("/proc/self/fd/" + std::to_string(fd)).c_str(), attribute, text, sizeof text);
    if (bytes < 0) {
        if (errno == ENODATA || errno == EOPNOTSUPP)
            return std::nullopt;
        if (errno == ERANGE) // a longer value is no number of ours
            return defaultProtectionClass;
        return neverLocked(Errno::last());
    }
    int protectionClass = 0;
    const auto [end, error] = std::from_chars(text, text + bytes, protectionClass);
    if (error != std::errc() || end != text + bytes || protectionClass < 0)
        return defaultProtectionClass;
    return protectionClass;
}

Errno XattrProtectionClass::setClass(int fd, int protectionClass) {
    if (protectionClass < 0)
        return Errno(EINVAL);
    if (lockState_.currentState() == DeviceLockState::locked) {
        const int current = TRY(classOf(fd));
        if (keysGoWithLock(protectionClass) || keysGoWithLock(current))
            return Errno(EPERM);
    }
    const std::string text = std::to_string(protectionClass);
    const Errno set =
        disk_.setAttribute(fd, attribute_, {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    if (set == EOPNOTSUPP)
        supported_.store(false, std::memory_order_relaxed);
    return neverLocked(set);
}

} // namespace zor::platform
