#include "platform/linux/HTLinuxStatusReader.h"

#include "platform/linux/HTLinuxProcessTable.h"
#include "platform/linux/HTProcBuffer.h"
#include "platform/linux/HTProcStatusParser.h"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>

bool HTLinuxStatusReader::readStatus(int32_t pid, HTProcStatus& status) const
{
    thread_local HTProcBuffer buffer;
    if (!processes_.readProcessFile(pid, "/status", buffer)) return false;
    status = htParseProcStatus(buffer.view());
    // A main thread that exited before the others has no memory lines in
    // its status, a live thread has them.
    if (!status.hasMemoryFigures() && processes_.readLiveThreadFile(pid, "status", buffer))
        status = htParseProcStatus(buffer.view());
    // A zombie's status has no memory lines: its address space is gone.
    if (!status.hasMemoryFigures()) {
        errno = ESRCH;
        return false;
    }
    return true;
}

int HTLinuxStatusReader::rusage(int32_t pid, int flavor, rusage_info_v4* info) const
{
    if (flavor != RUSAGE_INFO_V4 || info == nullptr) {
        errno = EINVAL;
        return -1;
    }
    HTProcStatus status;
    if (!readStatus(pid, status)) return -1;
    *info = rusage_info_v4{};
    info->ri_phys_heft = *status.rssAnon + *status.vmSwap + *status.vmPTE;
    // The peak resident set leaves out swap and page tables: a process with
    // much swapped out can be above its resident peak now, and a peak is
    // never below the present.
    info->ri_lifetime_max_phys_heft = std::max(*status.vmHWM, info->ri_phys_heft);
    return 0;
}

int HTLinuxStatusReader::ledgerTemplate(ledger_template_info* entries, int* count)
{
    if (count == nullptr || *count < 0 || (entries == nullptr && *count > 0)) {
        errno = EINVAL;
        return -1;
    }
    if (*count == 0) return 0;
    entries[0] = ledger_template_info{};
    std::snprintf(entries[0].lti_name, sizeof(entries[0].lti_name), "%s", "page_table");
    std::snprintf(entries[0].lti_group, sizeof(entries[0].lti_group), "%s", "physmem");
    std::snprintf(entries[0].lti_units, sizeof(entries[0].lti_units), "%s", "bytes");
    *count = 1;
    return 0;
}

int HTLinuxStatusReader::ledgerEntries(int32_t pid, ledger_entry_info* entries, int* count) const
{
    if (count == nullptr || *count < 0 || (entries == nullptr && *count > 0)) {
        errno = EINVAL;
        return -1;
    }
    HTProcStatus status;
    if (!readStatus(pid, status)) return -1;
    if (*count == 0) return 0;
    entries[0] = ledger_entry_info{};
    entries[0].lei_balance = static_cast<int64_t>(*status.vmPTE);
    entries[0].lei_credit = entries[0].lei_balance;
    entries[0].lei_limit = INT64_MAX;
    *count = 1;
    return 0;
}
