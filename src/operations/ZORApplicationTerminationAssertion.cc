// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORApplicationTerminationAssertion.h"

#include "base/ZORError.h"

#include <cerrno>
#include <cstdlib>
#include <semaphore.h>

namespace zor {

namespace {

constexpr const char* initFunction = "initWithBundleIdentifier";

platform::TerminationReason reasonOf(const Log& log, std::uint8_t code) {
    using platform::TerminationReason;
    switch (code) {
    case static_cast<std::uint8_t>(TerminationReason::installation):
    case static_cast<std::uint8_t>(TerminationReason::cacheDeletion):
    case static_cast<std::uint8_t>(TerminationReason::critical):
        return static_cast<TerminationReason>(code);
    default:
        log.write(logLevelError, initFunction, "Unknown reason: %d", code);
        std::abort();
    }
}

/// The semaphore with which the service's answer is waited for. The answer may come after the wait was given up, so
/// both sides share it.
class Acquisition {
public:
    Acquisition() : usable_(::sem_init(&semaphore_, 0, 0) == 0) {}
    ~Acquisition() {
        if (usable_)
            ::sem_destroy(&semaphore_);
    }
    Acquisition(const Acquisition&) = delete;
    Acquisition& operator=(const Acquisition&) = delete;

    [[nodiscard]] bool usable() const { return usable_; }
    void answer(bool acquired) {
        acquired_ = acquired;
        ::sem_post(&semaphore_);
    }
    /// Whether it was granted.
    [[nodiscard]] bool wait() {
        while (::sem_wait(&semaphore_) != 0 && errno == EINTR)
            continue;
        return acquired_;
    }

private:
    sem_t semaphore_{};
    const bool usable_;
    bool acquired_ = true;
};

} // namespace

std::unique_ptr<ZORApplicationTerminationAssertion>
ZORApplicationTerminationAssertion::initWithBundleIdentifier(const Log& log,
                                                             platform::TerminationAssertionService& service,
                                                             const std::string& bundleIdentifier, std::uint8_t reason) {
    const auto acquisition = std::make_shared<Acquisition>();
    if (!acquisition->usable()) {
        log.write(logLevelError, initFunction, "Failed to create completion semaphore: %s", Errno::last().text());
        return nullptr;
    }
    Handle handle = service.acquire(bundleIdentifier, reasonOf(log, reason),
                                    [&log, acquisition, bundleIdentifier](const std::optional<std::string>& error) {
                                        if (error)
                                            log.write(logLevelError, initFunction,
                                                      "Failed to acquire termination assertion for %s : %s",
                                                      ZOR_SHOWN(bundleIdentifier), error->c_str());
                                        acquisition->answer(!error);
                                    });
    if (!handle) {
        log.write(logLevelError, initFunction, "No termination assertion could be obtained for %s",
                  ZOR_SHOWN(bundleIdentifier));
        return nullptr;
    }
    if (!acquisition->wait())
        return nullptr;
    return std::unique_ptr<ZORApplicationTerminationAssertion>(
        new ZORApplicationTerminationAssertion(std::move(handle)));
}

ZORApplicationTerminationAssertion::~ZORApplicationTerminationAssertion() {
    if (termAssertion_)
        std::abort(); // nil == _termAssertion
}

} // namespace zor
