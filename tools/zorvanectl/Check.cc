// SPDX-License-Identifier: Apache-2.0
// Judging the store as it lies, and having put right what the daemon can put right. Looking needs no daemon and asks
// none to start; only a repair talks to it.
#include "Commands.h"
#include "PendingChanges.h"
#include "check/Finding.h"
#include "check/StoreCheck.h"

#include <algorithm>
#include <memory>

namespace zorvanectl {

namespace {

using zor::check::CheckedSystem;
using zor::check::CheckOptions;
using zor::check::Finding;
using zor::check::Mender;
using zor::check::RepairStep;

/// A daemon that does not answer this soon is looked at as one that is starting.
constexpr std::uint32_t statusMillisecondsMax = 5000;

bool isNote(const Finding& finding) {
    return zor::check::pageOf(finding.code).isNote;
}

/// Connects when it is first asked.
decltype(CheckOptions::servedPath) servedPathOf(const zorvane::ConnectOptions& connect) {
    return [connect, client = std::make_shared<std::optional<zorvane::Client>>()](
               zor::ContainerClass containerClass, std::uint32_t user,
               const std::string& identifier) -> std::optional<std::string> {
        if (!*client)
            if (auto connected = zorvane::Client::connect(connect))
                *client = std::move(*connected);
        if (!*client)
            return std::nullopt;
        const auto container = (*client)->createOrLookup(
            {.containerClass = static_cast<std::uint64_t>(containerClass), .user = user, .identifier = identifier});
        return container ? std::optional(container->path) : std::nullopt;
    };
}

CheckOptions optionsFor(const CheckedSystem& system, const zorvane::ConnectOptions& connect) {
    CheckOptions options;
    // Asking where nobody serves would have the service manager start a daemon.
    if (!system.daemonRuns())
        return options;
    zorvane::ConnectOptions quick = connect;
    if (quick.timeoutMilliseconds.value_or(0) == 0)
        quick.timeoutMilliseconds = statusMillisecondsMax;
    const auto status = zorvane::status(quick);
    if (!status)
        return options;
    options.daemonServes = true;
    options.servedPath = servedPathOf(quick);
    for (const PendingChange& change : pendingChangesIn(*status))
        options.changingProtection.insert(change.uuid);
    options.unsavedInfo = unsavedInfoIn(*status);
    return options;
}

std::string repairText(const Finding& finding) {
    switch (finding.mender) {
    case Mender::nobody:
        return "none is needed";
    case Mender::daemon:
        return "zorvanectl check --repair";
    case Mender::nextWrite:
        return "the daemon does it when it next writes there";
    case Mender::launch:
        return "the next start of the daemon does it";
    case Mender::boot:
        return "the first start of the daemon after a boot deletes it";
    case Mender::person:
        return finding.command;
    }
    return "";
}

nlohmann::json toJson(const Finding& finding) {
    nlohmann::json json = {{"code", zor::check::pageOf(finding.code).word},
                           {"path", finding.path},
                           {"what", finding.what},
                           {"repair", {{"by", zor::check::wordOf(finding.mender)}, {"text", repairText(finding)}}}};
    if (finding.containerClass)
        json["class"] = static_cast<std::uint64_t>(*finding.containerClass);
    if (finding.user)
        json["user"] = *finding.user;
    if (!finding.identifier.empty())
        json["identifier"] = finding.identifier;
    if (finding.uuid)
        json["uuid"] = finding.uuid->string();
    if (!finding.rule.empty())
        json["rule"] = finding.rule;
    return json;
}

void show(const Output& output, const Finding& finding) {
    const zor::check::FindingPage& page = zor::check::pageOf(finding.code);
    output.line((page.isNote ? "note: " : "") + std::string(page.word) + "  " + printable(finding.path));
    std::string what = "  " + printable(finding.what);
    if (!finding.identifier.empty())
        what += "; of " + printable(finding.identifier);
    if (finding.containerClass)
        what += " in " + std::string(zor::className(*finding.containerClass));
    if (finding.user)
        what += ", user " + std::to_string(*finding.user);
    output.line(what);
    output.line("  Repair: " + printable(repairText(finding)));
}

std::size_t faultsIn(const std::vector<Finding>& findings) {
    return findings.size() - static_cast<std::size_t>(std::ranges::count_if(findings, isNote));
}

std::string countText(std::size_t faults) {
    return faults == 0 ? "The store is whole"
                       : std::to_string(faults) + (faults == 1 ? " finding" : " findings") +
                             "; 'zorvanectl explain CODE' says more of each";
}

void addFindings(nlohmann::json& document, const std::vector<Finding>& findings) {
    document["findings"] = nlohmann::json::array();
    document["notes"] = nlohmann::json::array();
    for (const Finding& finding : findings)
        document[isNote(finding) ? "notes" : "findings"].push_back(toJson(finding));
}

int exitCodeFor(const std::vector<Finding>& findings) {
    return zor::check::isWhole(findings) ? exitDone : exitFindings;
}

int report(const Output& output, const std::vector<Finding>& findings) {
    if (output.isJson()) {
        nlohmann::json document;
        addFindings(document, findings);
        output.json(document);
        return exitCodeFor(findings);
    }
    output.page();
    for (const Finding& finding : findings)
        show(output, finding);
    output.line(countText(faultsIn(findings)));
    return exitCodeFor(findings);
}

zorvane::Result<void> carryOut(zorvane::Client& client, const RepairStep& step) {
    if (step.act == RepairStep::Act::emptyDeathRow)
        return client.emptyDeathRow();
    return client.recreateDefaultStructure({.containerClass = static_cast<std::uint64_t>(step.containerClass),
                                            .user = step.user,
                                            .identifier = step.identifier,
                                            .uuid = step.uuid.bytes()});
}

/// Shows each step, and does it unless it is only to be shown. A step that failed is said on standard error; its exit
/// code is kept.
class Repair {
public:
    Repair(const zorvane::ConnectOptions& connect, const Output& output, bool dryRun)
        : connect_(connect), output_(output), dryRun_(dryRun) {}

    void go(const RepairStep& step) {
        nlohmann::json shown = {{"by", zor::check::wordOf(step.mender)}, {"text", step.text}};
        if (!step.command.empty())
            shown["command"] = step.command;
        if (!output_.isJson()) {
            output_.line(std::string(zor::check::wordOf(step.mender)) + ": " + printable(step.text));
            if (!step.command.empty())
                output_.line("  " + printable(step.command));
        }
        if (!dryRun_ && step.act != RepairStep::Act::none)
            shown["done"] = execute(step);
        steps_.push_back(std::move(shown));
    }
    [[nodiscard]] const nlohmann::json& steps() const { return steps_; }
    [[nodiscard]] int exitCode() const { return exitCode_; }

private:
    bool execute(const RepairStep& step) {
        if (!client_)
            client_ = zorvane::Client::connect(connect_);
        const auto done = *client_ ? carryOut(**client_, step) : std::unexpected(client_->error());
        if (!done)
            exitCode_ = output_.error(done.error(), "repair: " + step.text);
        return done.has_value();
    }

    const zorvane::ConnectOptions& connect_;
    const Output& output_;
    const bool dryRun_;
    std::optional<zorvane::Result<zorvane::Client>> client_;
    nlohmann::json steps_ = nlohmann::json::array();
    int exitCode_ = exitDone;
};

} // namespace

int check(const zorvane::ConnectOptions& connect, const Output& output, const Checking& checking, Consent consent) {
    const std::string what = "check " + connect.root;
    const auto system = CheckedSystem::open(connect.root);
    if (!system)
        return output.localError(exitLocalError, printable(system.error()),
                                 "run it as the user that the daemon runs as, and name the daemon's root with --root",
                                 what);
    const CheckOptions options = optionsFor(**system, connect);
    const std::vector<Finding> findings = zor::check::checkStore(**system, options);
    if (!checking.repair)
        return report(output, findings);
    const std::vector<RepairStep> steps = zor::check::repairSteps(findings, (*system)->root().canonicalPath());
    const auto destroying = std::ranges::find_if(steps, &RepairStep::destroys);
    if (!checking.dryRun && destroying != steps.end() && consent == Consent::ask &&
        !output.agreed("Repair, so that " + destroying->text + "?", what))
        return exitUsage;
    Repair repair(connect, output, checking.dryRun);
    for (const RepairStep& step : steps)
        repair.go(step);
    const std::vector<Finding> left = checking.dryRun ? findings : zor::check::checkStore(**system, options);
    if (output.isJson()) {
        nlohmann::json document;
        addFindings(document, findings);
        document["steps"] = repair.steps();
        if (!checking.dryRun)
            document["left"] = faultsIn(left);
        output.json(document);
    } else if (!checking.dryRun) {
        output.line(countText(faultsIn(left)));
    }
    return repair.exitCode() != exitDone ? repair.exitCode() : exitCodeFor(left);
}

} // namespace zorvanectl
