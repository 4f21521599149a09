// SPDX-License-Identifier: Apache-2.0
#include "store/ZORMetadata.h"

#include "fs/Durability.h"
#include "fs/PathResolver.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "plist/Codec.h"
#include "store/StorePlaces.h"

#include <bit>
#include <cerrno>
#include <cmath>
#include <fcntl.h>
#include <limits>

namespace zor {

namespace {

// Keys of the file.
constexpr std::string_view contentClassKey = "ZORMetadataContentClass"; // integer
constexpr std::string_view personaKey = "ZORMetadataPersona";           // integer; may be missing
constexpr std::string_view identifierKey = "ZORMetadataIdentifier";     // string
constexpr std::string_view uuidKey = "ZORMetadataUUID";                 // string
constexpr std::string_view infoKey = "ZORMetadataInfo";                 // dictionary; may be missing

std::unexpected<MetadataRefusal> refusal(MetadataRule rule, ErrorCode code, int line, std::string description,
                                         std::shared_ptr<const ZORError> cause = nullptr) {
    return std::unexpected(MetadataRefusal{rule,
                                           {Here{"readAndValidateMetadataAtUrl", line}, ErrorDomain::zor,
                                            static_cast<int>(code), std::move(description), std::move(cause)}});
}

/// The 64 bits of an integer of either sign, as the file's readers take it.
std::optional<std::uint64_t> integerBits(const plist::Value& value) {
    if (const auto number = value.asUnsigned())
        return number;
    if (const auto number = value.asSigned())
        return static_cast<std::uint64_t>(*number);
    return std::nullopt;
}

std::string_view withoutLastComponent(std::string_view path) {
    return path.substr(0, path.rfind('/'));
}

} // namespace

#define ZOR_REFUSE(rule, ...)                                                                                          \
    return refusal(MetadataRule::rule, ErrorCode::metadataInvalid, __LINE__, formatted(__VA_ARGS__))

std::optional<int> ZORMetadata::recordedProtectionClass() const {
    const plist::Value* value = info_ ? info_->find(ipc::infoKeys::contentProtectionClass) : nullptr;
    if (!value)
        return std::nullopt;
    if (const double* real = value->asReal(); real && std::abs(*real) <= std::numeric_limits<int>::max())
        return static_cast<int>(*real);
    const auto number = value->asSigned();
    return number ? std::optional(static_cast<int>(*number)) : std::nullopt;
}

plist::Dictionary ZORMetadata::fileContent() const {
    plist::Dictionary content{
        {std::string(contentClassKey), static_cast<std::uint64_t>(containerClass_)},
        {std::string(personaKey), uid_},
        {std::string(identifierKey), identifier_},
        {std::string(uuidKey), uuid().string()},
    };
    if (info_)
        content.set(infoKey, *info_);
    return content;
}

Result<void> ZORMetadata::writeMetadataToDiskWithError(const Log& log, ZORFileManager& fileManager) const {
    const FileURL container = url();
    const auto written = writeToURL(fileContent(), container.appendingFile(names::metadataFile),
                                    writeAtomically | writeWithoutProtection, fs::metadataFileBytesMax, fileManager);
    if (!written)
        return Reporter(log, __func__)
            .error(ErrorCode::propertyListNotWritten, &written.error(), "Failed to write metadata dictionary to URL %s",
                   container.c_str());
    return {};
}

std::expected<std::shared_ptr<ZORMetadata>, MetadataRefusal> parseMetadata(std::span<const std::uint8_t> bytes,
                                                                           const ContainerPlace& place,
                                                                           std::uint32_t userId,
                                                                           CheckClassPath checkClassPath) {
    const auto value = plist::readPropertyList(bytes);
    const plist::Dictionary* content = value ? value->asDictionary() : nullptr;
    if (!content)
        return refusal(MetadataRule::readable, ErrorCode::metadataUnreadable, __LINE__,
                       formatted("Failed to read metadata at URL %s", place.url().c_str()));
    const plist::Value* persona = content->find(personaKey);
    if (persona) {
        const auto stored = integerBits(*persona);
        if (!stored || static_cast<std::uint32_t>(*stored) != userId)
            ZOR_REFUSE(user, "Incorrect UserId: %s, expecting: %u at %s", plist::describe(persona).c_str(), userId,
                       place.url().c_str());
    }
    const std::string* identifier = content->string(identifierKey);
    if (!identifier || !ipc::isIdentifier(*identifier))
        ZOR_REFUSE(identifier, "Invalid metadata Identifier: %s at %s",
                   plist::describe(content->find(identifierKey)).c_str(), place.url().c_str());
    const std::string* uuidString = content->string(uuidKey);
    if (!uuidString)
        ZOR_REFUSE(uuid, "Invalid metadata UUID String: %s at %s", plist::describe(content->find(uuidKey)).c_str(),
                   place.url().c_str());
    const auto uuid = UUID::parse(*uuidString);
    if (!uuid)
        ZOR_REFUSE(uuid, "Invalid metadata UUID: %s at %s", ZOR_SHOWN(*uuidString), place.url().c_str());
    const plist::Value* classValue = content->find(contentClassKey);
    const auto classNumber = classValue ? integerBits(*classValue) : std::nullopt;
    if (!classNumber)
        ZOR_REFUSE(containerClass, "Invalid metadata Class: %s at %s", plist::describe(classValue).c_str(),
                   place.url().c_str());
    if (!ipc::isContainerClass(*classNumber))
        ZOR_REFUSE(containerClass, "Invalid metadata Content Class: %ld at %s", static_cast<long>(*classNumber),
                   place.url().c_str());
    const auto containerClass = static_cast<ContainerClass>(*classNumber);
    const plist::Value* info = content->find(infoKey);
    if (info && !info->asDictionary())
        ZOR_REFUSE(info, "Invalid metadata Info: %s at %s", plist::describe(info).c_str(), place.url().c_str());
    if (checkClassPath == CheckClassPath::yes) {
        // The class directory is named by two components; a record proves that it lies in the one of its own class.
        const std::string_view base = withoutLastComponent(withoutLastComponent(place.parentPath()));
        const std::string expected = std::string(base) + "/" + className(containerClass);
        if (expected != place.parentPath())
            ZOR_REFUSE(place, "Invalid metadata-URLs should match: %s : %s", place.url().c_str(), expected.c_str());
    }
    return std::make_shared<ZORMetadata>(
        userId, *uuid, containerClass, *identifier,
        info ? std::make_shared<const plist::Dictionary>(*info->asDictionary()) : nullptr, place);
}

MetadataReader::MetadataReader(platform::Disk& disk, int directory, std::string directoryPath, std::uint32_t userId,
                               CheckClassPath checkClassPath, std::optional<uid_t> formerOwner)
    : disk_(disk), directory_(directory), parent_(std::make_shared<const ContainerParent>(std::move(directoryPath))),
      userId_(userId), checkClassPath_(checkClassPath), formerOwner_(formerOwner) {}

Result<std::shared_ptr<ZORMetadata>> MetadataReader::read(const char* name) const {
    auto judged = judge(name);
    if (!judged)
        return std::move(judged).error().error;
    return std::move(*judged);
}

std::expected<std::shared_ptr<ZORMetadata>, MetadataRefusal> MetadataReader::judge(const char* name) const {
    const ContainerPlace place(parent_, name);
    const std::string relative = std::string(name) + "/" + names::metadataFile;
    const auto bytes = fs::readOwnedFile(disk_, directory_, relative.c_str(), fs::metadataFileBytesMax, formerOwner_);
    if (!bytes) {
        const bool hidden = bytes.error() == ENOENT && fs::hidesNamesBelow(disk_, directory_, name);
        const Errno error = hidden ? Errno(ENOKEY) : bytes.error();
        const ZORError cause = posixError(ZOR_HERE, error, "%s", error.text());
        return refusal(MetadataRule::readable, ErrorCode::metadataUnreadable, __LINE__,
                       formatted("Failed to read metadata at URL %s", place.url().c_str()),
                       std::make_shared<const ZORError>(cause));
    }
    return parseMetadata(*bytes, place, userId_, checkClassPath_);
}

Result<std::shared_ptr<ZORMetadata>> readAndValidateMetadataAtUrl(const Log& log, ZORFileManager& fileManager,
                                                                  const FileURL& url, std::uint32_t userId,
                                                                  CheckClassPath checkClassPath,
                                                                  std::optional<uid_t> formerOwner) {
    const FileURL parent = url.deletingLastPathComponent();
    const auto directory = fileManager.resolver().openDirectoryPath(parent);
    // Without its directory, the read below says what is wrong with the container.
    const MetadataReader reader(fileManager.disk(), directory ? directory->get() : -1, parent.path(), userId,
                                checkClassPath, formerOwner);
    auto record = reader.read(std::string(url.lastPathComponent()).c_str());
    if (!record)
        logError(log, record.error());
    return record;
}

} // namespace zor
