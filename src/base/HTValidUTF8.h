#pragma once

#include <string>
#include <string_view>

// The text as it goes into a JSON document: unchanged when it is valid
// UTF-8, otherwise a copy in `scratch` with every byte that belongs to no
// well-formed sequence replaced by U+FFFD.
std::string_view htValidUTF8(std::string_view text, std::string& scratch);
