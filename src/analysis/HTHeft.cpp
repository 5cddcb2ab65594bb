#include "analysis/HTHeft.h"

#include <atomic>
#include <cerrno>
#include <cstdio>

namespace {

enum : int { SwitchUnknown = 0, SwitchOff = 1, SwitchOn = 2 };

// Read from gathering threads after a write from the main thread: every
// reader computes the same answer, so a relaxed atomic suffices.
std::atomic<int> breakDownPhysHeftState{SwitchUnknown};
std::atomic<bool> sharingAnalysisDisabled{false};

constexpr const char* kSelfRegionHeft = "vm.self_region_heft";

}  // namespace

bool HTHeft::breakDownPhysHeft(HTPlatform& platform)
{
    int state = breakDownPhysHeftState.load(std::memory_order_relaxed);
    if (state != SwitchUnknown) return state == SwitchOn;

    int32_t value = 0;
    size_t length = sizeof(value);
    if (platform.sysctlbyname(kSelfRegionHeft, &value, &length, nullptr, 0) != 0) {
        if (errno != ENOENT) std::perror("Unable to retrieve status of physical heft data collection");
        value = 0;
    }
    state = value != 0 ? SwitchOn : SwitchOff;
    breakDownPhysHeftState.store(state, std::memory_order_relaxed);
    return state == SwitchOn;
}

void HTHeft::setBreakDownPhysHeft(HTPlatform& platform, bool enabled)
{
    int32_t value = enabled ? 1 : 0;
    if (platform.sysctlbyname(kSelfRegionHeft, nullptr, nullptr, &value, sizeof(value)) != 0 && errno != ENOENT)
        std::perror("Unable to configure physical heft data collection");
    // The next read asks the kernel what it really holds.
    breakDownPhysHeftState.store(SwitchUnknown, std::memory_order_relaxed);
}

bool HTHeft::isSharingAnalysisDisabled()
{
    return sharingAnalysisDisabled.load(std::memory_order_relaxed);
}

void HTHeft::setSharingAnalysisDisabled(bool disabled)
{
    sharingAnalysisDisabled.store(disabled, std::memory_order_relaxed);
}
