// SPDX-License-Identifier: Apache-2.0
#include "upcall/ProcessContainers.h"

#include "upcall/packbuff/UpcallMessage.h"

namespace zor {

using namespace upcall;

namespace {

constexpr const char* function = "server_get_process_containers";

const char* nameOf(std::uint16_t valueType) {
    switch (valueType) {
    case CM_KERN_REQUEST_CODE_SIGNATURE_ID:
        return "CM_KERN_REQUEST_CODE_SIGNATURE_ID";
    case CM_KERN_REQUEST_CONTAINER_ID:
        return "CM_KERN_REQUEST_CONTAINER_ID";
    case CM_KERN_REQUEST_APPLICATION_ID:
        return "CM_KERN_REQUEST_APPLICATION_ID";
    case CM_KERN_REQUEST_APP_GROUP_ID:
        return "CM_KERN_REQUEST_APP_GROUP_ID";
    case CM_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        return "CM_KERN_REQUEST_SYSTEM_CONTAINER_ID";
    default:
        return "CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID";
    }
}

/// nullopt, logged, when the item at the cursor is no whole string.
std::optional<std::string> readString(const Log& log, sb_packbuff& packbuff, std::uint16_t valueType) {
    int error = packbuffSuccess;
    std::uint32_t length = 0;
    const char* const string = sb_packbuff_unpack_string(&packbuff, &length, &error);
    if (error != packbuffSuccess) {
        log.write(logLevelError, function, "failed: to unpack string for %s. error: %d", nameOf(valueType), error);
        return std::nullopt;
    }
    return std::string(string, length);
}

ReturnCode readStringItem(const Log& log, sb_packbuff& packbuff, std::uint16_t valueType,
                          ProcessContainersRequest& request) {
    std::optional<std::string> string = readString(log, packbuff, valueType);
    if (!string)
        return ReturnCode::refused;
    switch (valueType) {
    case CM_KERN_REQUEST_CODE_SIGNATURE_ID:
        request.codeSignatureIdentifier = std::move(string);
        break;
    case CM_KERN_REQUEST_CONTAINER_ID:
        request.containerIdentifier = std::move(string);
        break;
    case CM_KERN_REQUEST_APP_GROUP_ID:
        request.appGroupIdentifiers.push_back(std::move(*string));
        break;
    case CM_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        request.systemContainerIdentifier = std::move(string);
        break;
    case CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
        request.systemGroupIdentifiers.push_back(std::move(*string));
        break;
    default: // the application's: has to be readable, and is not used
        break;
    }
    return ReturnCode::success;
}

ReturnCode readItem(const Log& log, sb_packbuff& packbuff, std::uint16_t valueType, ProcessContainersRequest& request) {
    switch (valueType) {
    case CM_KERN_REQUEST_CODE_SIGNATURE_ID:
    case CM_KERN_REQUEST_CONTAINER_ID:
    case CM_KERN_REQUEST_APPLICATION_ID:
    case CM_KERN_REQUEST_APP_GROUP_ID:
    case CM_KERN_REQUEST_SYSTEM_CONTAINER_ID:
    case CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
        return readStringItem(log, packbuff, valueType, request);
    case CM_KERN_REQUEST_PERSONA_ID: {
        int error = packbuffSuccess;
        request.personaId = sb_packbuff_unpack_uint32(&packbuff, &error);
        if (error == packbuffSuccess)
            return ReturnCode::success;
        log.write(logLevelError, function, "failed: to unpack uint32 for CM_KERN_REQUEST_PERSONA_ID. error: %d", error);
        return ReturnCode::refused;
    }
    case CM_KERN_REQUEST_CONTAINER_TYPE:
        log.write(logLevelError, function, "CM_KERN_REQUEST_CONTAINER_TYPE is not currently supported!");
        return ReturnCode::unsupportedItem;
    default:
        log.write(logLevelError, function, "unexpected value: %u", valueType);
        return ReturnCode::unsupportedItem;
    }
}

} // namespace

ReturnCode readProcessContainersRequest(const Log& log, sb_packbuff& packbuff, ProcessContainersRequest& request) {
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(&packbuff, &valueType) != 0) {
        if (const ReturnCode code = readItem(log, packbuff, valueType, request); code != ReturnCode::success)
            return code;
    }
    if (sb_packbuff_is_at_end(&packbuff))
        return ReturnCode::success;
    // Less than an item is left: what was to come is not known.
    log.write(logLevelError, function, "failed: to find the end of the request. error: %d", packbuffOutOfRange);
    return ReturnCode::refused;
}

namespace {

class ReplyPacker {
public:
    ReplyPacker(const Log& log, sb_packbuff& packbuff, bool success)
        : log_(log), packbuff_(packbuff), success_(success) {}

    void path(std::uint16_t valueType, const std::optional<std::string>& path) {
        if (!success_ || !path)
            return;
        const auto length = static_cast<std::uint32_t>(path->size());
        const int error = sb_packbuff_pack_string(&packbuff_, valueType, path->c_str(), length);
        if (error == packbuffSuccess)
            return;
        success_ = false;
        log_.write(logLevelError, function, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s", error, valueType,
                   path->c_str());
    }

    /// `what` is what the line about a failure calls such a container.
    void groups(std::uint16_t keyType, std::uint16_t valueType, const char* what,
                const std::optional<std::map<std::string, std::string>>& groups) {
        if (!success_ || !groups)
            return;
        for (const auto& [identifier, container] : *groups) {
            const int error = sb_packbuff_pack_key_with_string_value(&packbuff_, keyType, identifier.c_str(), valueType,
                                                                     container.c_str());
            if (error == packbuffSuccess)
                continue;
            success_ = false;
            log_.write(logLevelError, function,
                       "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, %s: %s", error,
                       ZOR_SHOWN(identifier), what, container.c_str());
            return;
        }
    }

    void status() {
        const std::uint32_t value = success_ ? 1 : 0;
        const int error = sb_packbuff_pack_uint32(&packbuff_, CM_KERN_REPLY_STATUS, value);
        if (error != packbuffSuccess)
            log_.write(logLevelError, function, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u", error,
                       CM_KERN_REPLY_STATUS, value);
    }

private:
    const Log& log_;
    sb_packbuff& packbuff_;
    bool success_;
};

} // namespace

void packProcessContainersReply(const Log& log, sb_packbuff& packbuff, const ProcessContainers& containers,
                                bool success) {
    ReplyPacker packer(log, packbuff, success);
    packer.path(CM_KERN_REPLY_HOME_DIR_PATH, containers.homeDirectory);
    packer.path(CM_KERN_REPLY_DATA_CONTAINER_PATH, containers.dataContainer);
    packer.path(CM_KERN_REPLY_TEMP_DIR_PATH, containers.temporaryDirectory);
    packer.groups(CM_KERN_REPLY_APP_GROUP_ID, CM_KERN_REPLY_APP_GROUP_PATH, "group container", containers.appGroups);
    packer.path(CM_KERN_REPLY_SYSTEM_CONTAINER_PATH, containers.systemContainer);
    packer.groups(CM_KERN_REPLY_SYSTEM_GROUP_ID, CM_KERN_REPLY_SYSTEM_GROUP_PATH, "system group container",
                  containers.systemGroups);
    packer.status();
}

} // namespace zor
