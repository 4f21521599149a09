// SPDX-License-Identifier: Apache-2.0
#include "process/UnitFences.h"

#include "support/Sanitized.h"

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <fstream>
#include <linux/seccomp.h>
#include <sstream>
#include <string>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <unistd.h>

namespace zor::whole {

namespace {

std::vector<unsigned> numbersIn(std::istream& lines) {
    std::string line;
    std::getline(lines, line);
    std::istringstream words(line);
    std::vector<unsigned> numbers;
    for (unsigned number = 0; words >> number;)
        numbers.push_back(number);
    return numbers;
}

} // namespace

UnitFences::UnitFences() {
    std::ifstream lines(ZORVANE_BINARY_DIR "/unit-fences"); // made by unit-fences.sh
    capabilities_ = numbersIn(lines);
    const auto passed = numbersIn(lines);
    const auto refused = numbersIn(lines);
    if (support::isSanitized || passed.empty())
        return;
    filter_.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)));
    const auto answer = [&](const std::vector<unsigned>& calls, std::uint32_t action) {
        for (const unsigned call : calls) {
            filter_.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, call, 0, 1));
            filter_.push_back(BPF_STMT(BPF_RET | BPF_K, action));
        }
    };
    answer(passed, SECCOMP_RET_ALLOW);
    answer(refused, SECCOMP_RET_KILL_PROCESS);
    // The service manager's answer to calls that are newer than itself.
    filter_.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS));
}

bool UnitFences::enter() {
    constexpr rlimit nice{.rlim_cur = 25, .rlim_max = 25}; // the unit's LimitNICE=-5
    if (::geteuid() == 0 && !support::isSanitized) {
        (void)::setrlimit(RLIMIT_NICE, &nice); // where there is no power for it, priorities stay as they are
        for (unsigned number = 0; ::prctl(PR_CAPBSET_READ, number, 0, 0, 0) >= 0; ++number)
            if (std::ranges::find(capabilities_, number) == capabilities_.end() &&
                ::prctl(PR_CAPBSET_DROP, number, 0, 0, 0) != 0)
                return false;
    }
    const sock_fprog program{.len = static_cast<unsigned short>(filter_.size()), .filter = filter_.data()};
    return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           (!hasFilter() || ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0);
}

} // namespace zor::whole
