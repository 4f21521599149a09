// SPDX-License-Identifier: Apache-2.0
// A container to install into, with what lies around it.
#pragma once

#include "archives/ArchiveMaker.h"
#include "content/Content.h"
#include "os/LinuxDisk.h"
#include "support/FileTree.h"
#include "support/Files.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <sstream>

namespace zorvanectl::content::test {

using zor::platform::FileDescriptor;
using namespace zor::support;
using namespace zor::test;
inline constexpr const char* metadata = ".com.veltra.zorvane.metadata.plist";
inline constexpr uid_t ownerId = 501;

inline volatile std::sig_atomic_t noSignal = 0;

/// A container as it was just made, and something beside it that nobody may touch.
class World {
public:
    explicit World(const std::string& parent = "/dev/shm") : directory_(parent) {
        for (const char* name : {"/outside", "/container", "/container/Documents", "/source"})
            ::mkdir(path(name).c_str(), 0755);
        writeFile(path("/outside/file"), "SECRET");
        writeFile(path("/container/") + metadata, "whose it is");
        for (const char* name : {"/container", "/container/Documents"})
            EXPECT_TRUE(::geteuid() != 0 || ::chown(path(name).c_str(), ownerId, ownerId) == 0);
        ::chmod(directory_.path().c_str(), 0755);
        outside_ = outside();
        empty_ = content();
    }

    [[nodiscard]] std::string path(const std::string& below) const { return directory_.path() + below; }
    [[nodiscard]] bool isDamaged() const { return outside() != outside_; }
    /// Nothing of what was refused shows in the container, and nothing outside it changed.
    void expectRefused(const Outcome<Progress>& outcome, const std::string& why) const {
        ASSERT_FALSE(outcome);
        EXPECT_NE(outcome.error().what.find(why), std::string::npos) << outcome.error().what;
        EXPECT_FALSE(isDamaged());
        EXPECT_EQ(content(), empty_);
    }

    /// The status of an item in the container.
    [[nodiscard]] struct stat statusOf(const std::string& name) const {
        struct stat status{};
        EXPECT_EQ(::lstat(path("/container/" + name).c_str(), &status), 0) << name;
        return status;
    }
    /// A source that begins with "//" is one outside this world.
    Outcome<Progress> put(const std::string& source, zor::platform::Disk* disk = nullptr) {
        zor::platform::LinuxDisk real(zor::platform::Syncs::off);
        auto opened = Source::open(source.starts_with("//") ? source : path(source));
        if (!opened)
            return std::unexpected(opened.error());
        return putContent(disk ? *disk : real, openDirectory(path("/container")).get(), *opened, {}, noSignal);
    }
    Outcome<Progress> putArchive(const std::string& bytes) {
        writeFile(path("/archive"), bytes);
        return put("/archive");
    }

private:
    /// Everything but the container and the source.
    [[nodiscard]] std::string outside() const {
        return readTree(directory_.path(), {"container", "source", "archive"}).describe();
    }
    /// The content that shows in the container: ".install-" is closed to its owner.
    [[nodiscard]] std::string content() const {
        std::string shown;
        std::istringstream lines(readTree(path("/container"), {metadata}).describe());
        for (std::string line; std::getline(lines, line);)
            if (line.find(".install-") == line.npos)
                shown += line + "\n";
        return shown;
    }
    TemporaryDirectory directory_;
    std::string outside_;
    std::string empty_;
};

} // namespace zorvanectl::content::test
