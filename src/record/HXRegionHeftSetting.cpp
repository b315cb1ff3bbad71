#include "record/HXRegionHeftSetting.h"

HXRegionHeftSetting::HXRegionHeftSetting(HXPlatform &host) : _host(host) {
    size_t bytes = sizeof _current;
    if (_host.sysctlbyname(kSelfRegionHeftSetting, &_current, &bytes, nullptr, 0) == 0 &&
        bytes == sizeof _current)
        _found = _current;
}

HXRegionHeftSetting::~HXRegionHeftSetting() {
    if (_found) set(*_found);
}

void HXRegionHeftSetting::set(int32_t value) {
    if (!_found || value == _current) return;
    if (_host.sysctlbyname(kSelfRegionHeftSetting, nullptr, nullptr, &value, sizeof value) == 0)
        _current = value;
}
