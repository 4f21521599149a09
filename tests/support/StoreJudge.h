// SPDX-License-Identifier: Apache-2.0
// Reads a whole store from its files, with a knowledge of the layout that is its own and shares nothing with the
// daemon's, and says what is wrong with it: above all a container under its final name that is not whole.
//
// The device of the tests has one mobile user, 501, at home in private/var/mobile.
#pragma once

#include "support/FileTree.h"

namespace zor::support {

struct StoredContainer {
    std::uint64_t classNumber = 0;
    bool transient = false;
    std::string identifier;
    std::string uuid;
    /// Relative to the root.
    std::string path;
};

struct StoreFindings {
    /// Those that are whole.
    std::vector<StoredContainer> containers;
    /// The item that is half made, or lies where nothing of its kind may.
    std::string complaint;
    /// The container that is there a second time.
    std::string doubled;
    /// Names, hidden ones too.
    std::vector<std::string> staging;
    std::vector<std::string> deathRow;

    /// nullptr when there is none.
    [[nodiscard]] const StoredContainer* find(std::uint64_t classNumber, bool transient,
                                              const std::string& identifier) const;
};

/// Transient containers need not be whole after a power cut: a boot throws them away.
enum class Transients { judged, ignored };

StoreFindings judgeStore(const FileTree& tree, Transients transients);

} // namespace zor::support
