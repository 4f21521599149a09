// SPDX-License-Identifier: Apache-2.0
#include "device/FileTerminationAssertionService.h"

#include "base/Format.h"
#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr mode_t directoryMode = 0755;
constexpr mode_t fileMode = 0600;
// A launcher that looks whether there is an assertion has the lock for as long as that takes.
constexpr int lockAttemptsMax = 200;
constexpr std::chrono::milliseconds lockAttemptInterval{5};

/// 0 or an errno.
int lockWithin(int file) {
    for (int attempt = 0; attempt < lockAttemptsMax; ++attempt) {
        if (::flock(file, LOCK_EX | LOCK_NB) == 0)
            return 0;
        if (errno != EINTR && errno != EWOULDBLOCK)
            return errno;
        std::this_thread::sleep_for(lockAttemptInterval);
    }
    return EWOULDBLOCK;
}

} // namespace

class FileTerminationAssertionService::FileAssertion final : public Assertion {
public:
    /// `service` nullptr: the assertion was refused, and there is nothing to give back.
    FileAssertion(FileTerminationAssertionService* service, std::string identifier)
        : service_(service), identifier_(std::move(identifier)) {}
    FileAssertion(const FileAssertion&) = delete;
    FileAssertion& operator=(const FileAssertion&) = delete;
    ~FileAssertion() override {
        if (service_)
            service_->release(identifier_);
    }

private:
    FileTerminationAssertionService* const service_;
    const std::string identifier_;
};

std::unique_ptr<TerminationAssertionService::Assertion>
FileTerminationAssertionService::acquire(std::string_view bundleIdentifier, TerminationReason reason,
                                         AcquisitionHandler handler) {
    const std::string name = percentEncode(bundleIdentifier);
    if (name.empty() || name.size() > componentBytesMax)
        return nullptr;
    std::string identifier(bundleIdentifier);
    const int failure = hold(identifier, reason);
    auto assertion = std::make_unique<FileAssertion>(failure == 0 ? this : nullptr, std::move(identifier));
    handler(failure == 0 ? std::nullopt : std::optional<std::string>(::strerrordesc_np(failure)));
    return assertion;
}

std::vector<std::string> FileTerminationAssertionService::held() const {
    const MutexLock lock(mutex_);
    std::vector<std::string> identifiers;
    for (const auto& [identifier, held] : held_)
        identifiers.push_back(identifier);
    return identifiers;
}

int FileTerminationAssertionService::hold(const std::string& identifier, TerminationReason reason) {
    const MutexLock lock(mutex_);
    const auto found = held_.find(identifier);
    if (found != held_.end()) {
        ++found->second.holders;
        return 0;
    }
    auto file = lockFile(identifier, reason);
    if (!file)
        return file.error();
    held_.emplace(identifier, Held{.file = std::move(*file), .holders = 1});
    return 0;
}

std::expected<FileDescriptor, int> FileTerminationAssertionService::openDirectory() {
    const char* const name = names::assertionDirectory;
    const int made = disk_.makeDirectory(root_.runtimeDirectory(), name, directoryMode);
    if (made < 0 && made != -EEXIST)
        return std::unexpected(-made);
    return openBeneath(root_.runtimeDirectory(), name, O_RDONLY | O_DIRECTORY);
}

std::expected<FileDescriptor, int> FileTerminationAssertionService::lockFile(const std::string& identifier,
                                                                             TerminationReason reason) {
    const std::string name = percentEncode(identifier);
    const auto directory = openDirectory();
    if (!directory)
        return std::unexpected(directory.error());
    // A file that an earlier daemon left may be open in a launcher that waits on it; a new file cannot be.
    const int removed = disk_.unlinkFile(directory->get(), name.c_str());
    if (removed < 0 && removed != -ENOENT)
        return std::unexpected(-removed);
    const int created = disk_.createFile(directory->get(), name.c_str(), fileMode);
    if (created < 0)
        return std::unexpected(-created);
    FileDescriptor file(created);
    int failure = lockWithin(file.get());
    if (failure == 0) {
        const std::string text = std::to_string(static_cast<unsigned>(reason));
        failure = -disk_.write(file.get(), {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    }
    if (failure != 0) {
        (void)disk_.unlinkFile(directory->get(), name.c_str());
        return std::unexpected(failure);
    }
    return file;
}

void FileTerminationAssertionService::release(const std::string& identifier) {
    const MutexLock lock(mutex_);
    const auto found = held_.find(identifier);
    if (found == held_.end() || --found->second.holders > 0)
        return;
    // The name goes before the lock: who gets the lock of a file without a name looks again.
    if (const auto directory = openDirectory())
        (void)disk_.unlinkFile(directory->get(), percentEncode(identifier).c_str());
    held_.erase(found);
}

} // namespace zor::platform
