// SPDX-License-Identifier: Apache-2.0
// A file manager over a temporary root, with a disk that may fail, a log that keeps its lines, and a settable lock
// state.
#pragma once

#include "device/XattrProtectionClass.h"
#include "fs/ZORFileManager.h"
#include "support/FaultDisk.h"
#include "support/Files.h"
#include "support/RecordingLog.h"
#include "support/SettableRoles.h"
#include "support/TestRoot.h"

#include <fcntl.h>
#include <filesystem>
#include <gtest/gtest.h>
#include <memory>
#include <unistd.h>

namespace zor::fs::test {

class FileManager : public testing::Test, protected support::TestRoot {
protected:
    FileManager() { open(); }

    /// A new manager over the root; what was opened before sees nothing that is mounted since.
    void open() {
        reopen();
        manager_ = std::make_unique<ZORFileManager>(log, root(), disk, protection);
    }

    [[nodiscard]] ZORFileManager& manager() { return *manager_; }
    [[nodiscard]] FileURL url(const std::string& name) const { return FileURL::directory(path(name)); }
    void makeItems(const std::vector<std::string>& items) const {
        support::makeItems(support::openDirectory(path()).get(), items);
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

    support::RecordingLog lines{logLevelNotice};
    Log log{lines};
    support::SettableLockState lockState;
    support::FaultDisk disk{TestRoot::disk()};
    platform::XattrProtectionClass protection{disk, lockState};

private:
    std::unique_ptr<ZORFileManager> manager_;
};

} // namespace zor::fs::test
