// SPDX-License-Identifier: Apache-2.0
// How a program has to end.
#pragma once

#include "process/Program.h"

#include <gtest/gtest.h>

namespace zor::whole {

/// That it ended so, and said that.
inline void expectOutcome(const Outcome& outcome, int exitStatus, const std::string& says) {
    EXPECT_EQ(outcome.exitStatus, exitStatus) << outcome.output;
    EXPECT_NE(outcome.output.find(says), std::string::npos) << says << " in " << outcome.output;
}

inline void expectEnd(Program& program, int exitStatus, const std::string& says) {
    const int status = program.wait();
    expectOutcome({status, program.said()}, exitStatus, says);
}

} // namespace zor::whole
