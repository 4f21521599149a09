// SPDX-License-Identifier: Apache-2.0
#include "store/ClassDirectoryReader.h"

#include "base/Mutex.h"
#include "fs/BulkDirectoryRead.h"
#include "fs/PathResolver.h"
#include "fs/SharedWork.h"

#include <cerrno>
#include <iterator>
#include <map>
#include <optional>
#include <vector>

namespace zor {

namespace {

/// The number of a directory's entries that are no containers and are told one by one: a user may have filled it with
/// any number.
constexpr std::size_t refusalsSaidMax = 200;

/// The entries that could not be read as containers. Any thread.
class Refusals {
public:
    void add(std::size_t index, ZORError error) {
        const ZORError* const cause = error.underlying();
        const platform::MutexLock held(mutex_);
        ++count_;
        if (cause && cause->isOwnShortage())
            shortage_ = Errno(cause->code());
        isHidden_ = isHidden_ || (cause && cause->isPosix(ENOKEY));
        first_.emplace(index, std::move(error));
        if (first_.size() > refusalsSaidMax)
            first_.erase(std::prev(first_.end()));
    }
    /// In the directory's order.
    void say(const Log& log, const FileURL& directory) {
        const platform::MutexLock held(mutex_);
        for (const auto& [index, error] : first_)
            logError(log, error);
        if (count_ > first_.size())
            log.write(logLevelError, "readAndValidateMetadataAtUrl", "%llu more entries of %s are no containers",
                      static_cast<unsigned long long>(count_ - first_.size()), directory.c_str());
    }
    /// That this process was short of descriptors or memory.
    Errno shortage() {
        const platform::MutexLock held(mutex_);
        return shortage_;
    }
    [[nodiscard]] bool isHidden() {
        const platform::MutexLock held(mutex_);
        return isHidden_;
    }

private:
    platform::Mutex mutex_;
    std::uint64_t count_ ZOR_GUARDED_BY(mutex_) = 0;
    std::map<std::size_t, ZORError> first_ ZOR_GUARDED_BY(mutex_);
    Errno shortage_ ZOR_GUARDED_BY(mutex_);
    bool isHidden_ ZOR_GUARDED_BY(mutex_) = false;
};

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
    const auto failed = [&](Errno error) {
        return posixError({"urlsForItemsInDirectoryAtURL", __LINE__}, error, "_IterateDirectory for %s returned %s",
                          directory_.c_str(), error.text());
    };
    const auto directory = fileManager_.resolver().openDirectory(directory_);
    platform::Disk& disk = fileManager_.disk();
    const bool hidden = directory
                            ? disk.hidesNames(directory->get())
                            : directory.error() == ENOENT && fs::hiddenBy(fileManager_.resolver(), disk, directory_);
    if (!directory || hidden) {
        const Errno error = hidden ? Errno(ENOKEY) : directory.error();
        if (error != ENOENT)
            log_.write(logLevelError, "_IterateDirectory", "opendir of %s failed: %s", directory_.c_str(),
                       error.text());
        return failed(error);
    }
    Names names;
    fs::BulkDirectoryRead::Buffer buffer;
    fs::BulkDirectoryRead entries(directory->get(), buffer);
    while (const auto* entry = entries.next())
        if (entry->name[0] != '.')
            names.add(entry->name, entry->nameBytes);
    if (entries.error())
        return failed(entries.error());

    const MetadataReader reader(disk, directory->get(), std::make_shared<const std::string>(directory_.path()), userId_,
                                CheckClassPath::yes);
    std::vector<std::shared_ptr<ZORMetadata>> records(names.starts.size());
    Refusals refusals;
    fs::forEachStretch(records.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            auto record = reader.read(names.at(i));
            if (record)
                records[i] = std::move(*record);
            else
                refusals.add(i, std::move(record).error());
        }
    });
    refusals.say(log_, directory_);
    metHidden_ = refusals.isHidden();
    // An entry that this process could not look at may be a container. Taken for none, it would get a double.
    if (const Errno shortage = refusals.shortage())
        return failed(shortage);
    for (auto& record : records)
        if (record)
            found(std::move(record));
    return {};
}

} // namespace zor
