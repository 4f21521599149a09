// SPDX-License-Identifier: Apache-2.0
// Builds one container in the staging directory, complete, and moves it into its class directory with one move.
//
// Everything is made as the daemon's own, in a directory that is closed to all others until the end, and given its
// owner in a last pass, from the deepest directory up, that directory last: at no moment can the future owner, or
// anybody whom a mode lets in, reach a directory that the daemon still works in. So nobody else can name anything
// there, and what has just been made is found by its name.
//
// Unlike a directory getter, a container is not there by halves: a mode or an owner that cannot be set fails the build.
//
// A stop leaves: while it is built, a directory in staging, which the next launch moves to death row; after the
// move into the class directory, the container, whole. A power cut leaves the same: the metadata file's data is on the
// disk before the move can be (fs/Durability.h).
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "fs/Durability.h"
#include "fs/ZORFileManager.h"
#include "operations/DeathRow.h"
#include "store/Configuration.h"
#include "store/ZORMetadata.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace zor {

class ContainerMaker {
public:
    struct Needs {
        const Log& log;
        ZORFileManager& fileManager;
        const fs::Durability& durability;
        ZORGlobalConfiguration& configuration;
        const ZORWhitelist& whitelist;
        DeathRow& deathRow;
    };
    explicit ContainerMaker(const Needs& needs) : needs_(needs) {}

    /// A container in staging: whole, and on the disk before any move of it can be.
    struct Built {
        /// Its place is the one in staging, and it is not durable.
        std::shared_ptr<ZORMetadata> record;
        FileURL staging;
        /// The directory that holds it there.
        platform::FileDescriptor stagingDirectory;
    };
    struct Placed {
        FileURL url;
        /// The class directory that it was moved into.
        platform::FileDescriptor classDirectory;
    };
    /// Needs no lock, and waits for the disk. Errors 6, 7, 34; or 9 when what was begun could not be moved away.
    Result<Built> build(std::uint32_t userId, const std::string& identifier, ContainerClass containerClass);
    /// Moves it into its class directory; the value is its place there. `homeGeneration`: of the home in which the
    /// container was looked for and not found. Error 8; or 9 as above. It leaves staging, whatever happens.
    Result<Placed> putInPlace(const Built& built, bool transient, std::uint64_t homeGeneration);
    /// Moves one away that is not needed. One that cannot be moved is swept from staging at the next launch.
    void discard(const Built& built) noexcept;

private:
    Result<void> buildIn(int stagingDirectory, const FileURL& staging, const ZORMetadata& record);
    Result<Placed> moveIntoPlace(const Built& built, bool transient, std::uint64_t homeGeneration);
    /// The value of `step`; when that fails or throws, what is in staging is moved away first.
    template <typename Step>
    auto orCleanUp(const FileURL& staging, Step&& step) -> decltype(step());

    const Needs needs_;
};

/// A container that is built before the lock is taken, for the case that the lookup under the lock finds none. A
/// container that is left here goes to death row.
class BuiltAhead {
public:
    explicit BuiltAhead(ContainerMaker& maker) : maker_(maker) {}
    BuiltAhead(const BuiltAhead&) = delete;
    BuiltAhead& operator=(const BuiltAhead&) = delete;
    ~BuiltAhead() {
        if (container)
            maker_.discard(*container);
    }

    /// Errors as ContainerMaker::build has them.
    Result<void> build(std::uint32_t userId, const std::string& identifier, ContainerClass containerClass) {
        container = TRY(maker_.build(userId, identifier, containerClass));
        return {};
    }

    std::optional<ContainerMaker::Built> container;

private:
    ContainerMaker& maker_;
};

} // namespace zor
