#pragma once

// Broken internal preconditions stop the program here. No input may reach
// one: bad input becomes an error or a warning in the report instead.
[[noreturn]] void htAssertFailed(const char* module, const char* condition, const char* file, int line);

// Stops the program when `condition` is false, naming the module and the
// condition as the design states it (which may differ from the C++ text).
#define HT_ASSERT(module, condition, text)                                      \
    do {                                                                        \
        if (!(condition)) htAssertFailed((module), (text), __FILE__, __LINE__); \
    } while (0)

// Stops the program unconditionally: a state that no input can produce.
#define HT_FATAL(module, text) htAssertFailed((module), (text), __FILE__, __LINE__)
