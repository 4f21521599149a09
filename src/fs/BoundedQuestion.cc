// SPDX-License-Identifier: Apache-2.0
#include "fs/BoundedQuestion.h"

#include "base/BlockingScope.h"

#include <system_error>
#include <thread>

namespace zor::fs {

using platform::MutexLock;

bool BoundedQuestion::begin(const std::shared_ptr<State>& state, std::function<void()> question) {
    try {
        std::thread([state, question = std::move(question)]() mutable {
            question();
            question = nullptr; // who waits finds nothing held any more by what was asked
            const MutexLock held(state->mutex);
            state->done = state->begun;
            state->late = false;
            state->ended.broadcast();
        }).detach();
        return true;
    } catch (const std::system_error&) {
        // No thread can be had now: that the file system answers is not known, and is not taken for granted.
        return false;
    }
}

bool BoundedQuestion::ask(std::function<void()> question, std::chrono::milliseconds patience) {
    State& state = *state_;
    const platform::BlockingScope blocking;
    const MutexLock held(state.mutex);
    if (state.late)
        return false;
    if (state.begun == state.done) {
        if (!begin(state_, std::move(question)))
            return false;
        ++state.begun;
    }
    const std::uint64_t awaited = state.begun;
    const auto until = std::chrono::steady_clock::now() + patience;
    while (state.done < awaited) {
        const auto left = until - std::chrono::steady_clock::now();
        if (left <= left.zero()) {
            state.late = true;
            return false;
        }
        state.ended.waitFor(state.mutex,
                            std::chrono::duration_cast<std::chrono::milliseconds>(left) + std::chrono::milliseconds(1));
    }
    return true;
}

} // namespace zor::fs
