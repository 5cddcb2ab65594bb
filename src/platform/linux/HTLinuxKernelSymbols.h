#pragma once

// What the kernel's memory-info answer and its symbol resolvers work from:
// the kernel's symbol table, read once and only when first needed (reading
// kallsyms costs some 40 ms of kernel time), and the source locations of the
// allocation sites of the last memory-info answer. The platform and every
// resolver it hands out share one; any thread may ask.

#include "platform/HTPlatform.h"
#include "platform/linux/HTKernelSymbolTable.h"

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

class HTLinuxKernelSymbols {
public:
    explicit HTLinuxKernelSymbols(std::string kallsymsPath) : kallsymsPath_(std::move(kallsymsPath)) {}

    // The symbol table; null when kallsyms cannot be read.
    const HTKernelSymbolTable* table();
    // Replaces the source locations, keyed by site address.
    void setSourceInfos(std::unordered_map<uint64_t, HTSourceInfo> sourceInfos);
    std::optional<HTSourceInfo> sourceInfo(uint64_t address) const;

private:
    const std::string kallsymsPath_;
    std::once_flag tableRead_;
    std::unique_ptr<const HTKernelSymbolTable> table_;
    mutable std::mutex sourceInfosMutex_;
    std::unordered_map<uint64_t, HTSourceInfo> sourceInfos_;
};
