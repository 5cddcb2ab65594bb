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
