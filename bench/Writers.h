// SPDX-License-Identifier: Apache-2.0
// Clients that change the store, for themselves or beside one that is measured.
#pragma once

#include "Daemon.h"

#include <atomic>
#include <exception>
#include <string>
#include <thread>
#include <utility>

namespace zor::bench {

/// A whole frame: registers entitlements for an identifier.
[[nodiscard]] Frame registration(const std::string& identifier, plist::Dictionary entitlements,
                                 plist::Dictionary options = {});

/// Puts one new bundle container after the other in the place of the last.
class Replacer {
public:
    Replacer(const Daemon& daemon, std::string identifier);
    /// Makes a new one and lets it replace the last; the microseconds that the second took.
    double replace();

private:
    const std::string identifier_;
    Client client_;
    Container old_;
};

/// Work of other clients, on a thread of its own; what it throws comes out of `wait`.
class OtherClient {
public:
    template <typename Work>
    explicit OtherClient(Work&& work)
        : thread_([this, work = std::forward<Work>(work)] {
              try {
                  work();
              } catch (...) {
                  failure_ = std::current_exception();
              }
              ended_ = true;
          }) {}
    ~OtherClient() {
        if (thread_.joinable())
            thread_.join();
    }
    OtherClient(const OtherClient&) = delete;
    OtherClient& operator=(const OtherClient&) = delete;

    [[nodiscard]] bool ended() const { return ended_; }
    void wait() {
        thread_.join();
        if (failure_)
            std::rethrow_exception(failure_);
    }

private:
    std::atomic<bool> ended_{false};
    std::exception_ptr failure_;
    std::thread thread_;
};

} // namespace zor::bench
