// SPDX-License-Identifier: Apache-2.0
#include "store/ClassDirectoryReader.h"

#include "fs/BulkDirectoryRead.h"
#include "fs/Stretches.h"
#include "platform/Mutex.h"

#include <map>
#include <vector>

namespace zor {

namespace {

/// The names of a directory in one block of memory, each NUL-terminated.
struct Names {
    std::string bytes;
    std::vector<std::uint32_t> starts;
    void add(const char* name, std::size_t length) {
        starts.push_back(static_cast<std::uint32_t>(bytes.size()));
        bytes.append(name, length + 1);
    }
    [[nodiscard]] const char* at(std::size_t index) const { return bytes.data() + starts[index]; }
};

} // namespace

Result<void> ClassDirectoryReader::forEach(const std::function<void(std::shared_ptr<ZORMetadata>)>& found) {
    const auto failed = [&](int number) {
        return posixError({"urlsForItemsInDirectoryAtURL", __LINE__}, number, "_IterateDirectory for %s returned %s",
                          directory_.c_str(), errorText(number));
    };
    const auto directory = fileManager_.resolver().openDirectory(directory_);
    if (!directory) {
        if (directory.error() != ENOENT)
            log_.write(logLevelError, "_IterateDirectory", "opendir of %s failed: %s", directory_.c_str(),
                       errorText(directory.error()));
        return failed(directory.error());
    }
    Names names;
    fs::BulkDirectoryRead::Buffer buffer;
    fs::BulkDirectoryRead entries(directory->get(), buffer);
    while (const auto* entry = entries.next())
        if (entry->name[0] != '.')
            names.add(entry->name, entry->nameBytes);
    if (entries.error() != 0)
        return failed(entries.error());

    const MetadataReader reader(directory->get(), std::make_shared<const std::string>(directory_.path()), userId_,
                                CheckClassPath::yes);
    std::vector<std::shared_ptr<ZORMetadata>> records(names.starts.size());
    platform::Mutex mutex;
    std::map<std::size_t, ZORError> errors;
    fs::forEachStretch(records.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            auto record = reader.read(names.at(i));
            if (record) {
                records[i] = std::move(*record);
            } else {
                const platform::MutexLock held(mutex);
                errors.emplace(i, std::move(record).error());
            }
        }
    });
    for (const auto& [index, error] : errors) {
        logError(log_, error);
        // What this process could not look at may be a container. Taken for none, it would get a double.
        if (const ZORError* cause = error.underlying(); cause && cause->isOwnShortage())
            return failed(cause->code());
    }
    for (auto& record : records)
        if (record)
            found(std::move(record));
    return {};
}

} // namespace zor
