#include "process/HTCorpseProcess.h"

#include <cstdio>
#include <utility>

HTCorpseProcess::HTCorpseProcess(std::shared_ptr<HTPlatform> platform) : HTUserProcess(std::move(platform)) {}

HTCorpseProcess::~HTCorpseProcess() = default;

uint32_t HTCorpseProcess::recordFlagsForProcFlags(uint32_t procFlags)
{
    static constexpr std::pair<uint32_t, uint32_t> kFlags[] = {
        {P_SYSTEM, PROC_FLAG_SYSTEM}, {P_LP64, PROC_FLAG_LP64}, {P_CONTROLT, PROC_FLAG_CONTROLT},
        {P_SUGID, PROC_FLAG_PSUGID},  {P_EXEC, PROC_FLAG_EXEC}, {P_THCWD, PROC_FLAG_THCWD},
    };
    uint32_t recordFlags = 0;
    for (const auto& [procFlag, recordFlag] : kFlags)
        if (procFlags & procFlag) recordFlags |= recordFlag;
    return recordFlags;
}

bool HTCorpseProcess::initWithCorpse(std::shared_ptr<HTTaskPort> corpse, int32_t pid, const std::string& name,
                                     uint32_t dirtyFlags, uint32_t procFlags)
{
    _setTask(std::move(corpse));
    proc_bsdinfo info{};
    info.pbi_pid = static_cast<uint32_t>(pid);
    info.pbi_flags = recordFlagsForProcFlags(procFlags);
    if (!initWithBsdInfo(info)) return false;
    setName(name);
    char display[512];
    std::snprintf(display, sizeof(display), "%s [%d] (corpse)", name.c_str(), pid);
    setDisplayString(display);
    _setIdleExitStatusFromDirtyFlags(dirtyFlags);
    return true;
}

void HTCorpseProcess::addLedgerData(const uint64_t* values, size_t count)
{
    if (count >= 1) _setPageTableSize(values[0]);
}
