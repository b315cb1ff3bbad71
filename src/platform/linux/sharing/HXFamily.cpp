#include "platform/linux/sharing/HXFamily.h"

void HXFamilyPages::addRest(HXSharerSets::Bits set, std::span<const uint32_t> layout,
                            const HXPageCount &pages) {
    const uint32_t lowest = HXSharerSets::first(set);
    HXSharerSets::forEachMember(set, [&](uint32_t member) {
        auto *&last = _lastRest[member];
        if (last == nullptr || last->first.mapping != layout[member])
            last = &*rest.try_emplace({member, layout[member]}).first;
        last->second.pages += pages;
        if (member == lowest) last->second.counted += pages;
    });
}

void HXFamilyPages::add(const HXFamilyPages &other) {
    const auto firstLayout = static_cast<uint32_t>(layouts.size() / members);
    layouts.insert(layouts.end(), other.layouts.begin(), other.layouts.end());
    for (const Count &count : other.counts) {
        const HXSharerSets::Bits set = other.sets.bits(count.set);
        const uint32_t number = sets.number(set);
        if (number == HXSharerSets::kNone)
            addRest(set, other.layout(count.layout), count.pages);
        else
            counts.push_back({firstLayout + count.layout, number, count.pages});
    }
    for (const auto &[place, entry] : other.rest) {
        rest[place].pages += entry.pages;
        rest[place].counted += entry.counted;
    }
    for (size_t i = 0; i < members; i++)
        mayBeLazilyFreed[i] |= other.mayBeLazilyFreed[i];
    for (size_t i = 0; i < members; i++)
        figures[i].insert(figures[i].end(), other.figures[i].begin(), other.figures[i].end());
    metAgain.insert(metAgain.end(), other.metAgain.begin(), other.metAgain.end());
    repeated.insert(repeated.end(), other.repeated.begin(), other.repeated.end());
}
