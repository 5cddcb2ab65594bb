#include "platform/linux/HTLinuxKernelSymbols.h"

const HTKernelSymbolTable* HTLinuxKernelSymbols::table()
{
    std::call_once(tableRead_, [this] { table_ = HTKernelSymbolTable::read(kallsymsPath_.c_str()); });
    return table_.get();
}

void HTLinuxKernelSymbols::setSourceInfos(std::unordered_map<uint64_t, HTSourceInfo> sourceInfos)
{
    std::lock_guard<std::mutex> lock(sourceInfosMutex_);
    sourceInfos_ = std::move(sourceInfos);
}

std::optional<HTSourceInfo> HTLinuxKernelSymbols::sourceInfo(uint64_t address) const
{
    std::lock_guard<std::mutex> lock(sourceInfosMutex_);
    auto found = sourceInfos_.find(address);
    if (found == sourceInfos_.end()) return std::nullopt;
    return found->second;
}
