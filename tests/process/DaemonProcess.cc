// SPDX-License-Identifier: Apache-2.0
#include "process/DaemonProcess.h"

#include "device/DeviceQueries.h"
#include "os/SystemRoot.h"
#include "support/TestRoot.h"

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <thread>
#include <unistd.h>

namespace zor::whole {

namespace {

constexpr const char* everyPower =
    "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/></dict>";

} // namespace

zorvane::Client::Lookup dataContainer(const std::string& identifier, bool transient) {
    return {.containerClass = dataApplication,
            .user = mobile,
            .identifier = identifier,
            .create = true,
            .transient = transient};
}

std::vector<std::string> toolWords(const std::string& root, const std::vector<std::string>& words) {
    std::vector<std::string> all = {programPath("zorvanectl"), "--root", root};
    all.insert(all.end(), words.begin(), words.end());
    return all;
}

DaemonProcess::DaemonProcess(Syncs syncs, const std::string& parent) : directory_(parent), syncs_(syncs) {
    support::furnish(root());
    registerProgram("10-tests", ownProgram(), everyPower);
    registerProgram("20-ctl", programPath("zorvanectl"), everyPower);
}

DaemonProcess::~DaemonProcess() {
    daemon_.reset();
    // The marker of this root is a semaphore that would outlive it.
    if (const auto opened = platform::SystemRoot::open(root()))
        platform::SemaphoreBootMarker(*opened).forget();
}

void DaemonProcess::registerProgram(const std::string& fileName, const std::string& executable,
                                    const std::string& entry, const std::string& identifier) const {
    writeFile(path("etc/zorvane/identities.d/" + fileName + ".plist"),
              "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>Identifier</key><string>" +
                  (identifier.empty() ? "org.example." + fileName : identifier) +
                  "</string><key>Executable</key><string>" + executable + "</string>" + entry + "</dict></plist>");
}

void DaemonProcess::start(const std::vector<std::string>& moreArguments, const std::function<bool()>& prepare) {
    std::vector<std::string> words = {programPath("zorvaned"), "--root", root()};
    words.insert(words.end(), moreArguments.begin(), moreArguments.end());
    if (syncs_ == Syncs::off)
        ::setenv("ZORVANE_DURABILITY", "none", 1);
    else
        ::unsetenv("ZORVANE_DURABILITY");
    daemon_.emplace(words, [&] { return (!prepare || prepare()) && fences_.enter(); });
    for (int tries = 0; tries < 3000 && running(); ++tries) {
        if (zorvane::Client::connect(connection()))
            return;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    std::fprintf(stderr, "the daemon does not serve:\n%s\n", log().c_str());
    std::abort();
}

int DaemonProcess::end(int signal) {
    daemon_->signal(signal);
    const int exitStatus = daemon_->wait();
    said_ += daemon_->said();
    daemon_.reset();
    return exitStatus;
}

void DaemonProcess::kill() {
    (void)end(SIGKILL);
}

int DaemonProcess::terminate() {
    return end(SIGTERM);
}

zorvane::Client DaemonProcess::client() const {
    auto connected = zorvane::Client::connect(connection());
    if (!connected) {
        std::fprintf(stderr, "no client: %s\n", connected.error().message.c_str());
        std::abort();
    }
    return std::move(*connected);
}

std::int64_t DaemonProcess::counter(const std::string& name) const {
    const auto answer = zorvane::status(connection());
    if (!answer)
        return -1;
    const auto& counters = std::get<zorvane::Map>(std::get<zorvane::Map>(answer->content).at("Counters").content);
    return std::get<std::int64_t>(counters.at(name).content);
}

std::size_t DaemonProcess::descriptors() const {
    const std::filesystem::directory_iterator entries("/proc/" + std::to_string(pid()) + "/fd");
    return static_cast<std::size_t>(std::distance(entries, {}));
}

std::string DaemonProcess::log() const {
    return readFile(path("private/var/root/Library/Logs/Zorvane/zorvaned.log")) + said_ +
           (daemon_ ? daemon_->said() : "");
}

} // namespace zor::whole
