// SPDX-License-Identifier: Apache-2.0
// A question to a file system that may never answer, asked on a thread of its own so that nobody else waits for ever.
//
// An object has one question at a time: a caller that comes while it is under way gets its answer, and once somebody
// has waited for it in vain, all others are told so at once. So a file system that is dead costs one thread, however
// often it is asked about. The thread holds nothing but what the question brings along, which refers to nothing that
// may go: the thread may still wait when the process ends.
#pragma once

#include "base/Mutex.h"

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <system_error>
#include <thread>

namespace zor::platform {

/// How much longer than the patience for the question a thread may take to begin with it: a machine that is so busy
/// that a thread does not run says nothing of a file system.
inline constexpr int beginFactor = 5;

/// All questions of an object ask the same, so that one's answer is as good as another's.
template <typename Answer>
class BoundedQuestion {
public:
    /// Runs `question` on another thread, or waits for the one that is under way unless somebody has already waited in
    /// vain. None: it has not come back within `patience` from its beginning, or there was no thread or no memory for
    /// it. Any thread.
    std::optional<Answer> ask(std::function<Answer()> question, std::chrono::milliseconds patience) {
        const BlockingScope blocking;
        const MutexLock held(state_->mutex);
        if (state_->late || (!state_->underWay && !begin(std::move(question))))
            return std::nullopt;
        const std::uint64_t answersBefore = state_->answers;
        const auto asked = std::chrono::steady_clock::now();
        while (state_->answers == answersBefore) {
            const auto until =
                state_->begun ? std::max(asked, state_->begunAt) + patience : asked + patience * beginFactor;
            const auto left = until - std::chrono::steady_clock::now();
            if (left <= left.zero()) {
                state_->late = true;
                return std::nullopt;
            }
            state_->ended.waitFor(state_->mutex, std::chrono::duration_cast<std::chrono::milliseconds>(left) +
                                                     std::chrono::milliseconds(1));
        }
        return state_->answer;
    }

private:
    struct State {
        Mutex mutex;
        ConditionVariable ended;
        bool underWay ZOR_GUARDED_BY(mutex) = false;
        /// Whether the one under way has its thread, and since when.
        bool begun ZOR_GUARDED_BY(mutex) = false;
        std::chrono::steady_clock::time_point begunAt ZOR_GUARDED_BY(mutex);
        /// Somebody gave up waiting for the question that is under way.
        bool late ZOR_GUARDED_BY(mutex) = false;
        std::uint64_t answers ZOR_GUARDED_BY(mutex) = 0;
        std::optional<Answer> answer ZOR_GUARDED_BY(mutex);
    };

    bool begin(std::function<Answer()> question) ZOR_REQUIRES(state_->mutex) {
        try {
            std::thread([state = state_, question = std::move(question)]() mutable {
                {
                    const MutexLock held(state->mutex);
                    state->begun = true;
                    state->begunAt = std::chrono::steady_clock::now();
                    state->ended.broadcast(); // who waits has another end of its patience
                }
                std::optional<Answer> answer;
                try {
                    answer.emplace(question());
                } catch (...) {
                    answer.reset(); // memory ran out: nothing is known
                }
                question = nullptr; // who waits finds nothing held any more by what was asked
                const MutexLock held(state->mutex);
                state->answer = std::move(answer);
                ++state->answers;
                state->underWay = state->late = state->begun = false;
                state->ended.broadcast();
            }).detach();
            state_->underWay = true;
            return true;
        } catch (const std::system_error&) {
            // No thread can be had now: that the file system answers is not known, and is not taken for granted.
            return false;
        }
    }

    const std::shared_ptr<State> state_ = std::make_shared<State>();
};

} // namespace zor::platform
