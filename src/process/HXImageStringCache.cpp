#include "process/HXImageStringCache.h"

HXString HXStringSlots::find(size_t firstSlot, std::string_view text) {
    HXString made;
    for (size_t probe = 0; probe < _probeCount; probe++) {
        std::atomic<const std::string *> &slot = _slots[(firstSlot + probe) % _slots.size()];
        const std::string *held = slot.load(std::memory_order_acquire);
        if (!held) {
            if (!made) made = HXString::intern(text);
            if (slot.compare_exchange_strong(held, made._string, std::memory_order_release,
                                             std::memory_order_acquire))
                return made;
        }
        // Here `held` is another string's, this text's, or what another thread stored meanwhile.
        if (*held == text) return HXString(held);
    }
    return made ? made : HXString::intern(text);
}

HXString HXSharedImagePath(uint64_t baseAddress, std::string_view path) {
    static HXStringSlots slots(2047, 18);
    const uint64_t key = baseAddress ^ (baseAddress >> 8) ^ (baseAddress >> 16) ^ (baseAddress >> 24);
    return slots.find(key % 2047, path);
}

HXString HXSegmentName(std::string_view name) {
    static HXStringSlots slots(16, 16);
    return slots.find(0, name);
}
