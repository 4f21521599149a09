// SPDX-License-Identifier: Apache-2.0
#include "soak/Session.h"

#include <cstdio>

namespace zor::soak {

namespace {
constexpr std::size_t keptOperationsMax = 60;
} // namespace

void Session::found(const std::string& what) {
    const std::lock_guard lock(mutex_);
    findings_.push_back(what);
    stopped = true;
}

std::vector<std::string> Session::findings() const {
    const std::lock_guard lock(mutex_);
    return findings_;
}

void Session::did(const std::string& client, const std::string& operation, const std::string& detail) {
    const std::lock_guard lock(mutex_);
    ++counts_[operation];
    last_.push_back(client + " " + operation + " " + detail);
    if (printsOperations_)
        std::puts(last_.back().c_str());
    if (last_.size() > keptOperationsMax)
        last_.pop_front();
}

std::map<std::string, std::uint64_t> Session::counts() const {
    const std::lock_guard lock(mutex_);
    return counts_;
}

std::deque<std::string> Session::lastOperations() const {
    const std::lock_guard lock(mutex_);
    return last_;
}

} // namespace zor::soak
