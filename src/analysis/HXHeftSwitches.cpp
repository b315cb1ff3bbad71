#include "analysis/HXHeftSwitches.h"

#include "platform/HXPlatform.h"

#include <atomic>
#include <cerrno>
#include <cstdio>

namespace {

enum class Cached { unknown, no, yes };

constexpr char kSetting[] = "vm.self_region_heft";
std::atomic<Cached> cachedBreakDown{Cached::unknown};
// The platform that the cache was asked of (HXPlatform::generation).
std::atomic<uint64_t> cachedGeneration{0};
std::atomic<bool> sharingDisabled{false};

} // namespace

bool HXHeftSwitches::breakDownPhysHeft() {
    const uint64_t generation = HXPlatform::generation();
    const Cached cached = cachedGeneration == generation ? cachedBreakDown.load() : Cached::unknown;
    if (cached != Cached::unknown) return cached == Cached::yes;
    int32_t value = 0;
    size_t size = sizeof value;
    if (HXPlatform::current().sysctlbyname(kSetting, &value, &size, nullptr, 0) != 0) {
        if (errno != ENOENT) std::perror("Unable to retrieve status of physical heft data collection");
        value = 0;
    }
    cachedBreakDown = value != 0 ? Cached::yes : Cached::no;
    cachedGeneration = generation;
    return value != 0;
}

void HXHeftSwitches::setBreakDownPhysHeft(bool breakDown) {
    const int32_t value = breakDown ? 1 : 0;
    if (HXPlatform::current().sysctlbyname(kSetting, nullptr, nullptr, &value, sizeof value) != 0 &&
        errno != ENOENT)
        std::perror("Unable to configure physical heft data collection");
    cachedBreakDown = Cached::unknown;
}

bool HXHeftSwitches::isSharingAnalysisDisabled() {
    return sharingDisabled;
}

void HXHeftSwitches::setSharingAnalysisDisabled(bool disabled) {
    sharingDisabled = disabled;
}
