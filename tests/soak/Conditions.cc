// SPDX-License-Identifier: Apache-2.0
#include "soak/Conditions.h"

#include <filesystem>
#include <fstream>
#include <unistd.h>

namespace zor::soak {

namespace {

namespace files = std::filesystem;

constexpr const char* lateIdentifier = "org.soak.late";
constexpr const char* lateGroup = "group.org.soak.late";
constexpr const char* twinIdentifier = "org.soak.twin";
constexpr const char* keptName = "kept";

std::string entryOf(const std::string& executable, const std::string& group) {
    return "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>Identifier</key><string>" +
           std::string(twinIdentifier) + "</string><key>Executable</key><string>" + executable +
           "</string><key>Entitlements</key><dict><key>com.veltra.security.application-groups</key><array><string>" +
           group + "</string></array></dict></dict></plist>";
}

std::string twinGroup(bool first) {
    return std::string("group.org.soak.twin.") + (first ? "one" : "two");
}

zorvane::Client::Lookup lateLookup() {
    return {.containerClass = whole::dataApplication, .user = lateUser, .identifier = lateIdentifier, .create = true};
}

} // namespace

Conditions::Conditions(Session& session) : session_(session), home_(session.root() + "/private/var/late") {
    const std::string root = session.root();
    std::ofstream(root + "/etc/passwd", std::ios::app) << "late:x:504:504::/private/var/late:/bin/sh\n";
    files::create_directories(home_);
    if (::geteuid() == 0)
        (void)!::chown(home_.c_str(), lateUser, lateUser);
    files::create_directories(root + "/bin");
    for (const bool first : {true, false}) {
        const std::string program = root + "/bin/" + (first ? "one" : "two");
        files::copy_file(whole::programPath("zorvanectl"), program);
        whole::writeFile(root + "/etc/zorvane/identities.d/" + (first ? "30" : "31") + "-twin.plist",
                         entryOf(program, twinGroup(first)));
    }
}

std::optional<zorvane::Client> Conditions::client() const {
    std::optional<zorvane::Client> client;
    for (int tries = 0; !client && tries < 1000 && !session_.stopped; ++tries)
        session_.connect(client);
    return client;
}

bool Conditions::hold() {
    auto asking = client();
    if (!asking)
        return false;
    const zorvane::List groups{zorvane::Value{std::string(lateGroup)}};
    const auto registered = asking->processEntitlements(
        {.identifier = lateIdentifier,
         .entitlements = zorvane::Map{{"com.veltra.security.application-groups", zorvane::Value{groups}}}});
    const auto made = asking->createOrLookup(lateLookup());
    const auto paths = asking->groupContainerPaths(lateUser, lateIdentifier);
    if (!registered || !made || !paths || !paths->contains(lateGroup)) {
        session_.found("the user with the late home gets no containers: " + (!registered ? registered.error().message
                                                                             : !made     ? made.error().message
                                                                             : !paths    ? paths.error().message
                                                                                         : "no group's"));
        return false;
    }
    container_ = made->path;
    group_ = paths->at(lateGroup);
    whole::writeFile(container_ + "/" + keptName, "container");
    whole::writeFile(group_ + "/" + keptName, "group");
    return true;
}

void Conditions::bootWithoutAHome(const std::function<void()>& restart) {
    if (container_.empty() && !hold())
        return;
    session_.did("device", "home away");
    files::rename(home_, home_ + ".away");
    restart();
    auto asking = client();
    if (asking && asking->createOrLookup(lateLookup()))
        session_.found("a container is served in a home that is away");
    if (files::exists(home_))
        session_.found("the daemon made the home that was away");
    std::error_code error;
    files::rename(home_ + ".away", home_, error);
    if (error)
        session_.found("the home cannot come back: " + error.message());
    asking = client();
    if (!asking)
        return;
    const auto there = asking->createOrLookup(lateLookup());
    const auto paths = asking->groupContainerPaths(lateUser, lateIdentifier);
    if (!there || there->path != container_ || whole::readFile(container_ + "/" + keptName) != "container")
        session_.found("the container of the late home: " + (there ? there->path : there.error().message) + ", was " +
                       container_);
    if (!paths || !paths->contains(lateGroup) || paths->at(lateGroup) != group_ ||
        whole::readFile(group_ + "/" + keptName) != "group")
        session_.found("the group of the late home is not what it was");
}

void Conditions::oneOfTwoSpeaks(bool first) {
    session_.did("device", "one of two programs");
    const auto outcome =
        whole::runProgram({session_.root() + "/bin/" + (first ? "one" : "two"), "--root", session_.root(), "create",
                           twinIdentifier, "--class", "data-app", "--user", std::to_string(whole::mobile)});
    auto asking = client();
    if (!asking)
        return;
    if (outcome.exitStatus != 0)
        session_.found("a program of the registry gets no container: " + outcome.output);
    const auto groups = asking->groupContainerIdentifiers(whole::mobile, twinIdentifier);
    if (!groups || groups->size() != 2)
        session_.found("of the groups of two programs " + (groups ? std::to_string(groups->size()) : "none") +
                       " are registered");
}

} // namespace zor::soak
