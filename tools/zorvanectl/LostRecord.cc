// SPDX-License-Identifier: Apache-2.0
#include "LostRecord.h"

#include "KnownContainer.h"
#include "device/DataProtection.h"
#include "os/SystemRoot.h"

namespace zorvanectl {

namespace {

using zor::platform::defaultProtectionClass;
using zor::platform::FileDeviceLockState;

bool deviceIsLocked(const std::string& directory) {
    auto root = zor::platform::SystemRoot::open(directory);
    return root && !root->openRuntimeDirectory() &&
           FileDeviceLockState(*root).currentState() == FileDeviceLockState::locked;
}

} // namespace

LostRecord lostRecordOf(zorvane::Client& client, const zorvane::Client::Address& address) {
    LostRecord lost;
    const auto metadata = client.metadata(address);
    for (const auto& [key, value] : metadata ? metadata->info : zorvane::Map()) {
        const auto* number = std::get_if<std::int64_t>(&value.content);
        if (key != zorvane::protectionClassInfoKey())
            lost.infoKeys.push_back(key);
        else if (number && *number != defaultProtectionClass)
            lost.protectionClass = static_cast<std::int32_t>(*number);
    }
    return lost;
}

std::string lostInfoText(const LostRecord& lost) {
    std::string text;
    for (const std::string& key : lost.infoKeys)
        text += (text.empty() ? "" : ", ") + printable(key);
    return text.empty() ? "" : (lost.infoKeys.size() == 1 ? "info value " : "info values ") + text;
}

std::optional<int> refuseToLoseClass(const zorvane::ConnectOptions& connect, const Output& output,
                                     const LostRecord& lost, KeepClass keep, const std::string& what) {
    if (keep == KeepClass::ifPossible || !lost.protectionClass || !deviceIsLocked(connect.root))
        return std::nullopt;
    return output.localError(exitLocalError,
                             "the device is locked, and data-protection class " +
                                 std::to_string(*lost.protectionClass) +
                                 " of the container could not be set again. Nothing was done",
                             "unlock the device first, or leave out --keep-class", what);
}

bool setClassAgain(zorvane::Client& client, const Output& output, const Target& target, const LostRecord& lost) {
    if (!lost.protectionClass)
        return true;
    const auto done = client.setDataProtection({.containerClass = target.containerClass,
                                                .user = userOf(target),
                                                .identifier = target.identifier,
                                                .protectionClass = *lost.protectionClass,
                                                .thirdParty = false,
                                                .retryIfLocked = false});
    if (!done)
        output.remark(target.identifier + " had data-protection class " + std::to_string(*lost.protectionClass) +
                      ", and has " + std::to_string(defaultProtectionClass) + " now: " + done.error().message +
                      ". 'zorvanectl protect' sets it again");
    return done.has_value();
}

void addLost(nlohmann::json& document, const LostRecord& lost, bool classKept) {
    document["infoLost"] = lost.infoKeys;
    document["classKept"] = classKept;
    document["protectionClass"] = classKept && lost.protectionClass ? *lost.protectionClass : defaultProtectionClass;
}

} // namespace zorvanectl
