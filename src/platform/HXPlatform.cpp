#include "platform/HXPlatform.h"

#include "platform/HXInternalError.h"

static HXPlatform *currentPlatform = nullptr;

void HXCutRuns(uint64_t end, uint64_t pageSize, std::vector<vm_page_run> *runs) {
    while (!runs->empty() && runs->back().address >= end)
        runs->pop_back();
    if (!runs->empty() && runs->back().end(pageSize) > end)
        runs->back().pages = (end - runs->back().address) / pageSize;
}

HXPlatform &HXPlatform::current() {
    HXRequire(currentPlatform != nullptr, "HXPlatform current", "a platform was set");
    return *currentPlatform;
}

void HXPlatform::setCurrent(HXPlatform *platform) {
    currentPlatform = platform;
}

std::string HXPlatform::hostDescription() {
#if defined(__x86_64__)
    return "X86-64";
#elif defined(__aarch64__)
    return "ARM64";
#else
    return "unknown architecture";
#endif
}

void HXPlatform::mach_error(const char *label, kern_return_t error) {
    std::fprintf(stderr, "%s: %s\n", label, mach_error_string(error));
}

const char *HXPlatform::mach_error_string(kern_return_t error) {
    static constexpr struct {
        kern_return_t error;
        const char *text;
    } texts[] = {
        {KERN_SUCCESS, "(os/kern) successful"},
        {KERN_INVALID_ADDRESS, "(os/kern) invalid address"},
        {KERN_PROTECTION_FAILURE, "(os/kern) protection failure"},
        {KERN_NO_SPACE, "(os/kern) no space available"},
        {KERN_INVALID_ARGUMENT, "(os/kern) invalid argument"},
        {KERN_FAILURE, "(os/kern) failure"},
        {KERN_RESOURCE_SHORTAGE, "(os/kern) resource shortage"},
        {KERN_NO_ACCESS, "(os/kern) no access"},
        {MACH_SEND_INVALID_DEST, "(ipc/send) invalid destination port"},
    };
    for (const auto &entry : texts)
        if (entry.error == error) return entry.text;
    return "unknown error code";
}
