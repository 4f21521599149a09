// SPDX-License-Identifier: Apache-2.0
#include "device/FileTerminationAssertionService.h"

#include "ipc/Identifiers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr mode_t placeMode = 0755;
constexpr mode_t assertionMode = 0600;
// A launcher that looks whether there is an assertion has the lock for as long as that takes.
constexpr int lockAttemptsMax = 200;
constexpr std::chrono::milliseconds lockAttemptInterval{5};

Errno lockWithin(int file) {
    for (int attempt = 0; attempt < lockAttemptsMax; ++attempt) {
        if (::flock(file, LOCK_EX | LOCK_NB) == 0)
            return Errno();
        if (errno != EINTR && errno != EWOULDBLOCK)
            return Errno::last();
        std::this_thread::sleep_for(lockAttemptInterval);
    }
    return Errno(EWOULDBLOCK);
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
    const std::string name = ipc::percentEncode(bundleIdentifier);
    if (name.empty() || name.size() > ipc::componentBytesMax)
        return nullptr;
    std::string identifier(bundleIdentifier);
    const Errno failure = hold(identifier, reason);
    auto assertion = std::make_unique<FileAssertion>(failure ? nullptr : this, std::move(identifier));
    handler(failure ? std::optional<std::string>(failure.text()) : std::nullopt);
    return assertion;
}

std::vector<std::string> FileTerminationAssertionService::held() const {
    const MutexLock lock(mutex_);
    std::vector<std::string> identifiers;
    for (const auto& [identifier, held] : held_)
        identifiers.push_back(identifier);
    return identifiers;
}

Errno FileTerminationAssertionService::hold(const std::string& identifier, TerminationReason reason) {
    const MutexLock lock(mutex_);
    const auto found = held_.find(identifier);
    if (found != held_.end()) {
        ++found->second.holders;
        return Errno();
    }
    held_.emplace(identifier, Held{.file = TRY(lockFile(identifier, reason)), .holders = 1});
    return Errno();
}

ErrnoOr<FileDescriptor> FileTerminationAssertionService::openDirectory() {
    const char* const name = names::assertionDirectory;
    const Errno made = disk_.makeDirectory(root_.runtimeDirectory(), name, placeMode);
    if (made && made != EEXIST)
        return made;
    return openBeneath(root_.runtimeDirectory(), name, O_RDONLY | O_DIRECTORY);
}

ErrnoOr<FileDescriptor> FileTerminationAssertionService::lockFile(const std::string& identifier,
                                                                  TerminationReason reason) {
    const std::string name = ipc::percentEncode(identifier);
    const FileDescriptor directory = TRY(openDirectory());
    // A file that an earlier daemon left may be open in a launcher that waits on it; a new file cannot be.
    const Errno removed = disk_.unlinkFile(directory.get(), name.c_str());
    if (removed && removed != ENOENT)
        return removed;
    FileDescriptor file = TRY(disk_.createFile(directory.get(), name.c_str(), assertionMode));
    Errno failure = lockWithin(file.get());
    if (!failure) {
        const std::string text = std::to_string(static_cast<unsigned>(reason));
        failure = disk_.write(file.get(), {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    }
    if (failure) {
        (void)disk_.unlinkFile(directory.get(), name.c_str());
        return failure;
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
        (void)disk_.unlinkFile(directory->get(), ipc::percentEncode(identifier).c_str());
    held_.erase(found);
}

} // namespace zor::platform
