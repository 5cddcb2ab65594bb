#pragma once

#include "platform/HTPlatform.h"

#include <memory>

// The program: parses the command line, sets the analysis mode, checks
// privileges and selects the target processes on `platform`. Returns the
// exit status: 0 for a run (and for help), 1 for every failure before the
// analysis.
int heftMain(int argc, char** argv, const std::shared_ptr<HTPlatform>& platform);
