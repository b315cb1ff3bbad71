#include "platform/linux/kernel/HXLinuxKernelText.h"

#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <array>

namespace {

// The next word of `line`, if that is a number.
bool takeNumber(HXTextCursor &line, uint64_t *number) {
    return HXIsNumber(line.word(), number);
}

// "[ext4]" gives "ext4"; anything else nothing.
std::string_view moduleInBrackets(std::string_view word) {
    if (word.size() < 3 || word.front() != '[' || word.back() != ']') return {};
    return word.substr(1, word.size() - 2);
}

// A cache's name may hold blanks and colons (its module chose it), so the line is read from its fixed parts.
bool parseSlabCache(std::string_view line, HXSlabCache *cache) {
    constexpr std::string_view slabdataLabel = " : slabdata ";
    const size_t tunables = line.find(" : tunables ");
    const size_t slabdata = line.find(slabdataLabel);
    if (tunables == std::string_view::npos || slabdata == std::string_view::npos) return false;
    HXTextCursor head{line.substr(0, tunables)};
    HXTextCursor tail{line.substr(slabdata + slabdataLabel.size())};
    if (!HXIsNumber(head.lastWord(), &cache->pagesPerSlab)) return false;
    head.lastWord(); // objects per slab
    if (!HXIsNumber(head.lastWord(), &cache->objectSize)) return false;
    head.lastWord(); // all objects
    if (!HXIsNumber(head.lastWord(), &cache->activeObjects)) return false;
    tail.word(); // active slabs
    if (!takeNumber(tail, &cache->slabs)) return false;
    const size_t begin = head.rest.find_first_not_of(' ');
    if (begin == std::string_view::npos) return false;
    cache->name = head.rest.substr(begin, head.rest.find_last_not_of(' ') + 1 - begin);
    return true;
}

// The caller of an area, "function+0xOFFSET/0xSIZE", or its address when the kernel has no symbol for it.
void parseCaller(std::string_view word, HXVmallocArea *area) {
    const size_t plus = word.find("+0x");
    HXTextCursor address{word};
    if (plus != std::string_view::npos)
        area->function = word.substr(0, plus);
    else if (address.skip("0x"))
        HXIsNumber(address.rest, &area->callerAddress, 16);
}

// "START-END SIZE CALLER [MODULE] pages=N …"; the addresses are hashed or hidden and not needed.
bool parseVmallocArea(std::string_view text, HXVmallocArea *area) {
    if (text.find(" pages=") == std::string_view::npos) return false;
    HXTextCursor line{text};
    uint64_t size = 0;
    line.word();
    if (!takeNumber(line, &size)) return false;
    for (HXTextCursor word{line.word()}; !word.rest.empty(); word.rest = line.word()) {
        if (word.skip("pages=")) return HXIsNumber(word.rest, &area->pages) && area->pages > 0;
        if (const std::string_view module = moduleInBrackets(word.rest); !module.empty())
            area->module = module;
        else
            parseCaller(word.rest, area);
    }
    return false;
}

// "SIZE CALLS PATH:LINE [MODULE] func:FUNCTION …"
bool parseAllocationSite(std::string_view text, HXAllocationSite *site) {
    HXTextCursor line{text};
    uint64_t calls = 0;
    if (!takeNumber(line, &site->size) || !takeNumber(line, &calls)) return false;
    const std::string_view position = line.word();
    const size_t colon = position.rfind(':');
    if (colon == std::string_view::npos || !HXIsNumber(position.substr(colon + 1), &site->line)) return false;
    site->path = position.substr(0, colon);
    HXTextCursor word{line.word()};
    site->module = moduleInBrackets(word.rest);
    if (!site->module.empty()) word.rest = line.word();
    if (!word.skip("func:")) return false;
    site->function = word.rest;
    return true;
}

// The value of a hexadecimal digit, or above 15.
constexpr std::array<uint8_t, 256> hexDigitValues() {
    std::array<uint8_t, 256> values{};
    values.fill(0xFF);
    for (uint8_t digit = 0; digit < 10; digit++)
        values[static_cast<size_t>('0' + digit)] = digit;
    for (uint8_t letter = 0; letter < 6; letter++)
        values[static_cast<size_t>('a' + letter)] = static_cast<uint8_t>(10 + letter);
    return values;
}
constexpr std::array<uint8_t, 256> kHexDigits = hexDigitValues();

// "ADDRESS TYPE NAME" and, for a module's symbol, a TAB and the module. There are a hundred thousand of these
// lines and more, so this one is read by the character.
bool parseSymbol(std::string_view line, HXKernelSymbol *symbol) {
    size_t at = 0;
    for (; at < line.size() && kHexDigits[static_cast<uint8_t>(line[at])] <= 15; at++)
        symbol->address = symbol->address << 4 | kHexDigits[static_cast<uint8_t>(line[at])];
    if (at == 0 || at + 3 >= line.size() || line[at] != ' ' || line[at + 2] != ' ') return false;
    const char type = line[at + 1];
    symbol->isCode = type == 't' || type == 'T' || type == 'w' || type == 'W';
    const std::string_view rest = line.substr(at + 3);
    const size_t tab = rest.find('\t');
    symbol->name = rest.substr(0, tab);
    if (tab != std::string_view::npos) symbol->module = moduleInBrackets(rest.substr(tab + 1));
    return true;
}

// "NAME SIZE …"
bool parseModule(std::string_view text, HXKernelModule *module) {
    HXTextCursor line{text};
    module->name = line.word();
    return takeNumber(line, &module->size);
}

// The records of all lines that `parse` accepts.
template <typename Record>
std::vector<Record> parseLines(std::string_view text, bool (*parse)(std::string_view, Record *),
                               size_t expectedCount = 0) {
    std::vector<Record> records;
    records.reserve(expectedCount);
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        Record record;
        if (parse(cursor.line(), &record)) records.push_back(record);
    }
    return records;
}

} // namespace

std::vector<HXSlabCache> HXParseSlabinfo(std::string_view text) {
    // The heading has the form of a cache: "# name … : tunables … : slabdata <active_slabs> …"; its words are
    // no numbers.
    return parseLines(text, parseSlabCache);
}

std::vector<HXVmallocArea> HXParseVmallocinfo(std::string_view text) {
    return parseLines(text, parseVmallocArea);
}

std::vector<HXKernelModule> HXParseModules(std::string_view text) {
    return parseLines(text, parseModule);
}

std::optional<HXKernelMeminfo> HXParseKernelMeminfo(std::string_view text) {
    using Meminfo = HXKernelMeminfo;
    static constexpr HXLabelledFigure<Meminfo> figures[] = {
        {"MemTotal:", &Meminfo::totalSize},
        {"SReclaimable:", &Meminfo::slabReclaimableSize},
        {"SUnreclaim:", &Meminfo::slabUnreclaimableSize},
        {"KernelStack:", &Meminfo::kernelStackSize},
        {"PageTables:", &Meminfo::pageTableSize},
        {"SecPageTables:", &Meminfo::secondaryPageTableSize},
        {"VmallocUsed:", &Meminfo::vmallocUsedSize},
        {"Percpu:", &Meminfo::perCpuSize},
        {"Mlocked:", &Meminfo::mlockedSize},
        {"Zswap:", &Meminfo::zswapSize},
        {"HardwareCorrupted:", &Meminfo::hardwareCorruptedSize},
        {"Balloon:", &Meminfo::balloonSize},
        {"MemFree:", &Meminfo::freeSize},
        {"MemAvailable:", &Meminfo::availableSize},
        {"Buffers:", &Meminfo::buffersSize},
        {"Cached:", &Meminfo::cachedSize},
        {"Shmem:", &Meminfo::sharedSize},
        {"AnonPages:", &Meminfo::anonymousSize},
        {"KReclaimable:", &Meminfo::reclaimableSize},
        {"Active:", &Meminfo::activeSize},
        {"Inactive:", &Meminfo::inactiveSize},
        {"Unevictable:", &Meminfo::unevictableSize},
        {"Hugetlb:", &Meminfo::hugePageSize},
        {"SwapTotal:", &Meminfo::swapTotalSize},
        {"SwapFree:", &Meminfo::swapFreeSize},
        {"SwapCached:", &Meminfo::swapCachedSize},
    };
    const Meminfo meminfo = HXParseLabelledFigures(text, figures);
    const bool isWhole = meminfo.totalSize && meminfo.slabReclaimableSize && meminfo.slabUnreclaimableSize &&
                         meminfo.kernelStackSize;
    return isWhole ? std::optional(meminfo) : std::nullopt;
}

HXZonePages HXParseZoneinfo(std::string_view text) {
    HXZonePages sums;
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        HXTextCursor line{cursor.line()};
        const std::string_view label = line.word();
        uint64_t pages = 0;
        if (label == "present" && takeNumber(line, &pages)) sums.present += pages;
        if (label == "count:" && takeNumber(line, &pages)) sums.listed += pages;
    }
    return sums;
}

std::optional<uint64_t> HXParseZramUsedSize(std::string_view text) {
    // orig_data_size compr_data_size mem_used_total … (the kernel's zram document)
    HXTextCursor line{text};
    uint64_t used = 0;
    line.word();
    line.word();
    return takeNumber(line, &used) ? std::optional(used) : std::nullopt;
}

std::vector<HXAllocationSite> HXParseAllocinfo(std::string_view text) {
    return parseLines(text, parseAllocationSite);
}

std::vector<HXKernelSymbol> HXParseKallsyms(std::string_view text) {
    constexpr size_t usualLineLength = 40;
    auto symbols = parseLines(text, parseSymbol, text.size() / usualLineLength);
    const auto isHidden = [](const HXKernelSymbol &symbol) { return symbol.address == 0; };
    if (std::all_of(symbols.begin(), symbols.end(), isHidden)) return {};
    const auto before = [](const HXKernelSymbol &a, const HXKernelSymbol &b) {
        return a.address < b.address;
    };
    // The kernel proper comes in order; modules and generated code follow in any.
    if (!std::is_sorted(symbols.begin(), symbols.end(), before))
        std::stable_sort(symbols.begin(), symbols.end(), before);
    return symbols;
}
