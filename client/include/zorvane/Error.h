// SPDX-License-Identifier: Apache-2.0
// The errors of a call to the container manager.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace zorvane {

struct Error {
    enum class Kind {
        /// The daemon cannot be reached: not running, another root, no permission; or it ended while the call waited,
        /// and what the call was to change may have been done or not.
        unreachable,
        /// The daemon ended the connection instead of answering: it does not know this program, or does not do this for
        /// it. The message says which, and whom it takes this program for.
        refused,
        /// The time given to the call ran out. The command may still be carried out.
        timedOut,
        /// The answer makes no sense.
        protocol,
        /// The daemon answered with an error code.
        daemon,
    };
    Kind kind = Kind::protocol;
    /// The daemon's code; 0 unless kind is daemon. For a failed step that has no code of its own, the system's errno:
    /// as it is where no code of the daemon's has that number, else with 1000 added.
    std::uint64_t code = 0;
    /// One sentence for people, without a full stop.
    std::string message;
    /// The advice, in the same form; empty where kind and code say it all (errorText).
    std::string advice = {};
};

/// The daemon found no such container, or no such info key in it.
[[nodiscard]] bool isNotFound(const Error& error);

/// The meaning of a code of the daemon, how it comes about, what follows from it, and what to do. Static strings, never
/// null or empty.
struct ErrorText {
    const char* meaning;
    const char* cause;
    const char* consequence;
    const char* advice;
};
[[nodiscard]] ErrorText errorText(std::uint64_t code);
/// Every code that errorText has words for, in ascending order.
[[nodiscard]] std::vector<std::uint64_t> errorCodes();

} // namespace zorvane
