// SPDX-License-Identifier: Apache-2.0
#include "check/Checks.h"

#include "base/ContainerClass.h"
#include "fs/PathResolver.h"
#include "fs/TreeWalker.h"
#include "os/SystemRoot.h"
#include "store/Configuration.h"
#include "store/EntitlementFile.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <sys/stat.h>

namespace zor::check {

Look::Look(CheckedSystem& system, const CheckOptions& options)
    : system_(system), options_(options), whitelist_(ZORWhitelist::forSystem(system.log(), system.fileManager())) {
    for (std::uint32_t userId = system_.users().first; userId <= system_.users().last; ++userId)
        addUser(userId);
}

void Look::addUser(std::uint32_t userId) {
    const auto entry = system_.passwords().entryForUserId(userId);
    HomeQuestion wayToHome;
    auto home = UserHome::pathOf(system_.passwords(), userId, wayToHome);
    const FileURL looked = entry ? FileURL::directory(home ? home->path() : entry->homeDirectory)
                                 : FileURL::file(system_.root().path(platform::names::passwordFile));
    if (home)
        system_.fileManager().resolver().fence(*home, fs::MountFence::Kind::home);
    struct stat status{};
    const Errno error = home ? system_.fileManager().resolver().status(*home, status) : home.error();
    if (error == ENOENT && entry)
        homeless_.insert(userId);
    if (!error && system_.fileManager().resolver().status(StorePlaces::userBaseDirectory(*home), status) == ENOENT)
        homeless_.insert(userId);
    if (!error)
        users_.push_back({userId, std::move(*home)});
    else if (error != ENOENT)
        addUnexamined(looked, error).user = userId;
}

Finding& Look::add(FindingCode code, const FileURL& url, std::string what, Mender mender) {
    Finding& finding = findings_.emplace_back();
    finding.code = code;
    finding.path = system_.belowRoot(url);
    finding.what = std::move(what);
    finding.mender = mender;
    return finding;
}

Finding& Look::addForPerson(FindingCode code, const FileURL& url, std::string what, std::string command) {
    Finding& finding = add(code, url, std::move(what), Mender::person);
    finding.command = std::move(command);
    return finding;
}

Finding& Look::addUnexamined(const FileURL& url, Errno error) {
    return addForPerson(FindingCode::unexamined, url, std::string("cannot be looked at: ") + error.text(),
                        "ls -ld " + shellQuoted(url.path()));
}

void Look::addWrongShape(const FileURL& url) {
    // The first thing on the way that is no directory is what is wrong; all below it share that.
    const std::string& path = url.path();
    const std::size_t rootBytes = system_.root().isDeviceRoot() ? 0 : system_.root().canonicalPath().size();
    for (std::size_t end = path.find('/', rootBytes + 1);; end = path.find('/', end + 1)) {
        const FileURL prefix = FileURL::directory(path.substr(0, end));
        struct stat status{};
        if (!system_.fileManager().resolver().status(prefix, status) && !S_ISDIR(status.st_mode)) {
            if (misshapen_.insert(prefix.path()).second)
                addForPerson(FindingCode::wrongShape, prefix,
                             S_ISLNK(status.st_mode) ? "is a link where a directory belongs"
                                                     : "is no directory where one belongs",
                             moveAside(prefix));
            return;
        }
        if (end == path.npos)
            return; // it has changed meanwhile
    }
}

bool Look::isHidden(const FileURL& url) {
    ZORFileManager& fileManager = system_.fileManager();
    const auto hider = fs::hiddenBy(fileManager.resolver(), fileManager.disk(), url);
    if (hider && hiding_.insert(hider->path()).second)
        addUnexamined(*hider, Errno(ENOKEY));
    return hider.has_value();
}

std::optional<platform::FileDescriptor> Look::openDirectory(const FileURL& url) {
    auto opened = system_.fileManager().resolver().openDirectory(url);
    if ((opened || opened.error() == ENOENT) && isHidden(url))
        return std::nullopt;
    if (opened)
        return std::move(*opened);
    if (opened.error() == ELOOP || opened.error() == ENOTDIR)
        addWrongShape(url);
    else if (opened.error() != ENOENT)
        addUnexamined(url, opened.error());
    return std::nullopt;
}

void Look::forEachName(int directory, const FileURL& url, const std::function<void(const char*)>& function) {
    const auto buffer = std::make_unique<fs::BulkDirectoryRead::Buffer>();
    fs::BulkDirectoryRead entries(directory, *buffer);
    while (const auto* entry = entries.next())
        function(entry->name);
    if (entries.error())
        addUnexamined(url, entries.error());
}

std::string Look::moveAside(const FileURL& url) const {
    const FileURL parent = url.deletingLastPathComponent();
    const std::string name(url.lastPathComponent());
    const std::string aside =
        system_.root().path(names::rootHome) + "/" + std::string(parent.lastPathComponent()) + "-" + name + ".aside";
    // An item that lies there from before gets a number: -n would move nothing, and call that done.
    return inDirectory(parent.path(), "mv --backup=numbered -T -- " + shellQuoted(name) + " " + shellQuoted(aside));
}

void ReferenceCheck::checkAll() {
    const auto map = readMap();
    if (!map)
        return;
    checkGroups(*map, false);
    checkGroups(*map, true);
    checkSystemContainers(*map);
}

std::optional<plist::Dictionary> ReferenceCheck::readMap() {
    ZORFileManager& fileManager = look_.device().fileManager();
    const FileURL file = look_.device().places().entitlementFile();
    const FileURL aside = look_.device().places().unreadableEntitlementFile();
    const bool lost = !fileManager.itemDoesNotExistAtURL(aside);
    if (lost)
        // No command removes it: that accepts the loss, and what was lost has to be registered before.
        look_.addForPerson(FindingCode::entitlementsAside, aside, "holds entitlements that could not be read",
                           "zorvanectl explain " + std::string(pageOf(FindingCode::entitlementsAside).word));
    auto map = readEntitlementFile(file, fileManager);
    if (!map && map.error().isPosix(ENOENT))
        return lost ? std::nullopt : std::optional(plist::Dictionary());
    if (!map) {
        look_.add(FindingCode::entitlementsUnreadable, file,
                  map.error().isPosix(EPERM) ? "is not the daemon's alone: its owner, its permissions or a second name"
                                             : map.error().description().value_or("cannot be read"),
                  Mender::launch);
        return std::nullopt;
    }
    return lost ? std::nullopt : std::optional(std::move(*map));
}

void ReferenceCheck::checkGroups(const plist::Dictionary& map, bool system) {
    const ContainerClass containerClass = system ? ContainerClass::sharedSystemGroup : ContainerClass::sharedAppGroup;
    const auto references = groupReferencesIn(map, system ? GroupType::system : GroupType::application, nullptr);
    std::set<std::string, std::less<>> made;
    for (const auto& [place, containers] : look_.sharedContainers) {
        if (place.first != containerClass)
            continue;
        for (const auto& [group, url] : containers) {
            made.insert(group);
            if (references.contains(group))
                continue;
            Finding& finding = look_.add(FindingCode::groupUnreferenced, url,
                                         "belongs to a group that is in nobody's entitlements", Mender::boot);
            finding.containerClass = containerClass;
            finding.user = place.second;
            finding.identifier = group;
        }
    }
    for (const auto& [group, holders] : references) {
        // A list may name what can never have a container.
        if (made.contains(group) || (system && !group.starts_with(systemGroupPrefix)))
            continue;
        Finding& finding = look_.add(FindingCode::groupNotMade, look_.device().places().entitlementFile(),
                                     "names the group " + group + ", which has no container yet", Mender::nobody);
        finding.containerClass = containerClass;
        finding.identifier = group;
    }
}

void ReferenceCheck::checkSystemContainers(const plist::Dictionary& map) {
    const auto found = look_.sharedContainers.find({ContainerClass::dataSystem, look_.device().users().system});
    if (found == look_.sharedContainers.end())
        return;
    for (const auto& [identifier, url] : found->second) {
        if (ownsSystemContainer(map, identifier))
            continue;
        Finding& finding = look_.add(FindingCode::systemUnentitled, url,
                                     "belongs to an identifier that is not entitled to it", Mender::boot);
        finding.containerClass = ContainerClass::dataSystem;
        finding.user = look_.device().users().system;
        finding.identifier = identifier;
    }
}

} // namespace zor::check
