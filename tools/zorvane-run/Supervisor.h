// SPDX-License-Identifier: Apache-2.0
// Starts the sandbox, passes signals on to the program in it, and waits for its end.
//
// The sandbox's maker keeps a process of its own outside, which a signal would simply kill, and the program with it. So
// those signals are blocked there, caught here, and sent to the program itself, through a descriptor that can be no
// other process.
//
// All of that runs in a process namespace of this program's own. Its process 1 does nothing but end when this program
// does, and the kernel ends the others with it: at whatever instruction this program is killed, nothing is left. And
// nothing is left of a program when this one ends, for process 1 is gone only after the last of them.
//
// The maker is started before it is known what to make: process 1 makes the namespaces for IPC, the host's name and the
// network, and the maker is loaded in them, while this program asks the daemon; then the maker reads from a pipe. A
// launcher that finds that nothing may be made ends, and the maker with it.
#pragma once

#include "Failure.h"
#include "Notifications.h"
#include "Options.h"
#include "PassedSockets.h"
#include "os/FileDescriptor.h"

#include <optional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace zorvanerun {

/// The failure of a step of making the sandbox; errno says why.
[[nodiscard]] Failure noSandbox(const std::string& step);

class Supervisor {
public:
    /// Starts the maker. The passed sockets are its own from then on: whoever waits for their end waits for the
    /// program.
    [[nodiscard]] static Result<Supervisor> begin(const Options& options, const PassedSockets& passed);
    Supervisor(Supervisor&& other) noexcept;
    Supervisor& operator=(Supervisor&&) = delete;
    /// Everything that was started has ended then.
    ~Supervisor();

    /// Tells the maker the rest of its arguments. The exit code of the program, or why it never began.
    [[nodiscard]] Result<int> run(const std::vector<std::string>& arguments, Notifications notifications);

private:
    Supervisor() = default;
    void tell(const std::vector<std::string>& arguments);
    std::optional<int> wait(Notifications& notifications);
    void takeProgram();
    void takeSignals();
    void pass(int number) const;
    bool ended();

    std::string bubblewrap_;
    /// The namespace's process 1; -1 once it was waited for.
    pid_t keeper_ = -1;
    int status_ = 0;
    zor::platform::FileDescriptor arguments_;
    zor::platform::FileDescriptor channel_;
    zor::platform::FileDescriptor signals_;
    /// The program inside, from when there is one.
    zor::platform::FileDescriptor program_;
    std::vector<int> early_;
};

} // namespace zorvanerun
