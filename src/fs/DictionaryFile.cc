// SPDX-License-Identifier: Apache-2.0
#include "fs/DictionaryFile.h"

#include "fs/AtomicFile.h"
#include "os/Openat2.h"
#include "plist/Binary.h"
#include "plist/Read.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace zor {

Result<plist::Data> serialisedFor(const FileURL& url, const plist::Dictionary& dictionary, std::size_t bytesMax) {
    plist::Data bytes;
    if (const auto done = plist::appendBinary(dictionary, bytes); !done)
        return posixError(ZOR_HERE, Errno(EINVAL), "serialisation for %s failed: %s", url.c_str(), done.error().reason);
    if (bytes.size() > bytesMax)
        return posixError(ZOR_HERE, Errno(EFBIG),
                          "write of %s failed: %zu bytes are more than the %zu that it may have", url.c_str(),
                          bytes.size(), bytesMax);
    return bytes;
}

Result<void> writeToURL(const plist::Dictionary& dictionary, const FileURL& url, std::uint32_t options,
                        std::size_t bytesMax, ZORFileManager& fileManager) {
    if (options != (writeAtomically | writeWithoutProtection))
        return posixError(ZOR_HERE, Errno(EINVAL), "write of %s failed: options 0x%x are not offered", url.c_str(),
                          options);
    const plist::Data bytes = TRY(serialisedFor(url, dictionary, bytesMax));
    const auto parent = fileManager.resolver().openParent(url);
    const Errno error =
        parent ? fs::replaceFileDurably(
                     fileManager.disk(), parent->directory.get(), parent->name, 0644, bytes,
                     [&](int file) { return fileManager.setClassAtCreation(file, classWithoutProtection); })
               : parent.error();
    if (error)
        return posixError(ZOR_HERE, error, "write of %s failed: %s", url.c_str(), error.text());
    return {};
}

Result<plist::Dictionary> readDictionaryAtURL(const FileURL& url, std::size_t bytesMax, ZORFileManager& fileManager) {
    const auto parent = fileManager.resolver().openParent(url);
    const auto bytes =
        parent ? fs::readOwnedFile(fileManager.disk(), parent->directory.get(), parent->name.c_str(), bytesMax)
               : parent.error();
    if (!bytes)
        return posixError(ZOR_HERE, bytes.error(), "read of %s failed: %s", url.c_str(), bytes.error().text());
    auto value = plist::readPropertyList(*bytes);
    if (!value)
        return posixError(ZOR_HERE, Errno(EINVAL), "read of %s failed: %s", url.c_str(), value.error().text().c_str());
    plist::Dictionary* dictionary = value->asMutableDictionary();
    if (!dictionary)
        return posixError(ZOR_HERE, Errno(EINVAL), "read of %s failed: it is no dictionary", url.c_str());
    return std::move(*dictionary);
}

std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length) {
    return {bytes, length};
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
    return {bytes, std::strlen(bytes)};
}

bool containsDotDotPathComponents(std::string_view path) {
    while (!path.empty()) {
        const auto slash = path.find('/');
        if (path.substr(0, slash) == "..")
            return true;
        if (slash == std::string_view::npos)
            break;
        path.remove_prefix(slash + 1);
    }
    return false;
}

} // namespace zor
