#include "cli/HTUsage.h"

#include "cli/HTHeftArgs.h"

#include <cctype>
#include <cstdio>
#include <string>

void printUsage()
{
    static const char* const linesBeforeSort[] = {
        "Gather memory information about a process or set of processes",
        "Usage: heft [args] [proc/pid/snapfile [proc/pid/snapfile [...]]]",
        "\t-a, --all \t\t\t\ttarget all processes",
        "\t-j, --json <file> \t\t\tprint json output to a file",
        "\t-h, --help \t\t\t\tprint this output",
        "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)",
        "\t-x, --exclude [proc/pid] \t\texclude pid or process",
        "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean",
        ("\t-v \t\t\t\t\tprint all regions and spanlist-like output of address space layout (default output is "
         "a summary)"),
        "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)",
    };
    static const char* const linesAfterSort[] = {
        "\t-w, --wide\t\t\t\tshow wide output with all columns and full paths (implies --swapped --wired)",
        "\t--swapped\t\t\t\tshow swapped/compressed column",
        "\t--wired\t\t\t\t\tshow wired column",
        "\t--vmObjectDirty\t\t\tinterpret dirty memory as viewed by VM objects in the kernel",
        "\t--unmapped\t\t\t\tsearch all processes for unmapped memory owned by the target processes",
        "\t--snapshot-dir <dir>\t\t\talso save each process analysed as a snapfile NAME.PID.heftsnap in <dir>",
        "\t--exec -- <program> [args]\t\trun the program and report its memory as it exits (last option)",
    };

    for (const char* line : linesBeforeSort) std::fprintf(stdout, "%s\n", line);
    // The default column, not the one a --sort on this command line chose.
    std::string sortColumn = HTHeftArgs::defaultSortColumn();
    for (char& c : sortColumn) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    std::fprintf(stdout, "\t--sort <column> \t\t\tchange the column used for sorting (default: %s)\n",
                 sortColumn.c_str());
    for (const char* line : linesAfterSort) std::fprintf(stdout, "%s\n", line);
}
