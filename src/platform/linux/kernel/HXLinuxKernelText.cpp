#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cstring>

namespace {

// Takes the next line off `text`, without its newline.
std::string_view takeLine(std::string_view &text) {
    const char *newline = static_cast<const char *>(std::memchr(text.data(), '\n', text.size()));
    const size_t length = newline ? static_cast<size_t>(newline - text.data()) : text.size();
    const std::string_view line = text.substr(0, length);
    text.remove_prefix(std::min(length + 1, text.size()));
    return line;
}

// Takes the next word off `line`; empty at its end.
std::string_view takeWord(std::string_view &line) {
    const auto isBlank = [](char c) { return c == ' ' || c == '\t'; };
    size_t begin = 0;
    while (begin < line.size() && isBlank(line[begin]))
        begin++;
    size_t end = begin;
    while (end < line.size() && !isBlank(line[end]))
        end++;
    const std::string_view word = line.substr(begin, end - begin);
    line.remove_prefix(end);
    return word;
}

// The last word of `line`, taken off its end.
std::string_view takeLastWord(std::string_view &line) {
    while (!line.empty() && line.back() == ' ')
        line.remove_suffix(1);
    const size_t blank = line.rfind(' ');
    const size_t begin = blank == std::string_view::npos ? 0 : blank + 1;
    const std::string_view word = line.substr(begin);
    line.remove_suffix(word.size());
    return word;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && text.back() == ' ')
        text.remove_suffix(1);
    while (!text.empty() && text.front() == ' ')
        text.remove_prefix(1);
    return text;
}

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

template <typename Number>
bool parseNumber(std::string_view word, Number *number, int base = 10) {
    const auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), *number, base);
    return error == std::errc() && end == word.data() + word.size() && !word.empty();
}

bool takeNumber(std::string_view &line, uint64_t *number) {
    return parseNumber(takeWord(line), number);
}

// "[ext4]" gives "ext4"; anything else nothing.
std::string_view moduleInBrackets(std::string_view word) {
    if (word.size() < 3 || word.front() != '[' || word.back() != ']') return {};
    return word.substr(1, word.size() - 2);
}

// A cache's name may hold blanks and colons (its module chose it), so the line is read from its fixed parts.
bool parseSlabCache(std::string_view line, HXSlabCache *cache) {
    const size_t tunables = line.find(" : tunables ");
    const size_t slabdata = line.find(" : slabdata ");
    if (tunables == std::string_view::npos || slabdata == std::string_view::npos) return false;
    std::string_view head = line.substr(0, tunables);
    std::string_view tail = line.substr(slabdata + std::strlen(" : slabdata "));
    uint64_t activeSlabs = 0, objectsPerSlab = 0, objects = 0;
    const bool whole = parseNumber(takeLastWord(head), &cache->pagesPerSlab) &&
                       parseNumber(takeLastWord(head), &objectsPerSlab) &&
                       parseNumber(takeLastWord(head), &cache->objectSize) &&
                       parseNumber(takeLastWord(head), &objects) &&
                       parseNumber(takeLastWord(head), &cache->activeObjects) &&
                       takeNumber(tail, &activeSlabs) && takeNumber(tail, &cache->slabs);
    cache->name = trimmed(head);
    return whole && !cache->name.empty();
}

// The caller of an area, "function+0xOFFSET/0xSIZE", or its address when the kernel has no symbol for it.
void parseCaller(std::string_view word, HXVmallocArea *area) {
    const size_t plus = word.find("+0x");
    if (plus != std::string_view::npos)
        area->function = word.substr(0, plus);
    else if (startsWith(word, "0x"))
        parseNumber(word.substr(2), &area->callerAddress, 16);
}

// "START-END SIZE CALLER [MODULE] pages=N …"; the addresses are hashed or hidden and not needed.
bool parseVmallocArea(std::string_view line, HXVmallocArea *area) {
    if (line.find(" pages=") == std::string_view::npos) return false;
    uint64_t size = 0;
    takeWord(line);
    if (!takeNumber(line, &size)) return false;
    for (std::string_view word = takeWord(line); !word.empty(); word = takeWord(line)) {
        if (startsWith(word, "pages=")) return parseNumber(word.substr(6), &area->pages) && area->pages > 0;
        if (const std::string_view module = moduleInBrackets(word); !module.empty())
            area->module = module;
        else
            parseCaller(word, area);
    }
    return false;
}

bool parseAllocationSite(std::string_view line, HXAllocationSite *site) {
    uint64_t calls = 0;
    if (!takeNumber(line, &site->size) || !takeNumber(line, &calls)) return false;
    const std::string_view position = takeWord(line);
    const size_t colon = position.rfind(':');
    if (colon == std::string_view::npos || !parseNumber(position.substr(colon + 1), &site->line))
        return false;
    site->path = position.substr(0, colon);
    std::string_view word = takeWord(line);
    site->module = moduleInBrackets(word);
    if (!site->module.empty()) word = takeWord(line);
    if (!startsWith(word, "func:")) return false;
    site->function = word.substr(5);
    return true;
}

constexpr struct {
    std::string_view name;
    uint64_t HXKernelMeminfo::*field;
} kMeminfoFields[] = {
    {"MemTotal:", &HXKernelMeminfo::totalSize},
    {"SReclaimable:", &HXKernelMeminfo::slabReclaimableSize},
    {"SUnreclaim:", &HXKernelMeminfo::slabUnreclaimableSize},
    {"KernelStack:", &HXKernelMeminfo::kernelStackSize},
    {"PageTables:", &HXKernelMeminfo::pageTableSize},
    {"SecPageTables:", &HXKernelMeminfo::secondaryPageTableSize},
    {"VmallocUsed:", &HXKernelMeminfo::vmallocUsedSize},
    {"Percpu:", &HXKernelMeminfo::perCpuSize},
    {"Mlocked:", &HXKernelMeminfo::mlockedSize},
    {"Zswap:", &HXKernelMeminfo::zswapSize},
    {"HardwareCorrupted:", &HXKernelMeminfo::hardwareCorruptedSize},
    {"Balloon:", &HXKernelMeminfo::balloonSize},
};

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

// The records of all lines that `parse` accepts.
template <typename Record>
std::vector<Record> parseLines(std::string_view text, bool (*parse)(std::string_view, Record *)) {
    std::vector<Record> records;
    while (!text.empty()) {
        Record record;
        if (parse(takeLine(text), &record)) records.push_back(record);
    }
    return records;
}

bool parseModule(std::string_view line, HXKernelModule *module) {
    module->name = takeWord(line);
    return takeNumber(line, &module->size);
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
    HXKernelMeminfo meminfo;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        const std::string_view name = takeWord(line);
        uint64_t kibibytes = 0;
        if (!takeNumber(line, &kibibytes)) continue;
        for (const auto &field : kMeminfoFields)
            if (field.name == name) meminfo.*field.field = kibibytes * 1024;
    }
    if (meminfo.totalSize == 0) return std::nullopt;
    return meminfo;
}

uint64_t HXParseZoneinfoPresentPages(std::string_view text) {
    uint64_t presentPages = 0;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        uint64_t pages = 0;
        if (takeWord(line) == "present" && takeNumber(line, &pages)) presentPages += pages;
    }
    return presentPages;
}

uint64_t HXParseZramUsedSize(std::string_view text) {
    // orig_data_size compr_data_size mem_used_total … (the kernel's zram document)
    uint64_t original = 0, compressed = 0, used = 0;
    std::string_view line = takeLine(text);
    const bool whole =
        takeNumber(line, &original) && takeNumber(line, &compressed) && takeNumber(line, &used);
    return whole ? used : 0;
}

std::vector<HXAllocationSite> HXParseAllocinfo(std::string_view text) {
    return parseLines(text, parseAllocationSite);
}

std::vector<HXKernelSymbol> HXParseKallsyms(std::string_view text) {
    std::vector<HXKernelSymbol> symbols;
    symbols.reserve(text.size() / 40);
    bool anyAddress = false;
    while (!text.empty()) {
        HXKernelSymbol symbol;
        if (!parseSymbol(takeLine(text), &symbol)) continue;
        anyAddress |= symbol.address != 0;
        symbols.push_back(symbol);
    }
    if (!anyAddress) return {};
    const auto before = [](const HXKernelSymbol &a, const HXKernelSymbol &b) {
        return a.address < b.address;
    };
    // The kernel proper comes in order; modules and generated code follow in any.
    if (!std::is_sorted(symbols.begin(), symbols.end(), before))
        std::stable_sort(symbols.begin(), symbols.end(), before);
    return symbols;
}
