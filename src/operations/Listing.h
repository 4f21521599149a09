// SPDX-License-Identifier: Apache-2.0
// Listing the containers of a class. Changes nothing. Any thread; under the all-identifiers lock held for reading.
// A listing waits for a replace under way in its class: between its moves the class lacks a live container.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "store/ZORContainerCache.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zor {

struct ListedContainer {
    std::string identifier;
    UUID uuid;
};

struct ListedPage {
    std::vector<ListedContainer> containers;
    /// The `after` of the next page; absent when there is none.
    std::optional<std::string> next;
};

class Listing {
public:
    struct Needs : RecordNeeds {
        const StoreLimits& limits;
    };
    explicit Listing(const Needs& needs) : needs_(needs) {}

    /// Errors 11, 40, 45.
    Result<std::vector<ListedContainer>> containersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                           bool transient);
    /// The same, limits.listPageMax at a time, in the order of the identifiers' bytes: those behind `after`, which is
    /// empty for the first page. A container that is made or goes between two pages may be listed or not; every other
    /// is, once.
    Result<ListedPage> containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient,
                                         const std::string& after);

private:
    Result<void> checkListedClass(std::uint32_t userId, ContainerClass containerClass);

    const Needs needs_;
};

} // namespace zor
