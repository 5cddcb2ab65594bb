#include "platform/linux/HTKernelSymbolTable.h"

#include <algorithm>
#include <charconv>
#include <fcntl.h>

namespace {

// Code: text symbols, local or global, and weak symbols, which are
// functions unless marked as objects (v, V).
bool isCode(char type) { return type == 't' || type == 'T' || type == 'w' || type == 'W'; }

// Calls `found(address, name, module)` for each code symbol of the text, in
// the order listed; `module` is empty for the kernel's own code. Lines are
// "address type name" with single blanks, then "\t[module]" for module
// code; the hot loop reads them in place.
template<typename Found>
void forEachCodeSymbol(std::string_view text, Found&& found)
{
    for (size_t at = 0; at < text.size();) {
        size_t newline = text.find('\n', at);
        std::string_view line = text.substr(at, newline == std::string_view::npos ? newline : newline - at);
        at = newline == std::string_view::npos ? text.size() : newline + 1;
        uint64_t address = 0;
        auto [typeAt, error] = std::from_chars(line.data(), line.data() + line.size(), address, 16);
        size_t nameAt = static_cast<size_t>(typeAt - line.data()) + 3;
        if (error != std::errc() || nameAt >= line.size() || typeAt[0] != ' ' || typeAt[2] != ' ' || !isCode(typeAt[1]))
            continue;
        std::string_view name = line.substr(nameAt), module;
        if (size_t tab = name.find('\t'); tab != std::string_view::npos) {
            if (name.size() > tab + 2 && name.back() == ']') module = name.substr(tab + 2, name.size() - tab - 3);
            name = name.substr(0, tab);
        }
        if (!name.empty()) found(address, name, module);
    }
}

std::string displayName(std::string_view name, std::string_view module)
{
    std::string text(name);
    if (!module.empty()) text.append(" [").append(module).append("]");
    return text;
}

}  // namespace

std::unique_ptr<HTKernelSymbolTable> HTKernelSymbolTable::read(const char* path)
{
    std::unique_ptr<HTKernelSymbolTable> table(new HTKernelSymbolTable());
    if (!table->text_.readFile(AT_FDCWD, path)) return nullptr;
    table->parse();
    return table;
}

void HTKernelSymbolTable::parse()
{
    const std::string_view all = text_.view();
    entries_.reserve(all.size() / 40);
    forEachCodeSymbol(all, [&](uint64_t address, std::string_view name, std::string_view module) {
        if (name.size() > UINT16_MAX || module.size() > UINT16_MAX) return;
        entries_.push_back({address, static_cast<uint32_t>(name.data() - all.data()),
                            static_cast<uint16_t>(name.size()), static_cast<uint16_t>(module.size())});
        hidesAddresses_ = hidesAddresses_ && address == 0;
    });
    // The kernel lists its own symbols in address order and each module's
    // after them; stable, so that of symbols at one address the first listed
    // names it.
    auto byAddress = [](const Entry& a, const Entry& b) { return a.address < b.address; };
    if (!std::is_sorted(entries_.begin(), entries_.end(), byAddress))
        std::stable_sort(entries_.begin(), entries_.end(), byAddress);
}

void HTKernelSymbolTable::findAddresses(HTSymbolAddresses& wanted) const
{
    std::string moduleName;
    forEachCodeSymbol(text_.view(), [&](uint64_t address, std::string_view name, std::string_view module) {
        auto found = wanted.end();
        if (module.empty()) {
            found = wanted.find(name);
        } else {
            moduleName = displayName(name, module);
            found = wanted.find(moduleName);
        }
        if (found != wanted.end() && !found->second) found->second = address;
    });
}

std::optional<std::string> HTKernelSymbolTable::symbolName(uint64_t address) const
{
    if (hidesAddresses_) return std::nullopt;
    auto above = std::upper_bound(entries_.begin(), entries_.end(), address,
                                  [](uint64_t value, const Entry& entry) { return value < entry.address; });
    if (above == entries_.begin()) return std::nullopt;
    auto at = std::prev(above);
    while (at != entries_.begin() && std::prev(at)->address == at->address) --at;
    std::string_view name = text_.view().substr(at->nameOffset, at->nameLength);
    std::string_view module;
    if (at->moduleLength != 0) module = text_.view().substr(at->nameOffset + at->nameLength + 2, at->moduleLength);
    return displayName(name, module);
}
