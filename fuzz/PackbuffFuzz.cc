// SPDX-License-Identifier: Apache-2.0
// Any bytes as a packed buffer and as a packet of the upcall. Nothing outside them is read, whatever a reader does
// next; a request that is accepted reads as the same again when it is packed anew, and so does a reply.
//
// The first byte chooses how the rest is taken, the second which operations a reader does, one after the other.
#include "upcall/UpcallServer.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <algorithm>
#include <cstdlib>
#include <memory>

namespace {

using namespace zor;
using namespace zor::upcall;

void mustHold(bool condition) {
    if (!condition)
        std::abort();
}

class SilentLog final : public platform::PlatformLog {
public:
    bool open(std::string_view, int) override { return true; }
    [[nodiscard]] bool isOpen() const override { return true; }
    [[nodiscard]] int level() const override { return logLevelNotice; }
    void enableDiskLogging(const std::string&, unsigned, std::size_t) override {}
    void write(int, std::string_view, std::string_view message) override { mustHold(!message.empty()); }
    void writeToSystemLog(int, std::string_view) override {}
};

/// A copy of exactly these bytes: the sanitizer sees one byte too many.
struct Copy {
    explicit Copy(Bytes bytes) : size(bytes.size()), data(std::make_unique<std::uint8_t[]>(bytes.size())) {
        std::ranges::copy(bytes, data.get());
    }
    [[nodiscard]] PackbuffPointer reader() const {
        return PackbuffPointer(sb_packbuff_init_with_buffer(data.get(), size, true, packbuffDeallocNone));
    }
    std::size_t size;
    std::unique_ptr<std::uint8_t[]> data;
};

void print(const sb_packbuff* packbuff) {
    static std::FILE* const nowhere = std::fopen("/dev/null", "we");
    sb_packbuff_print(packbuff, nowhere);
}

/// Every byte of what was unpacked is there to be read.
std::uint8_t sum(const void* data, std::size_t length) {
    const auto* const bytes = static_cast<const std::uint8_t*>(data);
    std::uint8_t sum = 0;
    for (std::size_t i = 0; i < length; ++i)
        sum = static_cast<std::uint8_t>(sum + bytes[i]);
    return sum;
}

/// Reads with operations of any kind, those that do not fit the item too, until none goes on.
void readAnyhow(const Copy& copy, std::uint8_t choice) {
    const PackbuffPointer reader = copy.reader();
    mustHold((reader != nullptr) == (copy.size > 0));
    volatile std::uint8_t kept = 0;
    for (int failures = 0; reader && failures < 4; choice = static_cast<std::uint8_t>(choice * 5 + 3)) {
        const std::uint8_t* const before = reader->item;
        std::uint16_t valueType = 0;
        std::uint32_t length = 0;
        int error = packbuffSuccess;
        const char* key = nullptr;
        const char* value = nullptr;
        switch (choice % 5U) {
        case 0:
            (void)sb_packbuff_unpack_uint32(reader.get(), &error);
            break;
        case 1:
            if (const char* string = sb_packbuff_unpack_string(reader.get(), &length, &error)) {
                mustHold(string[length] == '\0');
                kept = sum(string, length);
            }
            break;
        case 2:
            if (const std::uint8_t* data = sb_packbuff_unpack_bytes(reader.get(), &length, &error))
                kept = sum(data, length);
            break;
        case 3:
            error = sb_packbuff_unpack_key_with_string_value(reader.get(), &key, &valueType, &value, &length);
            if (error == packbuffSuccess)
                kept = static_cast<std::uint8_t>(key[0] + value[length]);
            break;
        default:
            print(reader.get());
            error = sb_packbuff_get_item_value_type(reader.get(), &valueType) == 1 ? packbuffInvalidArgument
                                                                                   : packbuffOutOfRange;
            mustHold(!(error == packbuffInvalidArgument && sb_packbuff_is_at_end(reader.get())));
            break;
        }
        mustHold(reader->item >= before && reader->item <= copy.data.get() + copy.size);
        failures = reader->item > before ? 0 : failures + 1;
    }
    (void)kept;
}

void addString(sb_packbuff* packbuff, std::uint16_t valueType, const std::string& text) {
    mustHold(sb_packbuff_pack_string(packbuff, valueType, text.c_str(), static_cast<std::uint32_t>(text.size())) ==
             packbuffSuccess);
}

std::vector<std::uint8_t> packed(const ProcessContainersRequest& request) {
    const PackbuffPointer packbuff(sb_packbuff_new(64));
    if (request.codeSignatureIdentifier)
        addString(packbuff.get(), CM_KERN_REQUEST_CODE_SIGNATURE_ID, *request.codeSignatureIdentifier);
    if (request.containerIdentifier)
        addString(packbuff.get(), CM_KERN_REQUEST_CONTAINER_ID, *request.containerIdentifier);
    mustHold(sb_packbuff_pack_uint32(packbuff.get(), CM_KERN_REQUEST_PERSONA_ID, request.personaId) == packbuffSuccess);
    for (const std::string& group : request.appGroupIdentifiers)
        addString(packbuff.get(), CM_KERN_REQUEST_APP_GROUP_ID, group);
    if (request.systemContainerIdentifier)
        addString(packbuff.get(), CM_KERN_REQUEST_SYSTEM_CONTAINER_ID, *request.systemContainerIdentifier);
    for (const std::string& group : request.systemGroupIdentifiers)
        addString(packbuff.get(), CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, group);
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff.get());
    return {bytes, bytes + sb_packbuff_get_size(packbuff.get())};
}

std::optional<ProcessContainersRequest> requestIn(Bytes bytes) {
    static SilentLog silent;
    static const Log log(silent);
    const Copy copy(bytes);
    const PackbuffPointer reader = copy.reader();
    ProcessContainersRequest request;
    if (!reader)
        return std::nullopt;
    const ReturnCode code = readProcessContainersRequest(log, *reader, request);
    if (code == ReturnCode::success)
        return request;
    mustHold(code == ReturnCode::refused || code == ReturnCode::unsupportedItem);
    return std::nullopt;
}

void takeAsRequest(Bytes bytes) {
    const auto request = requestIn(bytes);
    if (!request)
        return;
    const std::vector<std::uint8_t> again = packed(*request);
    const auto read = requestIn(again);
    mustHold(read && packed(*read) == again);
    mustHold(decodeRequest(encodeRequest(again)).has_value());
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    if (size < 2)
        return 0;
    const Copy rest(Bytes(bytes + 2, size - 2));
    const Bytes input(rest.data.get(), rest.size);
    switch (bytes[0] % 4U) {
    case 0:
        readAnyhow(rest, bytes[1]);
        break;
    case 1:
        takeAsRequest(input);
        break;
    case 2:
        if (const auto buffer = decodeRequest(input)) {
            mustHold(buffer->empty() || buffer->data() + buffer->size() == input.data() + input.size());
            takeAsRequest(*buffer);
        } else {
            mustHold(messageIdOf(input) != processContainersMessageId || buffer.error() != ReturnCode::unknownMessage);
        }
        break;
    default:
        if (const auto reply = decodeReply(input)) {
            const auto again = reply->returnCode == ReturnCode::success
                                   ? encodeReply(processContainersMessageId, reply->buffer)
                                   : encodeErrorReply(processContainersMessageId, reply->returnCode);
            mustHold(std::ranges::equal(again, input));
            readAnyhow(Copy(reply->buffer), bytes[1]);
        }
        break;
    }
    return 0;
}
