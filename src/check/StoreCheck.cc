// SPDX-License-Identifier: Apache-2.0
#include "check/StoreCheck.h"

#include "check/ContainerCheck.h"
#include "check/Look.h"
#include "check/ReferenceCheck.h"
#include "check/WorkCheck.h"
#include "os/Names.h"
#include "store/RootNeeds.h"

#include <algorithm>
#include <thread>

namespace zor::check {

namespace {

/// Things that the whole system lacks or has too much of.
void checkSystem(Look& look) {
    const CheckedSystem& system = look.device();
    for (const std::string& path : missingOf(system.root()))
        look.addForPerson(FindingCode::rootIncomplete, FileURL::file(system.root().path(path)), "is not there",
                          initCommand(system.root()));
    for (const std::string& doubt : system.userDoubts())
        look.addForPerson(FindingCode::userNumberTaken,
                          FileURL::file(system.root().path(platform::names::configurationFile)), doubt,
                          "man zorvaned.conf");
}

std::vector<Finding> lookOnce(CheckedSystem& system, const CheckOptions& options) {
    Look look(system, options);
    checkSystem(look);
    ContainerCheck(look).checkAll();
    ReferenceCheck(look).checkAll();
    WorkCheck(look).checkAll();
    std::vector<Finding> findings = look.take();
    std::ranges::stable_sort(findings, {}, &Finding::path);
    return findings;
}

} // namespace

std::vector<Finding> checkStore(CheckedSystem& system, const CheckOptions& options) {
    std::vector<Finding> findings = lookOnce(system, options);
    if (options.pause.count() == 0 || isWhole(findings))
        return findings;
    std::this_thread::sleep_for(options.pause);
    const std::vector<Finding> again = lookOnce(system, options);
    std::erase_if(findings, [&](const Finding& finding) {
        const auto [first, last] = std::ranges::equal_range(again, finding.path, {}, &Finding::path);
        return std::none_of(first, last, [&](const Finding& seen) { return seen.isSameAs(finding); });
    });
    return findings;
}

bool isWhole(const std::vector<Finding>& findings) {
    return std::ranges::all_of(findings, [](const Finding& finding) { return pageOf(finding.code).isNote; });
}

} // namespace zor::check
