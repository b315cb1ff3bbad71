#include "platform/HXRegionTags.h"
#include "platform/linux/pages/HXAddressSpaceReader.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>

#include <cstdio>

namespace {

// None for a thread that runs whenever it is looked at, has ended, or may not be examined.
std::optional<uint64_t> stackPointer(const HXDescriptor &tasks, const char *thread) {
    constexpr int tries = 3; // one that runs now mostly waits a moment later
    char name[64];
    std::snprintf(name, sizeof name, "%.20s/syscall", thread);
    char buffer[512]; // nine hexadecimal numbers
    for (int i = 0; i < tries; i++) {
        const auto text = HXReadOnce(tasks, name, buffer);
        if (!text) return std::nullopt;
        const auto pointer = HXParseStackPointer(*text);
        if (pointer) return pointer;
    }
    return std::nullopt;
}

void tagStack(uint64_t pointer, HXAddressSpace *addressSpace) {
    const size_t index = addressSpace->find(pointer);
    if (index == addressSpace->count()) return;
    HXMapping &mapping = (*addressSpace)[index];
    const bool anonymous = mapping.kind == HXPathKind::none || mapping.kind == HXPathKind::namedAnonymous;
    if (mapping.contains(pointer) && anonymous && mapping.has(HXMappingWritable))
        mapping.tag = HXHostTagStack;
}

} // namespace

void HXTagThreadStacks(const HXDescriptor &process, HXAddressSpace *addressSpace) {
    constexpr size_t threadLimit = 8192; // some tens of milliseconds
    const HXDescriptor tasks = HXOpenAt(process, "task", O_DIRECTORY);
    if (!tasks) return;
    size_t count = 0;
    HXForEachEntry(tasks, [&](const char *thread) {
        if (thread[0] < '0' || thread[0] > '9') return true;
        const auto pointer = stackPointer(tasks, thread);
        if (pointer) tagStack(*pointer, addressSpace);
        return ++count < threadLimit;
    });
}
