#pragma once

// Scenario lines that script the kernel's memory on the fake platform, for
// the scenario tests of processes and of whole reports; written as
// tests/data/reports/processes/README.md says.

#include "output/HTExpectedReport.h"
#include "platform/fake/HTFakePlatform.h"

#include <map>
#include <sstream>
#include <string>

// Applies the line if it is one of the kernel's.
inline void scriptKernel(HTFakePlatform& platform, const HTScenarioLine& line)
{
    // clang-format off
    static const std::map<std::string, uint64_t> kWords = {{"tag", VM_KERN_SITE_TAG}, {"kmod", VM_KERN_SITE_KMOD},
        {"code", VM_KERN_SITE_KERNEL}, {"counter", VM_KERN_SITE_COUNTER}, {"wired", VM_KERN_SITE_WIRED},
        {"hide", VM_KERN_SITE_HIDE}, {"named", VM_KERN_SITE_NAMED}, {"zone", VM_KERN_SITE_ZONE},
        {"swappable", HT_KERN_SITE_SWAPPABLE},
        {"failure", KERN_FAILURE}, {"noaccess", HT_KERN_ERRNO_BASE | EACCES},
        {"notpermitted", HT_KERN_ERRNO_BASE | EPERM}};
    // clang-format on
    auto value = [](const std::string& word) {
        auto found = kWords.find(word);
        return found != kWords.end() ? found->second : std::stoull(word, nullptr, 0);
    };
    if (line.kind == "zone") {
        mach_zone_info_t zone{};
        zone.mzi_count = line.number("count");
        zone.mzi_cur_size = line.number("cur");
        zone.mzi_elem_size = line.number("elem");
        zone.mzi_collectable = line.number("collectable");
        platform.addZone(line.argument, zone);
    } else if (line.kind == "site") {
        uint64_t flags = value(line.argument);
        std::istringstream bits(line.text("bits").value_or(""));
        for (std::string bit; std::getline(bits, bit, ',');) flags |= value(bit);
        mach_memory_info_t& info =
            platform.addMemoryInfo(flags, line.number("id"), line.number("size"), line.text("name").value_or(""));
        info.mapped = line.number("mapped");
        info.zone = static_cast<uint16_t>(line.number("zone"));
    } else if (line.kind == "module") {
        platform.loadedModules.push_back({line.text("name").value_or(""), std::stoull(line.argument, nullptr, 0)});
    } else if (line.kind == "symbol") {
        const uint64_t address = std::stoull(line.argument, nullptr, 0);
        if (auto name = line.text("name")) platform.kernelSymbols[address] = *name;
        if (auto path = line.text("path"))
            platform.kernelSourceInfos[address] = {*path, static_cast<int32_t>(line.number("line"))};
    } else if (line.kind == "kernel-memory") {
        platform.memoryInfoResult = static_cast<kern_return_t>(value(line.text("fail").value_or("0")));
        platform.hasKernelSymbols = line.number("symbols", 1);
    }
}
