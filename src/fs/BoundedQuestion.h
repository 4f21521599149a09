// SPDX-License-Identifier: Apache-2.0
// A question to a file system that may never answer, asked on a thread of its own so that nobody else waits for ever.
//
// One question at a time for an object: while one has not come back, others are told so at once. So a file system that
// is dead costs one thread, however often it is asked about. The thread holds nothing but what the question brings
// along, which has to outlive nothing: it may still wait when the process ends.
#pragma once

#include "base/Mutex.h"

#include <chrono>
#include <functional>
#include <memory>

namespace zor::fs {

class BoundedQuestion {
public:
    BoundedQuestion() : state_(std::make_shared<State>()) {}

    /// Runs `question` on another thread and waits for its end up to `patience`; who finds another one's question under
    /// way waits for that, unless somebody has already waited in vain. False: it has not come back. Any thread.
    bool ask(std::function<void()> question, std::chrono::milliseconds patience);

private:
    struct State {
        platform::Mutex mutex;
        platform::ConditionVariable ended;
        std::uint64_t begun ZOR_GUARDED_BY(mutex) = 0;
        std::uint64_t done ZOR_GUARDED_BY(mutex) = 0;
        /// Somebody gave up waiting for the question that is under way.
        bool late ZOR_GUARDED_BY(mutex) = false;
    };
    static bool begin(const std::shared_ptr<State>& state, std::function<void()> question);

    const std::shared_ptr<State> state_;
};

} // namespace zor::fs
