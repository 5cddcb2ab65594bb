#pragma once

#include <cstdint>
#include <optional>
#include <string>

// An error object: a domain, a signed code and an optional description
// (the text a user is shown).
struct HTError {
    std::string domain;
    int64_t code = 0;
    std::optional<std::string> description;

    HTError() = default;
    HTError(std::string errorDomain, int64_t errorCode, std::optional<std::string> text = std::nullopt)
        : domain(std::move(errorDomain)), code(errorCode), description(std::move(text))
    {
    }
};

inline constexpr const char* HTHeftErrorDomain = "HTHeftError";
inline constexpr const char* HeftErrorDomain = "HeftErrorDomain";

// Codes of the "HTHeftError" domain: command-line and target-selection
// failures.
enum : int64_t {
    HTHeftErrorCodeCreation = 0,      // the arguments object could not be made
    HTHeftErrorCodeHelp = 1,          // -h / --help: usage, status 0
    HTHeftErrorCodeFormat = 2,        // bad -f / --format value
    HTHeftErrorCodeSort = 3,          // bad --sort value
    HTHeftErrorCodePid = 4,           // --pid value without digits
    HTHeftErrorCodeOption = 5,        // unknown option or missing argument
    HTHeftErrorCodeSnapfileMode = 6,  // snapfiles disagree on the analysis mode
    HTHeftErrorCodeSnapfileOpen = 7,  // an existing file that is no snapfile and no process
    HTHeftErrorCodeNoTarget = 8,      // nothing to analyse
};
