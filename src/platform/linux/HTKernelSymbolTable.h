#pragma once

// The running kernel's code symbols, read from /proc/kallsyms: one
// "address type name [\t[module]]" line a symbol, some 120,000 of them. The
// table keeps the file's text and a compact entry a code symbol pointing
// into it, sorted by address. Without the privilege to see them the kernel
// prints every address as 0: the names are there, but say nothing of where
// code lies.

#include "platform/linux/HTProcBuffer.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

// Looks up std::string keys by std::string_view, without a copy.
struct HTStringHash {
    using is_transparent = void;
    size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
};

// Function names, as symbolName spells them, to their addresses: nullopt
// while not found, 0 when found with the addresses hidden.
using HTSymbolAddresses = std::unordered_map<std::string, std::optional<uint64_t>, HTStringHash, std::equal_to<>>;

class HTKernelSymbolTable {
public:
    // Reads the table from the kallsyms file at `path`; null with errno set
    // when it cannot be read.
    static std::unique_ptr<HTKernelSymbolTable> read(const char* path);

    // The symbol whose code holds the address, the nearest at or below it,
    // spelt "name [module]" for module code; nullopt for 0, for an address
    // below every symbol, and when the addresses are hidden.
    std::optional<std::string> symbolName(uint64_t address) const;
    // Finds the code symbols of `wanted`, in one pass over the file's text:
    // of several of one name, the first listed (the kernel's own before the
    // modules', in address order).
    void findAddresses(HTSymbolAddresses& wanted) const;
    bool hidesAddresses() const { return hidesAddresses_; }

private:
    struct Entry {
        uint64_t address;
        uint32_t nameOffset;
        uint16_t nameLength;
        // The module's name follows the symbol's, after "\t[".
        uint16_t moduleLength;
    };

    HTKernelSymbolTable() = default;
    void parse();

    HTProcBuffer text_;
    std::vector<Entry> entries_;
    bool hidesAddresses_ = true;
};
