// SPDX-License-Identifier: Apache-2.0
// The real daemon as a process of its own, on a root of the test's own, for tests that look at the whole from outside.
#pragma once

#include "process/Program.h"
#include "process/UnitFences.h"
#include "support/FileTree.h"
#include "support/Files.h"
#include "zorvane/Client.h"

namespace zor::whole {

inline constexpr std::uint64_t bundleApplication = 1;
inline constexpr std::uint64_t dataApplication = 2;
inline constexpr std::uint32_t mobile = 501;
inline constexpr const char* metadataFile = ".com.veltra.zorvane.metadata.plist";

/// zorvanectl on a root.
std::vector<std::string> toolWords(const std::string& root, const std::vector<std::string>& words);

/// Makes the root, with users 501 and 502 and a registry entry that gives this test program every power.
class DaemonProcess {
public:
    enum class Syncs { off, on };
    explicit DaemonProcess(Syncs syncs = Syncs::off, const std::string& parent = "/dev/shm");
    ~DaemonProcess();

    /// Starts the daemon behind the fences of its unit, and waits until clients can connect. `prepare` as Program's.
    void start(const std::vector<std::string>& moreArguments = {}, const std::function<bool()>& prepare = {});
    /// SIGKILL, and waits for the end.
    void kill();
    /// SIGTERM; the exit status.
    int terminate();
    [[nodiscard]] std::vector<std::string> toolWords(const std::vector<std::string>& words) const {
        return whole::toolWords(root(), words);
    }
    [[nodiscard]] Outcome tool(const std::vector<std::string>& words) const { return runProgram(toolWords(words)); }
    /// A program of the registry: "<key>…</key>…", beside its identifier and executable.
    void registerProgram(const std::string& fileName, const std::string& executable, const std::string& entry,
                         const std::string& identifier = "") const;

    [[nodiscard]] bool running() const { return daemon_ && daemon_->running(); }
    [[nodiscard]] pid_t pid() const { return daemon_->pid(); }
    [[nodiscard]] std::string root() const { return directory_.path(); }
    [[nodiscard]] std::string path(const std::string& relative) const { return root() + "/" + relative; }
    [[nodiscard]] zorvane::ConnectOptions connection() const { return {.root = root(), .timeoutMilliseconds = 20'000}; }
    /// A connected client; ends the test's process when there is none.
    [[nodiscard]] zorvane::Client client() const;
    /// A number of the status's "Counters".
    [[nodiscard]] std::int64_t counter(const std::string& name) const;
    [[nodiscard]] std::size_t descriptors() const;
    [[nodiscard]] std::string log() const;
    [[nodiscard]] const UnitFences& fences() const { return fences_; }

private:
    int end(int signal);
    support::TemporaryDirectory directory_;
    const Syncs syncs_;
    UnitFences fences_;
    std::optional<Program> daemon_;
    /// The output of earlier daemons.
    std::string said_;
};

/// A data container of user 501's that is made where it is missing.
zorvane::Client::Lookup dataContainer(const std::string& identifier, bool transient = false);

using support::readFile;
using support::writeFile;

} // namespace zor::whole
