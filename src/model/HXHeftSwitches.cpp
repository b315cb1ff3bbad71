#include "model/HXHeftSwitches.h"

#include "platform/HXPlatform.h"

#include <atomic>
#include <cerrno>
#include <cstdio>

namespace {

std::atomic<bool> isDisabled{false};
std::atomic<bool> isWholeMachine{false};

} // namespace

bool HXHeftSwitches::breakDownPhysHeft() {
    HXPlatform &platform = HXPlatform::current();
    const int32_t cached = platform.cache().selfRegionHeft.load();
    if (cached >= 0) return cached != 0;
    int32_t value = 0;
    size_t size = sizeof value;
    if (platform.sysctlbyname(kSelfRegionHeftSetting, &value, &size, nullptr, 0) != 0) {
        if (errno != ENOENT) std::perror("Unable to retrieve status of physical heft data collection");
        value = 0;
    }
    platform.cache().selfRegionHeft = value != 0;
    return value != 0;
}

void HXHeftSwitches::setBreakDownPhysHeft(bool breakDown) {
    HXPlatform &platform = HXPlatform::current();
    const int32_t value = breakDown ? 1 : 0;
    if (platform.sysctlbyname(kSelfRegionHeftSetting, nullptr, nullptr, &value, sizeof value) != 0 &&
        errno != ENOENT)
        std::perror("Unable to configure physical heft data collection");
    platform.cache().selfRegionHeft = -1;
}

bool HXHeftSwitches::isSharingAnalysisDisabled() {
    return isDisabled;
}

void HXHeftSwitches::setSharingAnalysisDisabled(bool disabled) {
    isDisabled = disabled;
}

bool HXHeftSwitches::examinesWholeMachine() {
    return isWholeMachine;
}

void HXHeftSwitches::setExaminesWholeMachine(bool whole) {
    isWholeMachine = whole;
}
