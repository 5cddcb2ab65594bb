#pragma once

#include <cstdint>
#include <string>

// Option bits of the text report.
inline constexpr int64_t HTTextOptionWired = 1;    // show the wired column
inline constexpr int64_t HTTextOptionSwapped = 2;  // show the swapped column
inline constexpr int64_t HTTextOptionWide = 4;     // never shorten names

// How the text report writes a size.
inline constexpr int64_t HTTextFormatBytes = 0;
inline constexpr int64_t HTTextFormatFormatted = 1;
inline constexpr int64_t HTTextFormatPages = 2;

// What a run was asked to do, as far as the analysis, the processes and the
// report writers need to know it. Built once from the command line and
// handed down by value: nothing below the command line keeps a switch of its
// own.
struct HTSettings {
    // The counting mode. On (the default), each process is charged what its
    // own regions hold, region by region; off (--vmObjectDirty), a process is
    // charged every object it maps, whole.
    bool breakDownPhysHeft = true;
    // Regions join their memory objects without their process, so that no
    // per-process views arise and no pages are told apart after a fork.
    bool sharingAnalysisDisabled = false;

    // The text report: how sizes are written (HTTextFormat...), its option
    // bits (HTTextOption...) and the column its tables are sorted by.
    int64_t summaryFormat = HTTextFormatFormatted;
    int64_t textOptions = 0;
    std::string textSort = "Dirty";
    // Every process's region listing before the report.
    bool verbose = false;
    // Categories keyed by short names rather than full ones.
    bool summarize = true;

    // Where every live user process analysed is also saved as a snapfile;
    // empty for nowhere. The capture names the run, so that page identities
    // are only compared between snapfiles of one run.
    std::string snapshotDirectory{};
    std::string snapshotCapture{};
};
