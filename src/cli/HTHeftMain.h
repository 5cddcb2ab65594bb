#pragma once

#include "platform/HTPlatform.h"

#include <memory>

// The program: parses the command line, sets the analysis mode, checks
// privileges and selects the target processes on `platform`. Returns the
// exit status: 0 for a run (and for help); 1 for every failure before the
// analysis, for a report or JSON file that could not be written whole, and
// for a run that ran out of memory.
// With `exitWhenDone`, a successful run ends the process as soon as its
// report is out, without taking apart what the analysis built: a run over
// thousands of processes holds millions of objects, which the kernel frees
// at once when the process ends.
int heftMain(int argc, char** argv, const std::shared_ptr<HTPlatform>& platform, bool exitWhenDone = false);
