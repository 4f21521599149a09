// SPDX-License-Identifier: Apache-2.0
// A file manager over a temporary root, with a disk that may fail, a log that keeps its lines, and a settable lock
// state.
#pragma once

#include "fs/ZORFileManager.h"
#include "platform/linux/LinuxDisk.h"
#include "platform/linux/XattrProtectionClass.h"
#include "support/FaultDisk.h"
#include "support/FileTree.h"
#include "support/RecordingLog.h"

#include <algorithm>
#include <cstdio>
#include <dirent.h>
#include <fcntl.h>
#include <fstream>
#include <gtest/gtest.h>
#include <iterator>
#include <memory>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::fs::test {

class LockStateOfTest final : public platform::DeviceLockState {
public:
    [[nodiscard]] int currentState() const override { return state; }
    int registerForChanges(platform::RunLoop&, std::function<void()>) override { return 0; }
    [[nodiscard]] const char* registrationCallName() const override { return ""; }
    [[nodiscard]] const char* notificationName() const override { return ""; }
    int state = 0;
};

class FileManager : public testing::Test {
protected:
    FileManager() {
        ::chmod(directory_.path().c_str(), 0755);
        open();
    }

    /// A new manager over the root; what was opened before sees nothing that is mounted since.
    void open() {
        root_ = std::make_unique<platform::SystemRoot>(platform::SystemRoot::open(directory_.path()).value());
        EXPECT_EQ(root_->makeRuntimeDirectory(realDisk_), 0);
        protection_ = std::make_unique<platform::XattrProtectionClass>(disk, lockState);
        manager_ = std::make_unique<ZORFileManager>(log, *root_, disk, *protection_);
    }

    [[nodiscard]] ZORFileManager& manager() { return *manager_; }
    [[nodiscard]] std::string path(const std::string& name) const { return directory_.path() + "/" + name; }
    [[nodiscard]] FileURL url(const std::string& name) const { return FileURL::directory(path(name)); }

    void makeDirectory(const std::string& name, mode_t mode = 0755) const {
        ASSERT_EQ(::mkdir(path(name).c_str(), 0700), 0) << name;
        ASSERT_EQ(::chmod(path(name).c_str(), mode), 0);
    }
    void makeFile(const std::string& name, const std::string& content = "x", mode_t mode = 0644) const {
        std::ofstream(path(name)) << content;
        ASSERT_EQ(::chmod(path(name).c_str(), mode), 0) << name;
    }
    void makeLink(const std::string& name, const std::string& target) const {
        ASSERT_EQ(::symlink(target.c_str(), path(name).c_str()), 0) << name;
    }
    [[nodiscard]] std::string content(const std::string& name) const {
        std::ifstream file(path(name));
        return {std::istreambuf_iterator<char>(file), {}};
    }
    /// Mode and owner in one text; "missing".
    [[nodiscard]] std::string item(const std::string& name) const {
        struct stat status{};
        if (::lstat(path(name).c_str(), &status) != 0)
            return "missing";
        char text[64];
        std::snprintf(text, sizeof text, "%06o %u:%u", status.st_mode, status.st_uid, status.st_gid);
        return text;
    }
    [[nodiscard]] std::vector<std::string> names(const std::string& name) const {
        std::vector<std::string> found;
        DIR* directory = ::opendir(path(name).c_str());
        while (const dirent* entry = directory ? ::readdir(directory) : nullptr)
            if (entry->d_name != std::string(".") && entry->d_name != std::string(".."))
                found.emplace_back(entry->d_name);
        if (directory)
            ::closedir(directory);
        std::ranges::sort(found);
        return found;
    }
    /// The next call of this kind fails once.
    void failNext(support::DiskCall call, int error) {
        disk.arm({.error = error, .filter = [call](const support::DiskCallInfo& info) { return info.call == call; }});
    }
    static void expectPosix(const Result<void>& result, int number, const std::string& description) {
        ASSERT_FALSE(result);
        EXPECT_TRUE(result.error().isPosix(number)) << result.error().text();
        EXPECT_EQ(result.error().description(), description);
    }
    static bool isRoot() { return ::geteuid() == 0; }

    support::RecordingLog lines{logLevelNotice};
    Log log{lines};
    LockStateOfTest lockState;

private:
    support::TemporaryDirectory directory_;
    platform::LinuxDisk realDisk_{platform::Syncs::off};

protected:
    support::FaultDisk disk{realDisk_};

private:
    std::unique_ptr<platform::SystemRoot> root_;
    std::unique_ptr<platform::XattrProtectionClass> protection_;
    std::unique_ptr<ZORFileManager> manager_;
};

} // namespace zor::fs::test
