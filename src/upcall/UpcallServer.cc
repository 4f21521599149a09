// SPDX-License-Identifier: Apache-2.0
#include "upcall/UpcallServer.h"

#include "base/ContainerClass.h"
#include "plist/Value.h"
#include "store/StorePlaces.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <cerrno>
#include <new>

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
    const Reporter report(log, function);
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
        report.write(logLevelError, "failed: to unpack uint32 for CM_KERN_REQUEST_PERSONA_ID. error: %d", error);
        return ReturnCode::refused;
    }
    case CM_KERN_REQUEST_CONTAINER_TYPE:
        report.write(logLevelError, "CM_KERN_REQUEST_CONTAINER_TYPE is not currently supported!");
        return ReturnCode::unsupportedItem;
    default:
        report.write(logLevelError, "unexpected value: %u", valueType);
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
        : report_(log, function), packbuff_(packbuff), success_(success) {}

    void path(std::uint16_t valueType, const std::optional<std::string>& path) {
        if (!success_ || !path)
            return;
        const auto length = static_cast<std::uint32_t>(path->size());
        const int error = sb_packbuff_pack_string(&packbuff_, valueType, path->c_str(), length);
        if (error == packbuffSuccess)
            return;
        success_ = false;
        report_.write(logLevelError, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s", error, valueType,
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
            report_.write(logLevelError, "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, %s: %s",
                          error, ZOR_SHOWN(identifier), what, container.c_str());
            return;
        }
    }

    void status() {
        const std::uint32_t value = success_ ? 1 : 0;
        const int error = sb_packbuff_pack_uint32(&packbuff_, CM_KERN_REPLY_STATUS, value);
        if (error != packbuffSuccess)
            report_.write(logLevelError, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u", error,
                          CM_KERN_REPLY_STATUS, value);
    }

private:
    const Reporter report_;
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

using upcall::ReturnCode;

namespace {

constexpr std::uint32_t replyBlockBytes = 4096;
constexpr pid_t kernelPid = 0;
constexpr std::uint32_t rootPersona = 0;

using Groups = std::map<std::string, std::string>;

std::string described(const std::optional<Groups>& groups) {
    if (!groups)
        return "(null)";
    plist::Dictionary dictionary;
    for (const auto& [identifier, path] : *groups)
        dictionary.set(identifier, path);
    const plist::Value value(std::move(dictionary));
    return plist::describe(&value);
}

const char* orNull(const std::optional<std::string>& path) {
    return path ? path->c_str() : "(null)";
}

/// Looks up one container after the other, making what is missing, and keeps whether all could be had.
class Lookups {
public:
    Lookups(const Log& log, Creation& creation) : log_(log), creation_(creation) {}

    /// `failure` is what the line about a failure begins with.
    std::optional<std::string> pathOf(std::uint32_t userId, const std::string& identifier,
                                      ContainerClass containerClass, const char* failure) {
        auto found = creation_.createOrLookupContainerForUser(caller_, userId, &identifier, containerClass,
                                                              {.createIfNecessary = true, .transient = false});
        if (found)
            return std::move(found->path);
        log_.write(logLevelError, function, "%s Failed with error: %llu", failure,
                   static_cast<unsigned long long>(found.error().replyCode()));
        success_ = false;
        return std::nullopt;
    }

    Groups pathsOf(std::uint32_t userId, const std::vector<std::string>& identifiers, ContainerClass containerClass,
                   const char* failure) {
        Groups groups;
        for (const std::string& identifier : identifiers)
            if (auto path = pathOf(userId, identifier, containerClass, failure))
                groups.insert_or_assign(identifier, std::move(*path));
        return groups;
    }

    [[nodiscard]] bool success() const { return success_; }

private:
    const Log& log_;
    Creation& creation_;
    const Caller caller_ = Caller::daemonItself();
    bool success_ = true;
};

} // namespace

UpcallServer::UpcallServer(const Needs& needs, const platform::UpcallPort& port)
    : needs_(needs), log_(needs.log), port_(port) {}

std::vector<std::uint8_t> UpcallServer::answer(const platform::UpcallPacket& packet) {
    std::vector<std::uint8_t> reply;
    try {
        std::optional<Log::ClientScope> provoked;
        if (packet.senderUserId)
            provoked.emplace(*packet.senderUserId);
        demux_server(packet, reply);
    } catch (const std::exception&) {
        // Not even the line or the answer that says so can be made: the packet is dropped.
        reply.clear();
    }
    return reply;
}

void UpcallServer::demux_server(const platform::UpcallPacket& request, std::vector<std::uint8_t>& reply) {
    const std::optional<std::uint32_t> messageId = upcall::messageIdOf(request.bytes);
    if (!messageId)
        return;
    ZOR_LOG(log_, logLevelDebug, "in demux_server(); request->msgh_id: %d", static_cast<std::int32_t>(*messageId));
    const auto buffer = upcall::decodeRequest(request.bytes);
    if (!buffer || !request.senderPid) {
        reply = upcall::encodeErrorReply(*messageId, buffer ? ReturnCode::senderUnknown : buffer.error());
        return;
    }
    ZOR_LOG(log_, logLevelDebug, "handling incomming request for container_manager server");
    std::vector<std::uint8_t> replyBuffer;
    const auto outcome = needs_.boundary.run({function, __LINE__}, [&]() -> Result<ReturnCode> {
        return server_get_process_containers(*buffer, *request.senderPid, replyBuffer);
    });
    const ReturnCode code = outcome ? *outcome : ReturnCode::noBuffer;
    ZOR_LOG(log_, logLevelDebug, "container_manager server returns: %d", static_cast<int>(code));
    reply = code == ReturnCode::success ? upcall::encodeReply(*messageId, replyBuffer)
                                        : upcall::encodeErrorReply(*messageId, code);
}

ReturnCode UpcallServer::server_get_process_containers(upcall::Bytes request, pid_t senderPid,
                                                       std::vector<std::uint8_t>& reply) {
    if (senderPid != kernelPid)
        return ReturnCode::refused;
    ProcessContainersRequest wanted;
    if (const ReturnCode code = readRequest(request, wanted); code != ReturnCode::success)
        return code;
    const PackbuffPointer packbuff(sb_packbuff_new(replyBlockBytes));
    if (!packbuff)
        return ReturnCode::noBuffer;
    ProcessContainers containers;
    const bool success = lookUp(wanted, containers);
    if (success)
        containers.homeDirectory = homeDirectoryOf(wanted.personaId);
    else
        containers = {};
    if (log_.writes(logLevelDebug))
        logContainers(wanted, containers);
    packProcessContainersReply(log_, *packbuff, containers, success);
    copyReply(*packbuff, reply);
    return ReturnCode::success;
}

ReturnCode UpcallServer::readRequest(upcall::Bytes bytes, ProcessContainersRequest& request) const {
    const Reporter report(log_, function);
    std::vector<std::uint8_t> buffer(bytes.begin(), bytes.end());
    if (log_.writes(logLevelDebug))
        report.write(logLevelDebug, "request size: %u (%p)", static_cast<unsigned>(buffer.size()),
                     static_cast<const void*>(buffer.data()));
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    if (!reader) {
        report.write(logLevelError, "sb_packbuff_init() of request data fails");
        return ReturnCode::noBuffer;
    }
    if (log_.writes(logLevelDebug))
        report.write(logLevelDebug, "request packbuff byte address:%p",
                     static_cast<const void*>(sb_packbuff_get_bytes(reader.get())));
    return readProcessContainersRequest(log_, *reader, request);
}

bool UpcallServer::lookUp(const ProcessContainersRequest& request, ProcessContainers& found) {
    Lookups lookups(log_, needs_.creation);
    // Asked before any lock is taken: of a home that does not answer the lookups are then told at once.
    (void)needs_.configuration.homeAnswers(request.personaId);
    if (const std::string* identifier = request.dataContainerIdentifier())
        found.dataContainer = lookups.pathOf(request.personaId, *identifier, ContainerClass::dataApplication,
                                             "createOrLookupContainerForUser:");
    if (request.systemContainerIdentifier)
        found.systemContainer =
            lookups.pathOf(needs_.configuration.users().system, *request.systemContainerIdentifier,
                           ContainerClass::dataSystem, "createOrLookupContainerForUser:(system container)");
    found.appGroups = lookups.pathsOf(request.personaId, request.appGroupIdentifiers, ContainerClass::sharedAppGroup,
                                      "createOrLookupGroupContainersForUser:");
    found.systemGroups =
        lookups.pathsOf(needs_.configuration.users().system, request.systemGroupIdentifiers,
                        ContainerClass::sharedSystemGroup, "createOrLookupContainerForUser:(system group container)");
    if (found.dataContainer)
        found.temporaryDirectory =
            FileURL::directory(*found.dataContainer).appendingDirectory(names::containerTemporary).path();
    return lookups.success();
}

std::optional<std::string> UpcallServer::homeDirectoryOf(std::uint32_t personaId) {
    if (personaId == rootPersona)
        return needs_.fileManager.resolver().root().path(names::rootHome);
    ZORPerUserConfiguration* user = needs_.configuration.getPerUserConfigurationForUserId(personaId);
    const auto home = user ? user->userHomeDirectory() : std::nullopt;
    return home ? std::optional(home->path()) : std::nullopt;
}

void UpcallServer::logContainers(const ProcessContainersRequest& request, const ProcessContainers& containers) const {
    const Reporter report(log_, function);
    const auto line = [&](const char* name, const char* value) { report.write(logLevelDebug, "%s: %s", name, value); };
    report.write(logLevelDebug, "UPCALL-Containers for %s(%u):", ZOR_SHOWN(request.dataContainerIdentifier()),
                 request.personaId);
    line("dataContainerURL", orNull(containers.dataContainer));
    line("tempContainerURL", orNull(containers.temporaryDirectory));
    line("homeDirURL", orNull(containers.homeDirectory));
    line("groupURLs", described(containers.appGroups).c_str());
    line("systemContainerURL", orNull(containers.systemContainer));
    line("systemGroupURLs", described(containers.systemGroups).c_str());
}

void UpcallServer::copyReply(const sb_packbuff& packbuff, std::vector<std::uint8_t>& reply) const {
    const Reporter report(log_, function);
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(&packbuff);
    const std::size_t size = sb_packbuff_get_size(&packbuff);
    int error = upcall::ReplyOffset::buffer + size > port_.replyBytesMax() ? EMSGSIZE : 0;
    if (error == 0) {
        try {
            reply.assign(bytes, bytes + size);
        } catch (const std::bad_alloc&) {
            error = ENOMEM;
        }
    }
    if (error != 0)
        report.write(logLevelError, "copyReply(%p, %lu) fails: %d", static_cast<const void*>(bytes), size, error);
    else if (log_.writes(logLevelDebug))
        report.write(logLevelDebug, "packbuff bytes: %p, reply bytes: %p, reply size: %u",
                     static_cast<const void*>(bytes), static_cast<const void*>(reply.data()),
                     static_cast<unsigned>(size));
}

} // namespace zor
