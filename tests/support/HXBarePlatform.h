// A host with nothing on it but the analysis switch, and the real machine's command line, files and queue. It
// is the current platform while it lives.
#pragma once

#include "support/HXEmptyPlatform.h"

class HXBarePlatform : public HXEmptyPlatform {
  public:
    // "vm.self_region_heft"; none: the kernel lacks the setting. An error other than 0 fails its queries.
    std::optional<uint32_t> selfRegionHeft = 1;
    int settingError = 0;
    int settingReads = 0;

    HXBarePlatform() { setCurrent(this); }
    ~HXBarePlatform() override { setCurrent(nullptr); }

    uint32_t vm_kernel_page_size() override { return 16384; }
    bool hasSharedRegion() override { return true; }
    int32_t sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                         size_t newBytes) override;
    // Tag 100 is a heap; tag 101 has a description that tells nothing.
    std::optional<std::string> GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t, int32_t,
                                                                              uint8_t) override;
    HXOptionScan getopt_long(int argc, char *const argv[], const char *shortOptions,
                             const std::vector<HXLongOption> &options, bool restart) override;
    std::FILE *fopen(const std::string &path, const char *mode) override {
        return std::fopen(path.c_str(), mode);
    }
};
