// SPDX-License-Identifier: Apache-2.0
// The daemon as its tool shows it: exit codes and words, help and completion, schemas, what is found and repaired.
#include "process/DaemonProcess.h"
#include "whole/Expect.h"

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>
#include <sys/mount.h>
#include <tuple>

namespace zor::whole {

using nlohmann::json;

/// Judges a document by one of the schemas that are installed, as far as they use the language: a word of a schema that
/// is not known here is a fault. Returns where and how the document differs; empty when it does not.
std::string differenceFromSchema(const json& schema, const json& document);

bool hasType(const std::string& type, const json& document) {
    return type == (document.is_number_integer() ? "integer" : document.is_number() ? "number" : document.type_name());
}

std::string properties(const json& schema, const json& document) {
    if (!document.is_object())
        return {};
    const json known = schema.value("properties", json::object());
    for (const auto& [name, value] : document.items()) {
        const json rule = known.contains(name) ? known[name] : schema.value("additionalProperties", json(true));
        if (rule == json(false))
            return name + " is not known";
        if (const auto difference = rule.is_object() ? differenceFromSchema(rule, value) : ""; !difference.empty())
            return name + ": " + difference;
    }
    return {};
}

std::string differenceFromSchema(const json& schema, const json& document) {
    for (const auto& [word, rule] : schema.items()) {
        std::string difference;
        const json list = rule.is_array() ? rule : json::array({rule});
        const auto isSo = [&](const auto& judge) { return std::any_of(list.begin(), list.end(), judge); };
        if (word == "type")
            difference = isSo([&](const json& type) { return hasType(type, document); }) ? "" : "is no " + rule.dump();
        else if (word == "enum" || word == "const")
            difference = isSo([&](const json& value) { return value == document; }) ? "" : "is not " + rule.dump();
        else if (word == "anyOf")
            difference =
                isSo([&](const json& one) { return differenceFromSchema(one, document).empty(); }) ? "" : "none fits";
        else if (word == "required")
            difference =
                isSo([&](const json& name) { return !document.contains(name); }) ? "not all of " + rule.dump() : "";
        else if (word == "properties" || word == "additionalProperties")
            difference = properties(schema, document);
        else if (word == "items")
            for (std::size_t i = 0; i < document.size() && difference.empty(); ++i)
                difference = differenceFromSchema(rule, document[i]);
        else
            difference = "the schema says " + word;
        if (!difference.empty())
            return difference;
    }
    return {};
}

struct ToolCall {
    std::vector<std::string> arguments;
    int exitStatus;
    const char* inOutput;
    /// Says it, too: what to do about a mistake.
    const char* andDoes = "";
};

/// The name of the schema for what a call prints.
std::string schemaOf(const ToolCall& row, const nlohmann::json& schemas, const nlohmann::json& document) {
    if (document.contains("error"))
        return "error";
    std::string name;
    for (const std::string& word : row.arguments)
        for (const std::string& longer : {name + (name.empty() ? "" : " ") + word, word})
            if (schemas.contains(longer) || longer == "info" || longer == "entitlements" || longer == "registry") {
                name = longer;
                break;
            }
    return name;
}

void expectCall(const DaemonProcess& daemon, const ToolCall& row) {
    SCOPED_TRACE(::testing::PrintToString(row.arguments));
    static const nlohmann::json schemas =
        nlohmann::json::parse(readFile(packagingPath("schema/zorvanectl.schema.json")))["$defs"];
    std::vector<std::string> words = daemon.toolWords(row.arguments);
    if (!row.arguments.empty() && row.arguments[0] == "--root") // another than the daemon's
        words.erase(words.begin() + 1, words.begin() + 3);
    const auto outcome = runProgram(words);
    expectOutcome(outcome, row.exitStatus, row.inOutput);
    EXPECT_NE(outcome.output.find(row.andDoes), std::string::npos) << outcome.output;
    if (std::ranges::find(row.arguments, "--json") == row.arguments.end())
        return;
    const auto document = nlohmann::json::parse(outcome.output, nullptr, false);
    ASSERT_TRUE(document.is_object()) << outcome.output;
    const std::string name = schemaOf(row, schemas, document);
    ASSERT_TRUE(schemas.contains(name)) << name;
    EXPECT_EQ(differenceFromSchema(schemas[name], document), "") << name << outcome.output;
}

// Goal: the tool's exit codes and outputs are what scripts rely on, and its JSON what the installed schemas say.
// Method: a table of calls on a real daemon.
TEST(Tool, ExitCodesAndOutput) {
    DaemonProcess daemon;
    daemon.start();
    const std::string controls = "\302\23331m"; // would colour a terminal
    const std::vector<ToolCall> rows = {
        {{"--json", "create", "a.b", "--class", "data-app", "--user", "mobile"}, 0, "\"existed\": false"},
        {{"lookup", "a.b", "--class", "2", "-u", "current"}, 0, "a.b exists"},
        {{"--json", "lookup", "a.b", "--class", "Data/Application"}, 0, "\"existed\": true"},
        {{"create", "\346\227\245", "--class", "data-app", "--user", "second"}, 0, "created"},
        {{"list", "--all"}, 0, "Data/Application  502 second  \346\227\245          /"},
        {{"--json", "list", "--all", "--size", "--sort", "user"}, 0, "\"bytes\""},
        {{"--json", "list", "--class", "bundle-app"}, 0, "\"containers\": []"},
        {{"--json", "usage", "--all"}, 0, "\"totalBytes\""},
        {{"--json", "metadata", "a.b", "--class", "data-app"}, 0, "\"transient\": false"},
        {{"--json", "info", "set", "a.b", "k", "{\"deep\": [1, true]}", "--class", "data-app"}, 0, "\"set\""},
        {{"--json", "info", "get", "a.b", "k", "--class", "data-app"}, 0, "\"deep\""},
        {{"--json", "info", "unset", "a.b", "k", "--class", "data-app"}, 0, "\"unset\""},
        {{"--json", "info", "list", "a.b", "--class", "data-app"}, 0, "\"info\": {}"},
        {{"info", "list", "a.b", "--class", "data-app"}, 0, "a.b has no info values"},
        {{"--json", "repair", "a.b", "--class", "data-app"}, 0, "\"repaired\""},
        {{"--json", "lock-state", "1"}, 0, "\"locked\": true"},
        {{"protect", "a.b", "1", "--class", "data-app", "--no-wait"}, 0, "a.b gets class 1"},
        {{"--json", "protection", "a.b", "--class", "data-app"}, 0, "\"waitsForUnlock\": true"},
        {{"lock-state", "0"}, 0, "unlocked"},
        {{"--json", "protect", "a.b", "1", "--class", "data-app"}, 0, "\"pending\": false"},
        {{"--json", "explain", "61"}, 0, "\"whatToDo\""},
        {{"--json", "regenerate", "a.b", "--class", "data-app"}, 0, "\"path\""},
        {{"info", "set", "a.b", "k", "v", "--class", "data-app"}, 0, "a.b set"},
        {{"wipe", "a.b", "--class", "data-app"}, 2, "with info value k?"},
        {{"--json", "wipe", "a.b", "--class", "data-app", "--yes"}, 0, "\"protectionClass\": 1", "\"classKept\": true"},
        {{"lock-state", "1"}, 0, "locked"},
        {{"wipe", "a.b", "--class", "data-app", "--yes", "--keep-class"}, 5, "class 1 of the container", "unlock"},
        {{"wipe", "a.b", "--class", "data-app", "--yes"}, 0, "and has 3 now", "'zorvanectl protect' sets it again"},
        {{"lock-state", "0"}, 0, "unlocked"},
        {{"create", "a.b", "--class", "data-app", "--transient"}, 0, "a.b created"},
        {{"--json", "replace", "a.b", "--class", "data-app", "--yes"}, 0, "\"replaced\": true"},
        {{"--json", "delete", "a.b", "--class", "data-app", "--yes"}, 0, "\"deleted\""},
        {{"--json", "empty-death-row"}, 0, "\"emptied\": true"},
        {{"entitlements", "set", "a.b", "--app-group", "group.a", "--system-container"}, 0, "a.b registered"},
        {{"--json", "entitlements", "set", "c.d", "--app-group", "group.a", "--parent", "a.b"}, 0, "\"registered\""},
        {{"--json", "entitlements", "show", "nobody"}, 0, "\"registered\": false"},
        {{"--json", "entitlements", "list"}, 0, "\"a.b\""},
        {{"--json", "system-path", "a.b"}, 0, "/Data/System/"},
        {{"--json", "system-group-path", "systemgroup.com.veltra.fonts"}, 0, "/systemgroup.com.veltra.fonts"},
        {{"why", "a.b"}, 0, "2 references, by a.b c.d"},
        {{"--json", "why", "--group", "group.a"}, 0, "\"c.d\""},
        {{"--json", "why", "a.b"}, 0, "\"systemContainerGoesWithIdentifier\": true"},
        {{"--json", "entitlements", "clear", "a.b"}, 0, "\"cleared\""},
        {{"--json", "list", "--class", "data-system"}, 0, "\"containers\": []"},
        {{"--json", "registry", "list"}, 0, "20-ctl.plist"},
        {{"--json", "registry", "who", programPath("zorvanectl")}, 0, "org.example.20-ctl"},
        {{"--json", "status"}, 0, "\"uptimeMilliseconds\""},
        {{"help", "info", "get"}, 0, "Usage: zorvanectl info get"},
        {{"--help"}, 0, "Examples"},
        {{"create", controls, "--class", "2"}, 0, "\\xc2\\x9b31m created"},
        {{"--json", "list", "--class", "2"}, 0, "\"\\u009b31m\""},
    };
    for (const ToolCall& row : rows)
        expectCall(daemon, row);
    // A terminal that is too narrow for all columns has a line for each container.
    const auto narrow =
        runProgram({"/usr/bin/script", "-qec",
                    "stty cols 60; TERM=dumb " + programPath("zorvanectl") + " --root " + daemon.root() + " list --all",
                    "/dev/null"});
    EXPECT_NE(narrow.output.find("\n\346\227\245  "), std::string::npos) << narrow.output;
}

// Goal: every mistake at the terminal is told with what was wrong and what to do, under the exit code that scripts tell
// it by. Method: a table of mistakes, on a daemon that runs, one that is stopped, and none.
TEST(Tool, MistakesAreAnswered) {
    DaemonProcess daemon;
    daemon.start();
    expectCall(daemon, {{"create", "a.b", "--class", "2"}, 0, "created"});
    const auto registered = [&](const std::string& entry) {
        const std::string path = daemon.path("tmp/entry.plist");
        writeFile(path, "<plist version=\"1.0\">\n<dict><key>Executable</key><string>/bin/sh</string>\n" + entry +
                            "</dict></plist>");
        return path;
    };
    const std::string stranger = daemon.path("tmp/zorvanectl");
    std::filesystem::copy_file(programPath("zorvanectl"), stranger);
    const ToolCall rows[] = {
        {{}, 2, "'zorvanectl' needs a command", "help"},
        {{"lst"}, 2, "'list' meant", "zorvanectl help"},
        {{"info", "gte", "a.b", "k"}, 2, "'get' meant", "zorvanectl help info"},
        {{"lookup", "a.b", "c.d", "-c", "2"}, 2, "no further word, such as 'c.d'", "help lookup"},
        {{"lookup", "", "--class", "2"}, 2, "it is empty", "help lookup"},
        {{"lookup", "a.b", "--class", "dota-app"}, 2, "'data-application' meant", "--help"},
        {{"lookup", "a.b", "--class", "2", "--user", "mobil"}, 2, "nor a user of", "a user's name"},
        {{"--root", "/nowhere", "lookup", "a.b", "-c", "2", "-u", "mobile"}, 2, "cannot be opened", "name a user id"},
        {{"delete", "a.b", "x.y", "--class", "2", "--yes"}, 1, "nothing was deleted", "create it"},
        {{"lookup", "nobody", "--class", "2"}, 1, "code 21", "check identifier"},
        {{"--json", "lookup", "nobody", "--class", "2"}, 1, "\"code\": 21", "\"exitCode\": 1"},
        {{"replace", "a.b", "--class", "2", "--yes"}, 1, "no transient container", "transient"},
        {{"why", "--group", "nobodys"}, 1, "nobody is registered", "entitlements list"},
        {{"create", "a.b", "--class", "2", "--user", "99"}, 9, "code 38", "501 to 510"},
        {{"protect", "a.b", "2", "--class", "2"}, 9, "code 38", "0, 1 or 3"},
        {{"--root", "/", "--json", "lock-state", "1"}, 2, "the device's to set", "--root"},
        {{"--json", "entitlements", "set", "a.b", "--from", "/nowhere"}, 2, "cannot be read", "JSON object"},
        {{"install", "a.b", "-", "--class", "2", "--yes"}, 2, "standard input", "archive"},
        {{"--root", "/nowhere", "--json", "list", "--class", "2"}, 3, "\"unreachable\"", "--root"},
    };
    for (const ToolCall& row : rows)
        expectCall(daemon, row);
    const std::string allowed = "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key>";
    const std::tuple<std::string, int, const char*> entries[] = {
        {allowed + "<string>yes</string></dict>", 4, "is the string \"yes\", which grants nothing: write <true/>"},
        {allowed + "<true/></dict>", 0, "it gives power, and has no \"UserIDs\""},
        {"<key>Unti</key><string>a</string>", 4, "line 3, column 1: \"Unti\" is not a key of this file"},
        {"<key>Unit</key", 4, "line 3, column"},
    };
    for (const auto& [entry, exitStatus, says] : entries)
        expectCall(daemon, {{"registry", "check", registered(entry)}, exitStatus, says});
    expectCall(daemon, {{"--json", "registry", "check", registered("")}, 0, "\"remarks\""});
    expectCall(daemon, {{"registry", "who", "/bin/true"}, 1, "no file that counts names", "registry list"});
    writeFile(daemon.path("etc/zorvane/identities.d/50-bad.plist"), "no list", 0666);
    expectCall(daemon,
               {{"registry", "list"}, 4, "50-bad.plist\n  it does not count: can be written to by others", "2 of 3"});
    expectCall(daemon, {{"lock-state", "1"}, 0, "locked"});
    expectCall(daemon, {{"protect", "a.b", "1", "--class", "2", "--fail-if-locked"}, 9, "code 61", "unlock it"});
    for (const std::string& says :
         {"no entry names " + stranger, std::string("knows this program as org.example.30-stranger, but")}) {
        expectOutcome(runProgram({stranger, "--root", daemon.root(), "list", "--all"}), 6, says);
        daemon.registerProgram("30-stranger", stranger, "");
    }
    const auto full = runProgram({"/bin/sh", "-c", programPath("zorvanectl") + " --help >/dev/full"});
    EXPECT_EQ(full.exitStatus, 8) << full.output;
    ::kill(daemon.pid(), SIGSTOP);
    expectCall(daemon, {{"--timeout", "200", "list", "--all"}, 7, "is stopped", "kill -CONT"});
    ::kill(daemon.pid(), SIGCONT);
}

/// The words that a shell may put after these.
std::vector<std::string> completed(const DaemonProcess& daemon, std::vector<std::string> words, const char* typed) {
    words.insert(words.begin(), {programPath("zorvanectl"), "__complete", "--root", daemon.root()});
    words.emplace_back(typed);
    std::vector<std::string> found;
    std::istringstream lines(runProgram(words).output);
    for (std::string line; std::getline(lines, line);)
        found.push_back(line.substr(0, line.find('\t')));
    return found;
}

// Goal: help, manual page, completion and schemas speak of the same commands and options, the operator's page of all
// findings, and completion knows what is there, and no word that a shell would run. Method: what completion offers,
// command by command, looked up in the others; what is explained, looked up in the page.
TEST(Tool, HelpPageCompletionAndSchemasAgree) {
    DaemonProcess daemon;
    daemon.start();
    std::string page = readFile(packagingPath("man/zorvanectl.1"));
    std::erase(page, '\\');
    const auto schemas = nlohmann::json::parse(readFile(packagingPath("schema/zorvanectl.schema.json")))["$defs"];
    std::set<std::string> printing;
    std::vector<std::vector<std::string>> left = {{}};
    while (!left.empty()) {
        const std::vector<std::string> words = std::move(left.back());
        left.pop_back();
        std::string name;
        for (const std::string& word : words)
            name += (name.empty() ? "" : " ") + word;
        SCOPED_TRACE(name);
        std::vector<std::string> asking = {"help"};
        asking.insert(asking.end(), words.begin(), words.end());
        const std::string help = daemon.tool(asking).output + daemon.tool({"--help"}).output;
        for (const std::string& option : completed(daemon, words, "--")) {
            EXPECT_NE(help.find(option), std::string::npos) << option;
            EXPECT_NE(page.find(option), std::string::npos) << option;
        }
        const auto commands = completed(daemon, words, "");
        const bool isGroup = words.empty() || name == "info" || name == "entitlements" || name == "registry";
        for (std::size_t i = 0; isGroup && i < commands.size(); ++i) {
            left.push_back(words);
            left.back().push_back(commands[i]);
        }
        if (isGroup || name == "help")
            continue;
        EXPECT_NE(page.find(name), std::string::npos);
        printing.insert(name);
    }
    std::set<std::string> described = {"error"};
    for (const auto& [name, schema] : schemas.items())
        described.insert(name);
    printing.insert("error");
    EXPECT_EQ(printing, described);
    std::string operation = readFile(packagingPath("man/zorvane-operation.7"));
    std::erase(operation, '\\');
    for (const auto& code : nlohmann::json::parse(daemon.tool({"--json", "explain"}).output)["codes"]) {
        if (!code["code"].is_string())
            continue; // no finding
        for (const std::string& text :
             {".B " + code["code"].get<std::string>() + "\n", code["whatToDo"].get<std::string>().substr(1) + ".\n"})
            EXPECT_NE(operation.find(text), std::string::npos) << text;
    }
    expectCall(daemon, {{"create", "org.plain", "--class", "2"}, 0, "created"});
    expectCall(daemon, {{"create", "$(touch x)", "--class", "2"}, 0, "created"});
    expectCall(daemon, {{"entitlements", "set", "a.b", "--app-group", "group.a"}, 0, "registered"});
    using Completions = std::vector<std::string>;
    EXPECT_EQ(completed(daemon, {"lookup"}, ""), Completions{"org.plain"});
    EXPECT_EQ(completed(daemon, {"why", "-g"}, "gr"), Completions{"group.a"});
    const auto shell =
        runProgram({"/bin/bash", "-c",
                    "PATH=" + programPath("") + ":$PATH; . " + packagingPath("completions/zorvanectl.bash") +
                        "; COMP_WORDS=(zorvanectl --root " + daemon.root() +
                        " lookup org); COMP_CWORD=4; _zorvanectl; echo \"${COMPREPLY[@]}\""});
    EXPECT_EQ(shell.output, "org.plain\n");
}

// Goal: what the daemon shows and a full disk did not take is found, until it is saved. Method: a small file system.
TEST(Tool, FindsInfoThatIsNotSaved) {
    const support::TemporaryDirectory disk("/dev/shm");
    if (::mount("small", disk.path().c_str(), "tmpfs", 0, "mode=0755,size=1m") != 0)
        GTEST_SKIP() << "needs root: a file system of its own";
    {
        DaemonProcess daemon(DaemonProcess::Syncs::off, disk.path());
        daemon.start();
        zorvane::Client client = daemon.client();
        const auto made = client.createOrLookup(dataContainer("a")).value();
        const auto set = [&] { return client.setInfoValue({dataApplication, mobile, "a", made.uuid}, "k", {{true}}); };
        std::ofstream filler(disk.path() + "/filler");
        while (filler << 'x' << std::flush) {
        }
        const auto refused = set();
        EXPECT_TRUE(!refused && refused.error().code == 34);
        expectCall(daemon, {{"--json", "check"}, 4, "info-unsaved"});
        filler.close();
        std::filesystem::remove(disk.path() + "/filler");
        EXPECT_TRUE(set());
        expectCall(daemon, {{"--json", "check"}, 0, "\"findings\": []"});
    }
    ::umount2(disk.path().c_str(), MNT_DETACH);
}

// Goal: damage is found, told and mended as promised, with a daemon and without one. Method: a table of calls over a
// store whose container lost a directory, then over one whose daemon was killed.
TEST(Tool, ChecksAndRepairs) {
    DaemonProcess daemon;
    daemon.start();
    expectCall(daemon, {{"create", "a.b", "--class", "data-app", "--user", "501"}, 0, "created"});
    expectCall(daemon, {{"--json", "check"}, 0, "\"findings\": []"});
    const std::string documents = daemon.client().createOrLookup(dataContainer("a.b")).value().path + "/Documents";
    std::filesystem::remove(documents);
    expectCall(daemon, {{"check"}, 4, "subdirectory-missing"});
    expectCall(daemon, {{"--json", "check"}, 4, "\"code\": \"subdirectory-missing\""});
    expectCall(daemon, {{"check", "--repair", "--dry-run"}, 4, "of a.b in Data/Application are made again"});
    EXPECT_FALSE(std::filesystem::exists(documents));
    expectCall(daemon, {{"check", "--repair"}, 0, "of a.b in Data/Application are made again"});
    EXPECT_TRUE(std::filesystem::exists(documents));
    expectCall(daemon, {{"explain", "subdirectory-missing"}, 0, "Consequence"});
    expectCall(daemon, {{"check", "--dry-run"}, 2, "--repair"});
    expectCall(daemon, {{"--root", "/nowhere", "--json", "check"}, 5, "\"local\""});
    // Beside a copy, in whichever order the directory lists them, the one that is served stays.
    const std::string live = std::filesystem::path(documents).parent_path();
    const std::string copy = live.substr(0, live.rfind('/')) + "/01234567-89AB-4DEF-8123-456789ABCDEF";
    for (const bool copyIsNewer : {false, true}) {
        std::filesystem::rename(live, copy);
        ASSERT_EQ(runProgram({"/bin/cp", "-a", copy, live}).exitStatus, 0);
        if (copyIsNewer) {
            std::filesystem::rename(copy, copy + "x");
            ASSERT_EQ(runProgram({"/bin/cp", "-a", copy + "x", copy}).exitStatus, 0);
            std::filesystem::remove_all(copy + "x");
        }
        const auto checked = daemon.tool({"check"});
        EXPECT_NE(checked.output.find("which clients are given"), std::string::npos) << checked.output;
        const std::size_t command = checked.output.find("(cd -P");
        ASSERT_NE(command, std::string::npos) << checked.output;
        EXPECT_EQ(std::system(checked.output.substr(command, checked.output.find('\n', command) - command).c_str()), 0);
        EXPECT_TRUE(std::filesystem::exists(live));
        EXPECT_EQ(daemon.client().createOrLookup(dataContainer("a.b")).value().path, live);
    }
    daemon.kill();
    expectCall(daemon, {{"check"}, 0, "The store is whole"});
    std::filesystem::remove(documents);
    expectCall(daemon, {{"check", "--repair"}, 3, "cannot reach"});
}

} // namespace zor::whole
