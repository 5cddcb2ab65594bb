#pragma once

#include <string>

// The text a printf format makes of its arguments, however long.
std::string htStringWithFormat(const char* format, ...) __attribute__((format(printf, 1, 2)));
