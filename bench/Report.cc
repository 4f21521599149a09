// SPDX-License-Identifier: Apache-2.0
#include "Report.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sched.h>
#include <sys/utsname.h>

namespace zor::bench {

namespace {

std::string number(double value, const std::string& unit) {
    std::string shown = text(value < 100 ? "%.2f" : "%.0f", value);
    if (unit.empty() || unit == "x")
        return shown + unit;
    return shown + " " + unit;
}

std::string goalOf(const Figure& figure) {
    const int decimals = figure.goal == static_cast<int>(figure.goal) && figure.unit != "x" ? 0 : 2;
    std::string shown = text("%.*f", decimals, figure.goal);
    if (decimals > 0 && shown.ends_with('0'))
        shown.pop_back();
    return (figure.sense == Sense::atMost ? "<= " : ">= ") + shown +
           (figure.unit.empty() || figure.unit == "x" ? figure.unit : " " + figure.unit);
}

} // namespace

std::string text(const char* format, ...) {
    char buffer[512];
    va_list arguments;
    va_start(arguments, format);
    std::vsnprintf(buffer, sizeof buffer, format, arguments);
    va_end(arguments);
    return buffer;
}

bool Figure::met() const {
    return value && (sense == Sense::atMost ? *value <= goal : *value >= goal);
}

const char* Figure::verdict() const {
    if (!value)
        return "not measured";
    return met() ? "met" : "missed";
}

Machine Machine::here() {
    Machine machine;
    std::ifstream processors("/proc/cpuinfo");
    for (std::string line; machine.processor.empty() && std::getline(processors, line);)
        if (line.starts_with("model name") && line.find(": ") != std::string::npos)
            machine.processor = line.substr(line.find(": ") + 2);
    cpu_set_t allowed;
    if (::sched_getaffinity(0, sizeof allowed, &allowed) == 0)
        machine.processors = static_cast<unsigned>(CPU_COUNT(&allowed));
    utsname kernel{};
    if (::uname(&kernel) == 0)
        machine.kernel = std::string(kernel.sysname) + " " + kernel.release;
    if (::getloadavg(&machine.loadBefore, 1) != 1)
        machine.loadBefore = 0;
    return machine;
}

void printTable(const Machine& machine, const std::vector<Figure>& figures) {
    std::printf("\n%s, %u processors, %s, load before the run %.2f\n\n", machine.processor.c_str(), machine.processors,
                machine.kernel.c_str(), machine.loadBefore);
    // As Markdown takes it: docs/performance.md holds the last such table.
    const auto row = [](const char* what, const std::string& measured, const std::string& floor,
                        const std::string& value, const std::string& goal, const char* verdict) {
        std::printf("| %-48s | %12s | %12s | %11s | %12s | %-7s |\n", what, measured.c_str(), floor.c_str(),
                    value.c_str(), goal.c_str(), verdict);
    };
    row("Figure", "Measured", "Floor", "Value", "Goal", "Verdict");
    std::printf("|:%s|%s:|%s:|%s:|%s:|:%s|\n", std::string(49, '-').c_str(), std::string(13, '-').c_str(),
                std::string(13, '-').c_str(), std::string(12, '-').c_str(), std::string(13, '-').c_str(),
                std::string(8, '-').c_str());
    for (const Figure& figure : figures)
        row(figure.what.c_str(), figure.measured, figure.floor,
            figure.value ? number(*figure.value, figure.unit) : std::string("-"), goalOf(figure), figure.verdict());
    std::printf("\n");
    for (const Figure& figure : figures)
        if (!figure.remark.empty())
            std::printf("- %s: %s\n", figure.what.c_str(), figure.remark.c_str());
}

bool writeJson(const std::string& path, const Machine& machine, bool quick, const std::vector<Figure>& figures) {
    nlohmann::json list = nlohmann::json::array();
    for (const Figure& figure : figures) {
        nlohmann::json entry = {{"name", figure.name},
                                {"what", figure.what},
                                {"measured", figure.measured},
                                {"floor", figure.floor},
                                {"unit", figure.unit},
                                {"goal", figure.goal},
                                {"sense", figure.sense == Sense::atMost ? "at most" : "at least"},
                                {"verdict", figure.verdict()},
                                {"remark", figure.remark},
                                {"numbers", figure.numbers}};
        entry["value"] = figure.value ? nlohmann::json(*figure.value) : nlohmann::json();
        list.push_back(std::move(entry));
    }
    const nlohmann::json whole = {{"machine",
                                   {{"processor", machine.processor},
                                    {"processors", machine.processors},
                                    {"kernel", machine.kernel},
                                    {"loadBefore", machine.loadBefore}}},
                                  {"quick", quick},
                                  {"figures", std::move(list)}};
    std::ofstream file(path, std::ios::trunc);
    file << whole.dump(2) << '\n';
    file.close();
    if (!file)
        std::fprintf(stderr, "zorvane-bench: cannot write %s\n", path.c_str());
    return static_cast<bool>(file);
}

} // namespace zor::bench
