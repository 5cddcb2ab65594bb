#pragma once

#include "process/HTUserProcess.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

// A process analysed at its death: its address space, frozen, read through
// a task port on the corpse rather than on the live process. The walk and
// the accounting are a live process's; what the dead process can no longer
// be asked (its name, its flags, its idle-exit state, its page tables) is
// handed in by whoever holds the corpse.
class HTCorpseProcess : public HTUserProcess {
public:
    explicit HTCorpseProcess(std::shared_ptr<HTPlatform> platform);
    ~HTCorpseProcess() override;

    // Takes the corpse port and the dead process's identity: `dirtyFlags`
    // as proc_get_dirty reported them, `procFlags` the kernel's process
    // flags (P_LP64...). False when there is no port. The run's settings
    // are to be set first.
    bool initWithCorpse(std::shared_ptr<HTTaskPort> corpse, int32_t pid, const std::string& name, uint32_t dirtyFlags,
                        uint32_t procFlags);
    // The dead process's ledger values; only the first, the page tables'
    // bytes, is kept.
    void addLedgerData(const uint64_t* values, size_t count);

    // The record flags (pbi_flags) that the kernel's process flags stand
    // for; flags without a counterpart are dropped.
    static uint32_t recordFlagsForProcFlags(uint32_t procFlags);

    // --- replaced steps of a live process ------------------------------
    bool _populateTask() override { return task() != nullptr; }
    // Nothing is asked of the live process: not its usage, not its
    // ledgers, not its mapped files' paths.
    bool _isAlive() override { return false; }

protected:
    // The idle-exit state comes from the flags handed in.
    void _gatherIdleExitStatus() override {}
    std::optional<HTOwnedVmObjectMap> _gatherOwnedVmObjects() override { return std::nullopt; }
};
