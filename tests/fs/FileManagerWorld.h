// SPDX-License-Identifier: Apache-2.0
// A file manager over a temporary root, with a disk that may fail, a log that keeps its lines, and a settable lock
// state.
#pragma once

#include "device/XattrProtectionClass.h"
#include "fs/ZORFileManager.h"
#include "os/LinuxDisk.h"
#include "support/FaultDisk.h"
#include "support/FileTree.h"
#include "support/Files.h"
#include "support/RecordingLog.h"

#include <algorithm>
#include <cstdio>
#include <fcntl.h>
#include <filesystem>
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
    [[nodiscard]] const platform::SystemRoot& root() const { return *root_; }
    [[nodiscard]] platform::FileProtectionClass& protection() { return *protection_; }
    [[nodiscard]] std::string path(const std::string& name) const { return directory_.path() + "/" + name; }
    [[nodiscard]] FileURL url(const std::string& name) const { return FileURL::directory(path(name)); }

    void makeDirectory(const std::string& name, mode_t mode = 0755) const {
        support::makeDirectory(AT_FDCWD, path(name), mode);
    }
    void makeFile(const std::string& name, const std::string& content = "x", mode_t mode = 0644) const {
        support::makeFile(AT_FDCWD, path(name), content, mode);
    }
    void makeLink(const std::string& name, const std::string& target) const {
        support::makeLink(AT_FDCWD, path(name), target);
    }
    void makeItems(const std::vector<std::string>& items) const {
        support::makeItems(support::openDirectory(directory_.path()).get(), items);
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
        for (const auto& entry : std::filesystem::directory_iterator(path(name)))
            found.push_back(entry.path().filename().string());
        std::ranges::sort(found);
        return found;
    }
    /// The next call of this kind, or each until the disk is disarmed, fails; only one for `name`, when that is given.
    void fail(support::FaultSpan span, support::DiskCall call, int error, const std::string& name = "") {
        disk.arm({.error = error, .span = span, .filter = [=](const support::DiskCallInfo& info) {
                      return info.call == call && (name.empty() || info.subject == name);
                  }});
    }
    void failNext(support::DiskCall call, int error) { fail(support::FaultSpan::once, call, error); }
    template <typename Value>
    static void expectPosix(const Result<Value>& result, int number, const std::string& description) {
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
