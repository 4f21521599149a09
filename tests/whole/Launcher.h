// SPDX-License-Identifier: Apache-2.0
// A daemon and zorvane-run, as a service manager calls it. A test that makes sandboxes needs root, and a kernel that
// allows namespaces here.
#pragma once

#include "process/DaemonProcess.h"
#include "support/Waiting.h"
#include "whole/Expect.h"

#include <filesystem>
#include <string>
#include <vector>

namespace zor::whole {

namespace files = std::filesystem;
using Words = std::vector<std::string>;
using support::eventually;

inline Words operator+(Words words, const Words& more) {
    words.insert(words.end(), more.begin(), more.end());
    return words;
}

inline const std::string notes = "org.example.notes";
inline const std::string maps = "org.example.maps";

/// Why no sandbox can be made here; empty when one can.
inline std::string whyNoSandbox() {
    if (::geteuid() != 0)
        return "needs root: becomes other users";
    if (!files::exists("/usr/bin/bwrap"))
        return "needs bubblewrap";
    const auto probe = runProgram({"/usr/bin/bwrap", "--unshare-pid", "--unshare-ipc", "--unshare-uts", "--ro-bind",
                                   "/", "/", "--proc", "/proc", "--dev", "/dev", "true"});
    return probe.exitStatus == 0 ? "" : "no namespaces here: " + probe.output;
}

#define ZOR_NEEDS_SANDBOX()                                                                                            \
    if (const std::string why = whyNoSandbox(); !why.empty())                                                          \
    GTEST_SKIP() << why

/// A daemon that knows the launcher, and two identifiers of user 501 that share a group.
class Launcher {
public:
    static constexpr const char* agent = "<key>KernelAgent</key><true/><key>Entitlements</key><dict/>";

    explicit Launcher(const std::string& entry = agent) {
        // A folder that every user can reach, whatever the checkout lies in.
        files::copy_file(programPath("zorvane-run"), program);
        daemon.registerProgram("30-run", program, entry);
        daemon.start();
        for (const std::string& identifier : {notes, maps})
            setGroups(identifier, {"group.shared"});
    }

    void setGroups(const std::string& identifier, const Words& groups, bool systemContainer = false) {
        zorvane::List list;
        for (const std::string& group : groups)
            list.push_back({group});
        zorvane::Map entitlements = {{"com.veltra.security.application-groups", {std::move(list)}}};
        if (systemContainer)
            entitlements["com.veltra.security.system-container"] = {true};
        ASSERT_TRUE(daemon.client().processEntitlements({.identifier = identifier, .entitlements = entitlements}));
    }
    [[nodiscard]] std::string data(const std::string& identifier, std::uint32_t user = 501) const {
        auto lookup = dataContainer(identifier);
        lookup.user = user;
        return daemon.client().createOrLookup(lookup).value().path;
    }
    [[nodiscard]] std::string group(const std::string& identifier, const std::string& group) const {
        return daemon.client().groupContainerPaths(501, identifier).value()[group];
    }
    [[nodiscard]] Words words(const std::string& identifier, const Words& more) const {
        return Words{program, "--root", daemon.root(), "--identifier", identifier, "--user", "501"} + more;
    }
    [[nodiscard]] Outcome run(const std::string& identifier, const Words& more) const {
        return runProgram(words(identifier, more));
    }
    [[nodiscard]] Outcome shell(const std::string& identifier, const std::string& script) const {
        return run(identifier, {"--", "sh", "-c", script});
    }

    DaemonProcess daemon;
    const std::string program = daemon.path("zorvane-run");
};

} // namespace zor::whole
