// SPDX-License-Identifier: Apache-2.0
// Roles of the platform that are what the test says. Any thread may ask; one thread sets.
#pragma once

#include "platform/Device.h"
#include "platform/Errno.h"

#include <atomic>
#include <functional>
#include <string>

namespace zor::support {

class SettableBuild final : public platform::InternalBuildQuery {
public:
    explicit SettableBuild(bool isInternal = false) : internal(isInternal) {}
    [[nodiscard]] bool isInternalBuild() const override { return internal; }
    std::atomic<bool> internal;
};

class FlagBootMarker final : public platform::BootMarker {
public:
    explicit FlagBootMarker(bool present = false) : state{.present = present, .foreign = false} {}
    [[nodiscard]] State look() const override { return state; }
    Errno make() override {
        if (makeError == 0)
            state = {.present = true, .foreign = false};
        return Errno(makeError);
    }
    void forget() override { state = {}; }
    [[nodiscard]] std::string name() const override { return "marker"; }
    State state;
    int makeError = 0;
};

class SettableLockState final : public platform::DeviceLockState {
public:
    [[nodiscard]] int currentState() const override { return state; }
    Errno registerForChanges(platform::RunLoop&, std::function<void()> changed) override {
        notify = std::move(changed);
        return Errno();
    }
    [[nodiscard]] const char* registrationCallName() const override { return "register"; }
    [[nodiscard]] const char* notificationName() const override { return "lockstate"; }
    std::atomic<int> state{0};
    std::function<void()> notify;
};

} // namespace zor::support
