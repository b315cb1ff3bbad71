#include "platform/capture/HXStringTable.h"

#include <algorithm>
#include <cstring>
#include <functional>

std::string_view HXStringTable::view(const char *stored) {
    uint32_t length = 0;
    std::memcpy(&length, stored, sizeof length);
    return {stored + sizeof length, length};
}

uint32_t HXStringTable::add(std::string_view text) {
    if (_slots.size() * 3 <= _strings.size() * 4) growSlots();
    const size_t mask = _slots.size() - 1;
    size_t slot = std::hash<std::string_view>()(text) & mask;
    for (; _slots[slot] != 0; slot = (slot + 1) & mask)
        if (view(_strings[_slots[slot] - 1]) == text) return _slots[slot] - 1;
    _strings.push_back(store(text));
    _slots[slot] = static_cast<uint32_t>(_strings.size());
    return _slots[slot] - 1;
}

const char *HXStringTable::store(std::string_view text) {
    constexpr size_t blockBytes = size_t{16} * 1024;
    const uint32_t length = static_cast<uint32_t>(text.size());
    const size_t bytes = sizeof length + text.size() + 1;
    if (bytes > _freeBytes) {
        _freeBytes = std::max(blockBytes, bytes);
        _blocks.push_back(std::make_unique<char[]>(_freeBytes));
        _free = _blocks.back().get();
    }
    char *const stored = _free;
    std::memcpy(stored, &length, sizeof length);
    std::copy(text.begin(), text.end(), stored + sizeof length);
    _free += bytes;
    _freeBytes -= bytes;
    return stored;
}

void HXStringTable::growSlots() {
    _slots.assign(std::max<size_t>(64, _slots.size() * 2), 0);
    const size_t mask = _slots.size() - 1;
    for (uint32_t number = 0; number < _strings.size(); number++) {
        size_t slot = std::hash<std::string_view>()(view(_strings[number])) & mask;
        while (_slots[slot] != 0)
            slot = (slot + 1) & mask;
        _slots[slot] = number + 1;
    }
}
