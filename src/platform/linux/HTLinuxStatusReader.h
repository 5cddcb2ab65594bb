#pragma once

// The per-process figures of /proc/PID/status: the resident, swapped and
// page-table memory that rusage and the ledgers report.

#include "platform/HTPlatformTypes.h"

#include <cstdint>

class HTLinuxProcessTable;
struct HTProcStatus;

class HTLinuxStatusReader {
public:
    explicit HTLinuxStatusReader(const HTLinuxProcessTable& processes) : processes_(processes) {}

    // Anonymous resident + swapped + page tables, and the peak resident set.
    int rusage(int32_t pid, int flavor, rusage_info_v4* info) const;
    // One ledger, "page_table": the bytes of the process's page tables.
    static int ledgerTemplate(ledger_template_info* entries, int* count);
    int ledgerEntries(int32_t pid, ledger_entry_info* entries, int* count) const;

private:
    // Reads the memory figures of /proc/PID/status, or of a live thread's
    // when the main thread has exited; false with errno, ESRCH for a zombie.
    bool readStatus(int32_t pid, HTProcStatus& status) const;

    const HTLinuxProcessTable& processes_;
};
