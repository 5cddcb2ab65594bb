#pragma once

#include "platform/HTPlatform.h"

// The analysis driver. For now: the two class-level switches that change
// how memory is counted, read by the model and the process sources.
class HTHeft {
public:
    // Whether the kernel reports per-region physical heft for this program
    // (the breakdown mode). The value lives in the kernel setting
    // "vm.self_region_heft"; the class caches what it last read.
    static bool breakDownPhysHeft(HTPlatform& platform);
    static void setBreakDownPhysHeft(HTPlatform& platform, bool enabled);

    // When on, regions join their memory objects without their process, so
    // that no per-process views arise.
    static bool isSharingAnalysisDisabled();
    static void setSharingAnalysisDisabled(bool disabled);
};
