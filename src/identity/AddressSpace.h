// SPDX-License-Identifier: Apache-2.0
// Whether a process still has the address space that it had, for the price of the cheapest system call: to execute
// another program means to leave the address space, and so does the end of the process.
//
// It is told by a descriptor of the process's page map, which stays with the address space that was there when it was
// opened. A read of one byte, which is no whole entry of the map, is refused while the address space lives and finds
// nothing to read when it is gone; no page of the process is looked at.
//
// An address space lives until the last process that shares it leaves it: one that was made by vfork, say, keeps alive
// what its parent has left. So "has gone" is certain and "lives" is not: who relies on it looks at the executable
// itself again after a short time.
#pragma once

#include "os/FileDescriptor.h"

#include <memory>

namespace zor::platform {

class AddressSpace {
public:
    AddressSpace() = default;
    /// The address space of the process whose /proc directory is open. It counts as gone where the kernel does not let
    /// this process look at it, or there is no descriptor for it.
    [[nodiscard]] static AddressSpace of(int process);
    /// Whether it lives still, as far as this can tell. False where the kernel gives another answer than expected.
    [[nodiscard]] bool lives() const;
    /// Whether the kernel tells it at all: tried, once, on this process and on a child that executes a program. Waits
    /// for the child, a second at most, and leaves none.
    [[nodiscard]] static bool isTold();
    /// Starts the child, for who has other work until isTold. Called once, before there are other threads; the child is
    /// there until isTold.
    static void beginTrial();

private:
    class Trial;
    [[nodiscard]] static AddressSpace opened(int process);
    [[nodiscard]] static std::unique_ptr<Trial>& trial();

    FileDescriptor pageMap_;
};

} // namespace zor::platform
