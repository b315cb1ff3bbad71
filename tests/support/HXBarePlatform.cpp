#include "support/HXBarePlatform.h"

#include <cerrno>
#include <cstring>
#include <getopt.h>

int32_t HXBarePlatform::sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                                     size_t newBytes) {
    errno = ENOENT;
    if (std::strcmp(name, "vm.self_region_heft") != 0) return -1;
    if (settingError != 0) {
        errno = settingError;
        return -1;
    }
    if (!selfRegionHeft) return -1;
    if (old != nullptr) {
        settingReads++;
        std::memcpy(old, &*selfRegionHeft, *oldBytes = sizeof *selfRegionHeft);
    }
    if (newValue != nullptr && newBytes == sizeof *selfRegionHeft)
        std::memcpy(&*selfRegionHeft, newValue, newBytes);
    return 0;
}

std::optional<std::string>
HXBarePlatform::GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t, int32_t, uint8_t) {
    if (tag == 100) return "heap";
    if (tag == 101) return "Memory Tag 101";
    return std::nullopt;
}

HXOptionScan HXBarePlatform::getopt_long(int argc, char *const argv[], const char *shortOptions,
                                         const std::vector<HXLongOption> &options, bool restart) {
    std::vector<option> table;
    for (const HXLongOption &each : options)
        table.push_back(
            {each.name, each.hasArgument ? required_argument : no_argument, each.flag, each.value});
    table.push_back({});
    if (restart) optind = 0;
    HXOptionScan scan;
    scan.result = ::getopt_long(argc, argv, shortOptions, table.data(), nullptr);
    scan.argument = optarg;
    scan.index = optind;
    return scan;
}
