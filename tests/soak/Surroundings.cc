// SPDX-License-Identifier: Apache-2.0
#include "soak/Surroundings.h"

#include "soak/HostileOwner.h"
#include "support/HangingFileSystem.h"

#include <chrono>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <sys/resource.h>

namespace zor::soak {

namespace {

namespace files = std::filesystem;

/// Whether a store in use may have the finding: clients take directories away, a kill comes amid a change of the
/// protection class, errors leave what the next start clears.
bool isAllowed(const nlohmann::json& finding) {
    static const std::set<std::string> clearedByItself = {"launch", "boot", "next-write", "none"};
    static const std::set<std::string> codes = {"subdirectory-missing", "subdirectory-attributes", "protection-differs",
                                                "directory-leftover"};
    return finding.value("path", "").starts_with(hostileHome) || codes.contains(finding.value("code", "")) ||
           clearedByItself.contains(finding.at("repair").value("by", ""));
}

} // namespace

Surroundings::Surroundings(Session& session, std::uint64_t seed, bool diskCanBeFilled)
    : session_(session), choices_(seed, 2000), diskCanBeFilled_(diskCanBeFilled) {}

void Surroundings::happen(unsigned pauseMillisecondsMax) {
    sleepMilliseconds(1 + choices_.upTo(pauseMillisecondsMax));
    const auto lot = choices_.upTo(100);
    if (lot < 66)
        kill();
    else if (lot < 77)
        boot();
    else if (lot < 82)
        hang();
    else if (lot < 90)
        lock(!session_.locked);
    else if (lot < 95 && diskCanBeFilled_)
        fillDisk();
    else
        starve();
}

void Surroundings::end() {
    session_.did("device", "kill");
    session_.daemon().kill();
    ++kills_;
}

void Surroundings::kill() {
    if (choices_.oneIn(10)) {
        session_.did("device", "orderly end");
        ++kills_;
        if (const int status = session_.daemon().terminate(); status != 0)
            session_.found("an orderly end gives exit status " + std::to_string(status));
    } else {
        end();
    }
    session_.daemon().start();
    if (choices_.oneIn(4))
        check();
}

void Surroundings::boot() {
    session_.did("device", "boot");
    end();
    ++boots_;
    session_.daemon().start({"--forget-boot"});
    check();
}

void Surroundings::lock(bool locked) {
    const std::unique_lock silence(session_.requests);
    const auto outcome = session_.daemon().tool({"lock-state", locked ? "1" : "0"});
    if (outcome.exitStatus != 0)
        session_.found("lock-state: " + outcome.output);
    session_.locked = locked;
}

void Surroundings::enter(Trouble trouble) {
    const std::unique_lock silence(session_.requests);
    session_.trouble = trouble;
}

void Surroundings::fillDisk() {
    enter(Trouble::diskFull);
    session_.did("device", "full disk");
    const std::string filler = session_.root() + "/filler";
    {
        std::ofstream file(filler, std::ios::binary);
        const std::string block(1 << 16, 'x');
        while (file.write(block.data(), static_cast<std::streamsize>(block.size())).flush()) {
        }
    }
    sleepMilliseconds(100 + choices_.upTo(300));
    if (choices_.oneIn(2)) {
        end();
        ::unlink(filler.c_str());
        session_.daemon().start();
    }
    ::unlink(filler.c_str());
    enter(Trouble::none);
    session_.did("device", "room again");
}

void Surroundings::starve() {
    enter(Trouble::fewDescriptors);
    session_.did("device", "few descriptors");
    const pid_t pid = session_.daemon().pid();
    rlimit before{};
    ::prlimit(pid, RLIMIT_NOFILE, nullptr, &before);
    const rlimit few{session_.daemon().descriptors() + choices_.upTo(4), before.rlim_max};
    ::prlimit(pid, RLIMIT_NOFILE, &few, nullptr);
    sleepMilliseconds(50 + choices_.upTo(200));
    ::prlimit(pid, RLIMIT_NOFILE, &before, nullptr);
    enter(Trouble::none);
    session_.did("device", "descriptors again");
}

void Surroundings::hang() {
    constexpr double endSecondsMax = 8;
    std::string place = session_.root() + "/" + hostileHome;
    const std::lock_guard alone(session_.hostileTree);
    std::error_code error;
    for (auto levels = choices_.upTo(5); levels > 0; --levels) {
        // The home, what leads to its containers, and one of them.
        const files::directory_iterator entries(place, error);
        if (error || entries == files::directory_iterator())
            break;
        place = entries->path();
    }
    const support::HangingFileSystem hanging(place, hostileUser);
    session_.did("device", hanging.mounted() ? "hanging mount" : "no hanging mount");
    sleepMilliseconds(200 + choices_.upTo(800));
    if (!choices_.oneIn(2))
        return;
    const auto begin = std::chrono::steady_clock::now();
    const int status = session_.daemon().terminate();
    const std::chrono::duration<double> time = std::chrono::steady_clock::now() - begin;
    if (status != 0 || time.count() > endSecondsMax)
        session_.found("with a hanging mount at " + place + " an end takes " + std::to_string(time.count()) +
                       " s and gives exit status " + std::to_string(status));
    session_.daemon().start();
}

void Surroundings::settle() {
    if (session_.locked)
        lock(false);
}

void Surroundings::check() {
    const std::unique_lock silence(session_.requests);
    const auto outcome = session_.daemon().tool({"--json", "check"});
    session_.did("device", "check");
    const auto document = nlohmann::json::parse(outcome.output, nullptr, false);
    if (document.is_discarded() || !document.contains("findings")) {
        session_.found("check says: " + outcome.output);
        return;
    }
    for (const auto& finding : document.at("findings"))
        if (!isAllowed(finding))
            session_.found("check finds " + finding.dump());
}

Surroundings::Size Surroundings::size() const {
    std::ifstream file("/proc/" + std::to_string(session_.daemon().pid()) + "/status");
    Size size{.residentKiB = 0, .descriptors = session_.daemon().descriptors()};
    for (std::string line; std::getline(file, line);)
        if (line.starts_with("VmRSS:"))
            size.residentKiB = std::stoul(line.substr(6));
    return size;
}

} // namespace zor::soak
