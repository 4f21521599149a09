// SPDX-License-Identifier: Apache-2.0
#include "store/ClassDirectoryReader.h"

#include "fs/BulkDirectoryRead.h"

#include <atomic>
#include <exception>
#include <map>
#include <system_error>
#include <thread>

namespace zor {

namespace {

/// Below this many entries a second thread costs more than it brings.
constexpr std::size_t entriesForTwoThreads = 256;
/// Entries that one thread takes at a time.
constexpr std::size_t stretchEntries = 32;

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

/// What the threads share: the next stretch, and a place for each entry's outcome.
class SharedReading {
public:
    SharedReading(const MetadataReader& reader, const Names& names) : reader_(reader), names_(names) {
        records.resize(names.starts.size());
    }

    void work(std::map<std::size_t, ZORError>& errors) {
        const std::size_t count = records.size();
        for (;;) {
            const std::size_t begin = next_.fetch_add(stretchEntries);
            if (begin >= count)
                return;
            for (std::size_t i = begin; i < std::min(begin + stretchEntries, count); ++i) {
                auto record = reader_.read(names_.at(i));
                if (record)
                    records[i] = std::move(*record);
                else
                    errors.emplace(i, std::move(record).error());
            }
        }
    }

    std::vector<std::shared_ptr<ZORMetadata>> records;

private:
    const MetadataReader& reader_;
    const Names& names_;
    std::atomic<std::size_t> next_{0};
};

/// Reads everything, with a second thread where that pays. An exception of either thread comes out here.
void readAll(SharedReading& reading, std::map<std::size_t, ZORError>& errors) {
    std::map<std::size_t, ZORError> otherErrors;
    std::exception_ptr otherException;
    std::thread other;
    if (reading.records.size() >= entriesForTwoThreads) {
        try {
            other = std::thread([&] {
                try {
                    reading.work(otherErrors);
                } catch (...) {
                    otherException = std::current_exception();
                }
            });
        } catch (const std::system_error&) {
            other = std::thread(); // none to be had: this one reads alone
        }
    }
    std::exception_ptr ownException;
    try {
        reading.work(errors);
    } catch (...) {
        ownException = std::current_exception();
    }
    if (other.joinable())
        other.join();
    if (ownException || otherException)
        std::rethrow_exception(ownException ? ownException : otherException);
    errors.merge(otherErrors);
}

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
    SharedReading reading(reader, names);
    std::map<std::size_t, ZORError> errors;
    readAll(reading, errors);
    for (const auto& [index, error] : errors) {
        logError(log_, error);
        // What this process could not look at may be a container. Taken for none, it would get a double.
        if (const ZORError* cause = error.underlying(); cause && cause->isOwnShortage())
            return failed(cause->code());
    }
    for (auto& record : reading.records)
        if (record)
            found(std::move(record));
    return {};
}

} // namespace zor
