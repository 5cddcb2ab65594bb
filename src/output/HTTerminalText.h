#pragma once

#include <string>
#include <string_view>

// Names and paths come from other users' processes and files: a process
// can name itself with a line feed, a tab or a terminal escape sequence.
// The text report shows them with control characters and bytes that are
// not UTF-8 written out as escapes ("\n", "\t", "\r", "\xNN"), so that no
// name can split a line of the report or drive the reader's terminal.
// Other text, valid UTF-8 included, passes unchanged.

// Appends `text` to `out`, escaped.
void htAppendTerminalSafe(std::string& out, std::string_view text);

// `text`, escaped.
std::string htTerminalSafe(std::string_view text);
