// SPDX-License-Identifier: Apache-2.0
// The daemon's own directories: what a stop left in them, what waits on death rows, the sandbox mappings and the boot
// marker. Reads alone; one thread.
#pragma once

#include "check/CheckedSystem.h"
#include "check/Look.h"

#include <cstdint>
#include <functional>

namespace zor::check {

/// Calls with each row that there is, open for reading, and what it is called.
void forEachDeathRow(Look& look, const std::function<void(int row, const FileURL& url)>& function);

struct DeathRow {
    std::size_t items = 0;
    std::uint64_t bytes = 0;
    /// Since the one that waits longest was moved there; 0 without items.
    std::uint64_t oldestSeconds = 0;
};
/// Measures each item, which takes as long as its tree is large.
[[nodiscard]] DeathRow lookAtDeathRow(CheckedSystem& system);

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
