// SPDX-License-Identifier: Apache-2.0
#include "upcall/ProcessContainersReply.h"

#include "upcall/packbuff/UpcallMessage.h"

namespace zor {

using namespace upcall;

namespace {

constexpr const char* function = "server_get_process_containers";

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
