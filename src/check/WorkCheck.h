// SPDX-License-Identifier: Apache-2.0
// The daemon's own directories: what a stop left in them, the sandbox mappings and the boot marker.
#pragma once

#include "check/Look.h"

namespace zor::check {

class WorkCheck {
public:
    explicit WorkCheck(Look& look) : look_(look) {}
    void checkAll();

private:
    void checkStaging();
    void checkDeathRow();
    void addDeathRowItems(int directory, const FileURL& row);
    void checkJournals();
    void addJournal(const FileURL& url);
    void checkLibrary();
    void checkMappings();
    void checkBootMarker();

    Look& look_;
};

} // namespace zor::check
