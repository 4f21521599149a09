// SPDX-License-Identifier: Apache-2.0
#include "identity/IdentityFile.h"
#include "identity/CgroupUnit.h"
#include "identity/LinuxPasswordDatabase.h"
#include "os/Names.h"
#include "support/TestRoot.h"

#include <gtest/gtest.h>

namespace zor::platform {
namespace {

using support::TestRoot;

std::string file(const std::string& body) {
    return "<plist version=\"1.0\"><dict>" + body + "</dict></plist>";
}

std::expected<RegistryEntry, std::string> parse(const std::string& text) {
    return parseIdentityFile({reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
}

const std::string executable = "<key>Executable</key><string>/usr/bin/agent</string>";

// A file that is not wholly understood grants nothing.
TEST(IdentityFile, RefusesWhatItDoesNotUnderstand) {
    ASSERT_TRUE(parse(file(executable + "<key>Identifier</key><string>" + std::string(1024, 'i') + "</string>")));
    std::vector<std::string> wrong = {"", "not a property list", "<plist version=\"1.0\"><array/></plist>",
                                      "<plist version=\"1.0\"><string>/usr/bin/agent</string></plist>", file("")};
    for (const char* value :
         {"<string>agent</string>", "<string></string>", "<integer>1</integer>", "<array><string>/a</string></array>"})
        wrong.push_back(file(std::string("<key>Executable</key>") + value));
    const std::pair<const char*, std::vector<std::string>> values[] = {
        {"Identifier", {"<string></string>", "<true/>", "<string>" + std::string(1025, 'i') + "</string>"}},
        {"UserIDs", {"<integer>501</integer>", "<array><string>501</string></array>"}},
        {"UserIDs", {"<array><integer>-1</integer></array>", "<array><integer>4294967295</integer></array>"}},
        {"Unit", {"<array/>", "<string></string>"}},
        {"SecurityLabel", {"<true/>"}},
        {"Entitlements", {"<array/>"}},
        {"KernelAgent", {"<integer>1</integer>"}},
        {"OnlyOwnIdentifier", {"<string>true</string>"}},
        // A fence with a typing mistake must not be a fence that is not there.
        {"UserIds", {"<array><integer>501</integer></array>"}},
        {"Executable ", {"<string>/b</string>"}}};
    for (const auto& [key, texts] : values)
        for (const std::string& text : texts)
            wrong.push_back(file(executable + "<key>" + key + "</key>" + text));
    for (const std::string& text : wrong) {
        const auto entry = parse(text);
        EXPECT_TRUE(!entry && !entry.error().empty()) << text;
    }
}

// Power needs a uid that was named, or the owner's.
TEST(IdentityFile, FencesPowers) {
    const std::string prefix = "com.veltra.private.Zorvane.";
    const auto entitled = [&](const std::string& key, const std::string& value) {
        return "<key>Entitlements</key><dict><key>" + key + "</key>" + value + "</dict>";
    };
    struct Case {
        std::string body;
        bool admitsOwner;
        bool admits501;
    };
    const std::string named = "<key>UserIDs</key><array><integer>501</integer></array>";
    const std::vector<Case> cases = {
        {"", true, true},
        {"<key>Identifier</key><string>com.veltra.app</string>", true, true},
        {entitled(prefix + "allowed", "<true/>"), true, false},
        {entitled(prefix + "allowed", "<false/>"), true, true},
        {entitled(prefix + "allowed", "<integer>1</integer>"), true, true},
        {entitled(prefix + "otherIdLookup", "<true/>"), true, false},
        {entitled(prefix + "wipeContainer", "<array/>"), true, false},
        {entitled(prefix + "wipeContainer", "<true/>"), true, true},
        {entitled("com.veltra.security.application-groups", "<array/>"), true, true},
        {"<key>KernelAgent</key><true/>", true, false},
        {"<key>KernelAgent</key><false/>", true, true},
        {entitled(prefix + "allowed", "<true/>") + named, false, true},
        {named, false, true},
        {"<key>UserIDs</key><array/>", false, false},
    };
    for (const Case& row : cases) {
        const auto entry = parse(file(executable + row.body));
        ASSERT_TRUE(entry) << row.body << entry.error();
        EXPECT_EQ(entry->admitsUser(0), row.admitsOwner) << row.body;
        EXPECT_EQ(entry->admitsUser(501), row.admits501) << row.body;
    }
}

// Only a unit of the system manager counts, not one that a user can bring about.
TEST(CgroupUnit, IsTheSystemManagersUnit) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"0::/system.slice/installer.service\n", "installer.service"},
        {"0::/system.slice/system-x.slice/x@1.service/inner/deeper\n", "x@1.service"},
        {"0::/user.slice/user-501.slice/user@501.service/app.slice/installer.service\n", "user@501.service"},
        {"0::/\n", ""},
        {"0::/../system.slice/installer.service\n", ".."},
        {"0::/system.slice/_cpu.service\n", "cpu.service"},
        {"12:cpu:/system.slice/a.service\n1:name=systemd:/system.slice/b.service\n0::/\n", "b.service"},
        {"1:cpu,name=other:/system.slice/installer.service\n", ""},
        {"", ""},
        {"0::/system.slice", ""},
    };
    for (const auto& [text, unit] : cases)
        EXPECT_EQ(systemUnitInCgroups(text), unit) << text;
}

TEST(PasswordDatabase, ReadsTheRootsOwnFile) {
    const TestRoot test;
    const LinuxPasswordDatabase database(test.root());
    EXPECT_FALSE(database.entryForUserId(0)) << "the system's own database must not be asked";
    test.write(names::passwordFile, "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                    "# a comment\nbroken line\nmobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                    "homeless:x:502:502:::/bin/sh\nrelative:x:503:503::home:/bin/sh\n"
                                    "other:x:501:501::/elsewhere:/bin/sh\n");
    ASSERT_TRUE(database.entryForUserId(501));
    EXPECT_EQ(database.entryForUserId(501)->name, "mobile");
    EXPECT_EQ(database.entryForUserId(501)->homeDirectory, test.path("private/var/mobile"));
    EXPECT_EQ(database.entryForName("other")->homeDirectory, test.path("elsewhere"));
    for (const char* name : {"homeless", "relative", "absent", ""})
        EXPECT_FALSE(database.entryForName(name)) << name;
    // On the device itself the whole database of the system counts.
    EXPECT_TRUE(LinuxPasswordDatabase(SystemRoot::open("/").value()).entryForUserId(0));
}

} // namespace
} // namespace zor::platform
