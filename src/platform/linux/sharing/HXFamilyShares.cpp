#include "platform/linux/sharing/HXFamilyShares.h"

#include <algorithm>
#include <functional>
#include <unordered_set>

namespace {

class Shares {
  public:
    Shares(const std::vector<HXFamilyTask> &tasks, HXFamilyPages pages, uint32_t pageShift,
           HXObjectIdentifiers &identifiers)
        : _tasks(tasks), _pages(std::move(pages)), _pageShift(pageShift), _identifiers(identifiers),
          _told(tasks.size()) {}

    std::vector<HXSharedPages> tell();

  private:
    // A page at several places: of each member the lowest.
    struct United {
        std::vector<uint64_t> set;
        std::vector<uint32_t> layout;
        HXPageCount page;
    };

    void forEachUnited(const std::function<void(const United &)> &each);
    void countRepeated(HXFamilyMapping place, HXPageKey key);
    void chooseExactSets();
    void addExact(uint32_t set, std::span<const uint32_t> layout, const HXPageCount &pages);
    void add(HXSharerSets::Bits bits, uint32_t set, std::span<const uint32_t> layout,
             const HXPageCount &pages);
    uint64_t tokenOf(uint32_t set);
    void tellExact();
    void tellRest();
    void share(HXFamilyMapping place, const vm_region_share &share);

    const std::vector<HXFamilyTask> &_tasks;
    HXFamilyPages _pages;
    const uint32_t _pageShift;
    HXObjectIdentifiers &_identifiers;
    std::vector<HXSharedPages> _told;
    std::vector<uint64_t> _setPages; // by set
    std::vector<bool> _isExact;
    // By set and where its lowest member has the pages: where each member has how many of them.
    std::map<std::pair<uint32_t, HXFamilyMapping>, std::map<HXFamilyMapping, HXPageCount>> _exact;
    std::unordered_set<uint64_t> _tokens;
};

std::vector<HXSharedPages> Shares::tell() {
    for (uint32_t member = 0; member < _tasks.size(); member++)
        for (const auto &[mapping, figures] : _pages.figures[member])
            _told[member].figures.push_back({mapping, figures.resident, figures.anonymous, figures.swapped});
    for (uint32_t member = 0; member < _tasks.size(); member++)
        _told[member].mayBeLazilyFreed = _pages.mayBeLazilyFreed[member] != 0;
    std::sort(_pages.repeated.begin(), _pages.repeated.end());
    chooseExactSets();
    for (const HXFamilyPages::Count &count : _pages.counts)
        add(_pages.sets.bits(count.set), count.set, _pages.layout(count.layout), count.pages);
    forEachUnited([this](const United &united) {
        add(united.set, _pages.sets.number(united.set), united.layout, united.page);
    });
    tellExact();
    tellRest();
    for (HXSharedPages &told : _told)
        std::stable_sort(told.shares.begin(), told.shares.end(),
                         [](const auto &a, const auto &b) { return a.mapping < b.mapping; });
    return std::move(_told);
}

// Calls `each` for the pages that several members have.
void Shares::forEachUnited(const std::function<void(const United &)> &each) {
    United united{std::vector<uint64_t>(_pages.sets.wordCount()),
                  std::vector<uint32_t>(_tasks.size(), HXFamilyPages::kNoMapping),
                  {}};
    const auto &all = _pages.repeated;
    for (size_t first = 0, next = 0; first < all.size(); first = next) {
        const HXPageKey key = all[first].key;
        size_t sharers = 0;
        std::fill(united.set.begin(), united.set.end(), 0);
        for (; next < all.size() && all[next].key == key; next++) {
            const HXFamilyMapping &place = all[next].place;
            if (next > first && all[next - 1].place.member == place.member) continue;
            united.set[place.member / 64] |= uint64_t{1} << (place.member % 64);
            united.layout[place.member] = place.mapping;
            sharers++;
        }
        united.page = {};
        united.page.add(key);
        if (sharers > 1) each(united);
    }
}

void Shares::countRepeated(HXFamilyMapping place, HXPageKey key) {
    auto &told = _told[place.member].repeated;
    if (told.empty() || told.back().mapping != place.mapping) told.push_back({place.mapping, 0, 0});
    (key & kSwappedKey ? told.back().swapped : told.back().resident)++;
}

void Shares::chooseExactSets() {
    const auto &all = _pages.repeated;
    for (size_t i = 1; i < all.size(); i++)
        if (all[i].key == all[i - 1].key && all[i].place.member == all[i - 1].place.member)
            countRepeated(all[i].place, all[i].key);
    forEachUnited([this](const United &united) { (void)_pages.sets.number(united.set); });
    _setPages.resize(_pages.sets.size());
    for (const HXFamilyPages::Count &count : _pages.counts)
        _setPages[count.set] += count.pages.all();
    forEachUnited([this](const United &united) {
        const uint32_t set = _pages.sets.number(united.set);
        if (set != HXSharerSets::kNone) _setPages[set]++;
    });
    std::vector<uint64_t> largest = _setPages;
    uint64_t least = 1;
    if (largest.size() > kExactSets) {
        const auto last = largest.begin() + kExactSets - 1;
        std::nth_element(largest.begin(), last, largest.end(), std::greater<>());
        least = *last;
    }
    size_t chosen = 0;
    for (const uint64_t pages : _setPages)
        chosen += pages > least;
    for (const uint64_t pages : _setPages) { // of equal ones the first
        const bool isChosen = pages > least || (pages == least && chosen++ < kExactSets);
        _isExact.push_back(isChosen || pages << _pageShift >= kExactSize);
    }
}

void Shares::add(HXSharerSets::Bits bits, uint32_t set, std::span<const uint32_t> layout,
                 const HXPageCount &pages) {
    if (set == HXSharerSets::kNone || !_isExact[set])
        _pages.addRest(bits, layout, pages);
    else
        addExact(set, layout, pages);
}

void Shares::addExact(uint32_t set, std::span<const uint32_t> layout, const HXPageCount &pages) {
    const HXSharerSets::Bits bits = _pages.sets.bits(set);
    const uint32_t lowest = HXSharerSets::first(bits);
    auto &object = _exact[{set, {lowest, layout[lowest]}}];
    HXSharerSets::forEachMember(bits, [&](uint32_t member) { object[{member, layout[member]}] += pages; });
}

// A number that no other set of the family has, and that is the same in every run.
uint64_t Shares::tokenOf(uint32_t set) {
    uint64_t token = 1; // 0 is what is not told exactly
    HXSharerSets::forEachMember(_pages.sets.bits(set), [&](uint32_t member) {
        token = (token ^ static_cast<uint32_t>(_tasks[member].task->pid())) * 0x9E3779B97F4A7C15;
        token ^= token >> 29;
    });
    while (token == 0 || !_tokens.insert(token).second)
        token++;
    return token;
}

void Shares::share(HXFamilyMapping place, const vm_region_share &share) {
    _told[place.member].shares.push_back({place.mapping, share});
}

void Shares::tellExact() {
    uint32_t lastSet = HXSharerSets::kNone;
    uint64_t token = 0;
    for (const auto &[object, places] : _exact) {
        const auto &[set, lowest] = object;
        if (set != lastSet) token = tokenOf(set);
        lastSet = set;
        const HXFamilyTask &task = _tasks[lowest.member];
        const uint64_t start = (*task.addressSpace)[lowest.mapping].start;
        const uint64_t id = _identifiers.ofShared(task.task->pid(), start, token);
        for (const auto &[place, pages] : places)
            share(place, {id, pages.resident, pages.swapped, 0, 0});
    }
}

void Shares::tellRest() {
    const uint64_t id = _identifiers.ofShared(_tasks.front().task->pid(), 0, 0);
    for (const auto &[place, rest] : _pages.rest)
        share(place,
              {id, rest.pages.resident, rest.pages.swapped, rest.counted.resident, rest.counted.swapped});
}

} // namespace

std::vector<HXSharedPages> HXSharesOfFamily(const std::vector<HXFamilyTask> &tasks, HXFamilyPages pages,
                                            uint32_t pageShift, HXObjectIdentifiers &identifiers) {
    return Shares(tasks, std::move(pages), pageShift, identifiers).tell();
}
