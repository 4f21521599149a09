// SPDX-License-Identifier: Apache-2.0
// Rules by which the kernel refuses system calls to a process and to all that it starts, for good.
//
// The rule that was added first decides a call that meets several; `Rest` decides one that meets none. A call of
// another architecture ends the process: it has other numbers, so no rule would know it. A rule compares the low half
// of an argument: the kernel reads no more of the arguments named here. One thread.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <linux/filter.h>
#include <vector>

namespace zor::platform {

class SystemCallFilter {
public:
    enum class Rest : std::uint8_t { allowed, refused };

    SystemCallFilter();

    void allow(int call);
    void refuse(int call, int error);
    /// Refuses it when the argument has all of `bits`.
    void refuseBits(int call, unsigned argument, std::uint32_t bits, int error);
    void refuseValue(int call, unsigned argument, std::uint32_t value, int error);
    void refuseUnless(int call, unsigned argument, std::initializer_list<std::uint32_t> values, int error);

    /// From here on for the calling thread and what it starts; `refused` answers EPERM. It can be neither loosened nor
    /// taken back. The thread has to have given up new privileges (PR_SET_NO_NEW_PRIVS). False: nothing was laid on.
    [[nodiscard]] bool layOn(Rest rest);

private:
    /// For a rule of `count` instructions that holds for one call alone; what comes behind it may load what it likes.
    void beginRule(int call, unsigned count);
    void add(std::uint16_t code, std::uint32_t value, std::uint8_t ifTrue = 0, std::uint8_t ifFalse = 0);
    void answer(std::uint32_t action);
    void loadArgument(unsigned argument);

    std::vector<sock_filter> program_;
};

} // namespace zor::platform
