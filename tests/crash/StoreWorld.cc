// SPDX-License-Identifier: Apache-2.0
#include "crash/StoreWorld.h"

#include "check/StoreCheck.h"
#include "support/ProcessResources.h"

namespace zor::support {

namespace {

/// Judges what must hold of a store at rest.
std::string judgeAtRest(const std::string& root, const std::vector<Acknowledged>& promised, Leftovers leftovers) {
    const FileTree tree = readTree(root, {"run"});
    const StoreFindings findings = judgeStore(tree, Transients::judged);
    if (!findings.complaint.empty())
        return findings.complaint;
    if (!findings.staging.empty())
        return "staging still holds " + findings.staging.front();
    if (!findings.deathRow.empty())
        return "death row still holds " + findings.deathRow.front();
    if (leftovers == Leftovers::none && !tree.inodes.at(tree.resolve("tmp")).entries.empty())
        return "something was put into tmp";
    if (leftovers == Leftovers::none && !findings.doubled.empty())
        return findings.doubled;
    for (const Acknowledged& promise : promised) {
        const auto isIt = [&](const StoredContainer& container) {
            return std::string(root).append("/").append(container.path) == promise.path &&
                   container.uuid == promise.uuid && container.identifier == promise.request.identifier;
        };
        if (std::ranges::none_of(findings.containers, isIt))
            return promise.request.identifier + " was acknowledged and is not there";
    }
    return "";
}

std::string judgeRequests(StoreDaemon& daemon, const std::string& root, std::vector<Acknowledged>& promised,
                          const std::vector<Request>& requests, Leftovers leftovers) {
    // Asking for a transient container throws away the one there is.
    for (const auto& [request, path, uuid] : promised) {
        if (request.transient)
            continue;
        const auto answer = daemon.lookUp(request);
        if (!answer.acknowledged || answer.acknowledged->uuid != uuid || answer.acknowledged->path != path)
            return request.identifier + " was acknowledged and is not found: " + daemon.log();
    }
    for (const Request& request : requests) {
        const auto found = daemon.lookUp(request);
        if (!found.acknowledged && found.code != ErrorCode::notFound)
            return request.identifier + " is answered with " + std::to_string(static_cast<int>(found.code)) + ": " +
                   daemon.log();
        const auto created = daemon.create(request);
        if (!created.acknowledged)
            return request.identifier + " cannot be created: " + daemon.log();
        if (found.acknowledged && !request.transient && created.acknowledged->uuid != found.acknowledged->uuid)
            return request.identifier + " was found and then made again";
        add(promised, *created.acknowledged);
    }
    if (daemon.world.services().locks().identifiersInUse() != 0)
        return "an identifier is still locked";
    return judgeAtRest(root, promised, leftovers);
}

/// Judges what a user would be told of a store that was launched: nothing, but what the next boot or write clears, and
/// empty directories that never got their names.
std::string judgeByCheck(const std::string& root, const platform::BootMarker& marker) {
    const auto system = check::CheckedSystem::open(root);
    if (!system)
        return "the store cannot be checked: " + system.error();
    for (const check::Finding& finding : check::checkStore(
             **system, {.daemonServes = true, .pause = std::chrono::milliseconds(0), .bootMarker = &marker})) {
        const bool allowed = finding.mender == check::Mender::boot || finding.mender == check::Mender::nextWrite ||
                             finding.code == check::FindingCode::directoryLeftover;
        if (!allowed && !check::pageOf(finding.code).isNote)
            return "the check finds " + std::string(check::pageOf(finding.code).word) + " at " + finding.path + ": " +
                   finding.what;
    }
    return "";
}

} // namespace

std::string judgeAfterRestart(const std::string& root, platform::BootMarker& marker, fs::Durability::Probe probe,
                              const std::vector<Acknowledged>& promised, const std::vector<Request>& requests,
                              Leftovers leftovers) {
    const bool boots = !marker.look().present;
    const StoreFindings asItLies =
        judgeStore(readTree(root, {"run"}), boots ? Transients::ignored : Transients::judged);
    if (!asItLies.complaint.empty())
        return "before the launch: " + asItLies.complaint;
    std::vector<Acknowledged> kept = promised;
    if (boots)
        std::erase_if(kept, [](const Acknowledged& one) { return one.request.transient; });
    const ProcessResources before;
    {
        platform::LinuxDisk disk{platform::Syncs::off};
        StoreDaemon daemon(root, marker, disk, probe);
        daemon.launch();
        if (std::string complaint = judgeAtRest(root, kept, leftovers); !complaint.empty())
            return "after the launch: " + complaint + daemon.log();
        if (std::string complaint = judgeRequests(daemon, root, kept, requests, leftovers); !complaint.empty())
            return complaint;
        if (std::string complaint = judgeByCheck(root, marker); !complaint.empty())
            return complaint + daemon.log();
    }
    return before.leakedSince();
}

} // namespace zor::support
