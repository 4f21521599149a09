// SPDX-License-Identifier: Apache-2.0
#include "store/WaitingReplaces.h"

#include <utility>

namespace zor {

using platform::MutexLock;

void WaitingReplaces::add(Waiting waiting) {
    const MutexLock held(mutex_);
    std::erase_if(waiting_, [&](const Waiting& one) { return one.journalUrl == waiting.journalUrl; });
    waiting_.push_back(std::move(waiting));
    update();
}

void WaitingReplaces::remove(const FileURL& journalUrl) {
    const MutexLock held(mutex_);
    std::erase_if(waiting_, [&](const Waiting& one) { return one.journalUrl == journalUrl; });
    update();
}

std::vector<WaitingReplaces::Waiting> WaitingReplaces::all() const {
    const MutexLock held(mutex_);
    return waiting_;
}

bool WaitingReplaces::unlisted() const {
    const MutexLock held(mutex_);
    return unlisted_;
}

void WaitingReplaces::setUnlisted(bool unlisted) {
    const MutexLock held(mutex_);
    unlisted_ = unlisted;
    update();
}

} // namespace zor
