// SPDX-License-Identifier: Apache-2.0
// zorvane-lockd: tells zorvaned whether the device is locked, as the login service (logind) says. Runs as a user of its
// own that may write one file, and nothing else.
//
// A kill leaves the state that was told last. The service manager starts this program again, and the first thing that
// it then does is to tell what is so.
#include "Sessions.h"
#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "platform/Device.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <string_view>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace {

using zor::platform::DeviceLockState;

constexpr int exitFailure = 1;
constexpr int exitUsage = 2;

int say(const std::string& what, int number) {
    std::fprintf(stderr, "zorvane-lockd: %s: %s\n", what.c_str(), std::strerror(number));
    return exitFailure;
}

/// The file that the daemon reads. It is there already, and this user's: nobody but root makes files beside it.
class StateFile {
public:
    explicit StateFile(const std::string& root)
        : path_(root + "/" + std::string(zor::ipc::runtimeDirectory) + "/" + std::string(zor::ipc::lockStateFile)) {}
    [[nodiscard]] const std::string& path() const { return path_; }
    /// 0 or an errno. One write of two bytes over two: a reader sees the old state or the new one. The daemon is told
    /// when the file is closed.
    int put(bool isLocked) const {
        const std::string text = std::to_string(isLocked ? DeviceLockState::locked : DeviceLockState::unlocked) + "\n";
        const zor::platform::FileDescriptor file(::open(path_.c_str(), O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        if (!file.valid() || ::pwrite(file.get(), text.data(), text.size(), 0) < 0)
            return errno;
        return 0;
    }

private:
    const std::string path_;
};

int follow(const StateFile& file) {
    sd_bus* bus = nullptr;
    if (const int failure = sd_bus_open_system(&bus); failure < 0)
        return say("cannot reach the system's message bus", -failure);
    int told = -1;
    int failed = 0;
    zorvanelockd::Sessions sessions(bus, [&](bool isLocked) {
        if (told == static_cast<int>(isLocked))
            return;
        failed = file.put(isLocked);
        told = static_cast<int>(isLocked);
        std::fprintf(stderr, "zorvane-lockd: the device is %s\n", isLocked ? "locked" : "unlocked");
    });
    int done = sessions.follow();
    if (done >= 0)
        (void)sd_notify(0, "READY=1");
    while (done >= 0 && failed == 0) {
        done = sd_bus_process(bus, nullptr);
        if (done == 0)
            done = sd_bus_wait(bus, UINT64_MAX);
        if (done == -EINTR)
            done = 0;
    }
    sd_bus_flush_close_unref(bus);
    return failed != 0 ? say("cannot write " + file.path(), failed) : say("the message bus is gone", -done);
}

} // namespace

int main(int count, char** arguments) {
    const std::string_view option = count > 1 ? arguments[1] : "";
    if (option == "--version") {
        std::puts("zorvane-lockd " ZORVANE_VERSION);
        return 0;
    }
    const bool hasRoot = count == 3 && option == "--root";
    if (count != 1 && !hasRoot) {
        std::fputs("usage: zorvane-lockd [--root DIR]\n"
                   "Writes into DIR/run/zorvane/lockstate whether all sessions at the device's seats are locked.\n",
                   option == "--help" ? stdout : stderr);
        return option == "--help" ? 0 : exitUsage;
    }
    return follow(StateFile(hasRoot ? arguments[2] : ""));
}
