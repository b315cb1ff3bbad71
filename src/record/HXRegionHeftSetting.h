// The kernel setting "vm.self_region_heft" while something is recorded.
#pragma once

#include "platform/HXPlatform.h"

#include <cstdint>
#include <optional>

// Remembers the setting and puts it back in the end.
class HXRegionHeftSetting {
  public:
    explicit HXRegionHeftSetting(HXPlatform &host);
    ~HXRegionHeftSetting();
    HXRegionHeftSetting(const HXRegionHeftSetting &) = delete;
    HXRegionHeftSetting &operator=(const HXRegionHeftSetting &) = delete;

    // The setting as it was found; none when the kernel lacks it.
    const std::optional<int32_t> &found() const { return _found; }
    // Changes it, if the kernel has it.
    void set(int32_t value);

  private:
    HXPlatform &_host;
    std::optional<int32_t> _found;
    int32_t _current = 0;
};
