#include "platform/linux/sharing/HXFamilyColumns.h"

#include "platform/linux/pages/HXPageScan.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <memory>
#include <optional>
#include <span>

namespace {

// A member's entries of a window are read at once, so that memory which the member exchanges for other memory
// meanwhile is seldom counted twice or not at all.
constexpr uint64_t kWindowPages = 16384;
// Of memory that is mostly holes.
constexpr uint64_t kSparseWindowPages = 512, kEntriesOfSparsePage = 64;
// So much memory is taken for the entries of a window: those of a large family are shorter.
constexpr uint64_t kWindowEntries = uint64_t{1} << 19;
constexpr size_t kSetsOfStretch = size_t{1} << 15;
// So many entries are compared at once: a row's differences are kept in one word.
constexpr size_t kPiecePages = 512;
static_assert(kWindowPages / kPiecePages <= 64);

// Groups the members of a column by what they hold. Used again for each column: entries of earlier ones are
// told by their stamp.
class Groups {
  public:
    explicit Groups(size_t members) : _slots(std::bit_ceil(members * 2)), _wordCount((members + 63) / 64) {}

    struct Group {
        HXPageKey key;
        uint32_t count;
    };

    void begin() {
        _stamp++;
        _groups.clear();
        _bits.clear();
    }
    void add(uint32_t member, HXPageKey key) {
        const size_t group = groupOf(key);
        _groups[group].count++;
        _bits[group * _wordCount + member / 64] |= uint64_t{1} << (member % 64);
    }
    const std::vector<Group> &groups() const { return _groups; }
    HXSharerSets::Bits bits(size_t group) const {
        return HXSharerSets::Bits(_bits).subspan(group * _wordCount, _wordCount);
    }

  private:
    struct Slot {
        uint64_t stamp = 0;
        uint32_t group = 0;
    };

    size_t groupOf(HXPageKey key) {
        size_t slot = (key * 0x9E3779B97F4A7C15 >> 32) & (_slots.size() - 1);
        for (; _slots[slot].stamp == _stamp; slot = (slot + 1) & (_slots.size() - 1))
            if (_groups[_slots[slot].group].key == key) return _slots[slot].group;
        _slots[slot] = {_stamp, static_cast<uint32_t>(_groups.size())};
        _groups.push_back({key, 0});
        _bits.resize(_bits.size() + _wordCount);
        return _groups.size() - 1;
    }

    std::vector<Slot> _slots;
    const size_t _wordCount;
    uint64_t _stamp = 0;
    std::vector<Group> _groups;
    std::vector<uint64_t> _bits;
};

class ColumnReader {
  public:
    ColumnReader(const HXColumnRequest &request, std::atomic<uint32_t> *reading);

    std::unique_ptr<HXFamilyPages> read();

  private:
    // A member in the stretch that is read.
    struct Row {
        size_t range = 0;         // the first of its ranges that ends behind the window's start
        uint64_t nothingUpTo = 0; // before this page there is none, as far as is known
        bool isInWindow = false;
        size_t from = 0, to = 0; // places in the window: what was read
        uint64_t alike = 0;      // by piece: whether that is what the reference holds there
    };

    // Of the window, within one strip. The base is the strip's first active member.
    struct Piece {
        size_t place, end;
        HXFamilyFigures figures; // of the base
    };

    void readWindow(uint64_t first, uint64_t end);
    void readRow(uint32_t member, uint64_t first, uint64_t end);
    void keepRow(uint32_t member);
    void skipHole(uint32_t member, uint64_t from);
    uint64_t nextPage(uint64_t from);
    void countStrip(uint64_t first, uint64_t end);
    void addPieces(size_t place, size_t end);
    void addFigures(uint32_t member, uint32_t mapping, const HXFamilyFigures &figures);
    HXFamilyFigures takeEntries(std::span<uint64_t> entries, bool isFile) const;
    HXFamilyFigures takeBase(uint32_t member, bool isFile);
    HXFamilyFigures takeRow(uint32_t member, bool isFile, bool baseIsFile);
    bool isUniform(size_t piece);
    void countPiece(size_t piece);
    void countUniform(std::span<const HXPageKey> keys);
    void countColumn(size_t piece, size_t place);
    void countGroup(HXPageKey key, HXSharerSets::Bits bits, uint32_t sharers);
    void wantFlags(HXPageKey key) {
        if (_flags && (key & kSwappedKey) == 0) _frames.push_back(key);
    }
    void countSharers(const HXPageCount &pages, HXSharerSets::Bits bits);
    void endStrip();
    void findLazilyFreed();
    uint64_t *row(uint32_t member) { return _entries.data() + (kOwnRows + member) * _stride; }
    // As they were read.
    const uint64_t *entriesAt(uint32_t member, size_t place) {
        const bool isKept = (_rows[member].alike >> place / kPiecePages & 1) == 0;
        return (isKept ? row(member) : _reference) + place;
    }
    uint64_t *bits(std::vector<uint64_t> &ofPieces, size_t piece) {
        return ofPieces.data() + piece * _allBits.size();
    }
    const std::vector<HXFamilyRange> &ranges(uint32_t member) const { return _family.members[member].ranges; }

    const HXColumnRequest &_request;
    const HXFamily &_family;
    std::atomic<uint32_t> &_reading;
    const uint32_t _memberCount;
    const uint64_t _windowPages, _stride;
    // Of the window. Most rows of a family are alike, entry by entry: each is read into the same memory,
    // which stays in the processor's cache, and only what differs from the first one's is kept.
    static constexpr size_t kOwnRows = 3;
    const std::span<uint64_t> _entries; // the rows of the next line, then those of members
    uint64_t *const _reference, *const _scratch, *const _keys; // the first row, the one just read, the bases'
    std::optional<uint32_t> _referenceMember;
    std::vector<Piece> _pieces;
    // By piece, a bit for each active member: it holds the base's keys, or its own.
    std::vector<uint64_t> _same, _own;
    std::vector<uint64_t> _differs; // by place: not 0 where the active rows are not equal
    std::vector<Row> _rows;
    std::vector<uint32_t> _active;                 // members with a mapping in the strip
    std::vector<uint64_t> _allBits;                // of these
    bool _isSparse;                                // the last window, or what is expected of the first
    std::vector<uint32_t> _layout;                 // of the strip, then of the last that was counted
    uint64_t _windowStart = 0, _windowLength = 0;  // pages
    uint64_t _windowEntries = 0, _windowFound = 0; // read, and of these such as tell a page
    size_t _stripPiece = 0;                        // the strip's first
    uint32_t _layoutNumber = HXFamilyPages::kNoMapping;
    std::unordered_map<uint32_t, HXPageCount> _counts; // of the layout, by set
    uint32_t _lastSet = HXSharerSets::kNone;
    HXPageCount *_lastCount = nullptr;
    Groups _groups;
    std::optional<HXFrameFlags> _flags;          // where lazily freed pages are wanted
    std::vector<uint64_t> _frames, _lazilyFreed; // of the window
    HXSeenKeys::Cursor _seen;
    std::optional<HXSeenKeys::Cursor> _repeated;
    std::unique_ptr<HXFamilyPages> _pages;
};

// Room for `count` entries, of any value, until the thread asks again.
std::span<uint64_t> roomForEntries(size_t count) {
    struct Room {
        std::unique_ptr<uint64_t[]> entries;
        size_t count = 0;
    };
    thread_local Room room; // most of its pages would be cleared for each stretch otherwise
    if (room.count < count) room = {std::make_unique_for_overwrite<uint64_t[]>(count), count};
    return {room.entries.get(), count};
}

uint64_t windowPagesFor(uint64_t members) {
    const uint64_t pages = std::bit_floor(std::max<uint64_t>(kWindowEntries / members, 64));
    return std::min(kWindowPages, pages);
}

ColumnReader::ColumnReader(const HXColumnRequest &request, std::atomic<uint32_t> *reading)
    : _request(request), _family(*request.family), _reading(*reading),
      _memberCount(static_cast<uint32_t>(_family.members.size())), _windowPages(windowPagesFor(_memberCount)),
      // Rows that lie a power of two apart would fight for the same lines of the processor's cache.
      _stride(_windowPages + 8), _entries(roomForEntries(_stride * (kOwnRows + _memberCount))),
      _reference(_entries.data()), _scratch(_reference + _stride), _keys(_scratch + _stride),
      _differs(_windowPages), _rows(_memberCount), _allBits((_memberCount + 63) / 64),
      _isSparse(request.stretch.end - request.stretch.first > kWindowPages),
      _layout(_memberCount, HXFamilyPages::kNoMapping), _groups(_memberCount), _seen(*_family.seen),
      _pages(std::make_unique<HXFamilyPages>(_memberCount, kSetsOfStretch)) {
    if (request.findsLazilyFreed) _flags.emplace();
    if (request.repeated) _repeated.emplace(*request.repeated);
}

std::unique_ptr<HXFamilyPages> ColumnReader::read() {
    const HXPageStretch &stretch = _request.stretch;
    for (uint32_t member = 0; member < _memberCount; member++) {
        const auto &all = ranges(member);
        const auto found = std::partition_point(
            all.begin(), all.end(), [&](const HXFamilyRange &range) { return range.end <= stretch.first; });
        _rows[member].range = static_cast<size_t>(found - all.begin());
    }
    for (uint64_t at = nextPage(stretch.first); at < stretch.end; at = nextPage(at)) {
        const uint64_t pages = _isSparse ? std::min(kSparseWindowPages, _windowPages) : _windowPages;
        const uint64_t end = std::min(at + pages, stretch.end);
        readWindow(at, end);
        at = end;
    }
    endStrip();
    return std::move(_pages);
}

// The first page from `from` on that may be there in some member; none: the end of the stretch.
uint64_t ColumnReader::nextPage(uint64_t from) {
    uint64_t next = _request.stretch.end;
    for (uint32_t member = 0; member < _memberCount && next > from; member++) {
        Row &row = _rows[member];
        const uint64_t least = std::max(from, row.nothingUpTo);
        const auto &all = ranges(member);
        while (row.range < all.size() && all[row.range].end <= least)
            row.range++;
        if (row.range < all.size()) next = std::min(next, std::max(least, all[row.range].first));
    }
    return next;
}

void ColumnReader::readWindow(uint64_t first, uint64_t end) {
    _windowStart = first;
    _windowLength = end - first;
    _windowEntries = _windowFound = 0;
    _referenceMember.reset();
    _pieces.clear();
    _same.clear();
    _own.clear();
    std::vector<uint64_t> borders = {first, end};
    for (uint32_t member = 0; member < _memberCount; member++) {
        Row &row = _rows[member];
        const auto &all = ranges(member);
        while (row.range < all.size() && all[row.range].end <= first)
            row.range++;
        row.isInWindow = row.range < all.size() && all[row.range].first < end && row.nothingUpTo < end;
        if (!row.isInWindow) continue;
        for (size_t i = row.range; i < all.size() && all[i].first < end; i++) {
            borders.push_back(std::max(all[i].first, first));
            borders.push_back(std::min(all[i].end, end));
        }
        readRow(member, first, end);
    }
    std::sort(borders.begin(), borders.end());
    borders.erase(std::unique(borders.begin(), borders.end()), borders.end());
    for (size_t i = 0; i + 1 < borders.size(); i++)
        countStrip(borders[i], borders[i + 1]);
    _isSparse = _windowFound * kEntriesOfSparsePage < _windowEntries;
    if (_flags) findLazilyFreed();
}

// Reads the entries of a member's ranges in the window, and of what lies between them.
void ColumnReader::readRow(uint32_t member, uint64_t first, uint64_t end) {
    const auto &all = ranges(member);
    Row &row = _rows[member];
    const uint64_t from = std::max(all[row.range].first, first);
    size_t last = row.range;
    while (last + 1 < all.size() && all[last + 1].first < end)
        last++;
    const uint64_t to = std::min(all[last].end, end);
    row.from = from - first;
    row.to = to - first;
    uint64_t *const entries = (_referenceMember ? _scratch : _reference) + row.from;
    const size_t bytes = (to - from) * sizeof *entries;
    _windowEntries += to - from;
    _reading.store(member, std::memory_order_relaxed);
    const ssize_t got = _family.members[member].pagemap.readAt(from * sizeof *entries, entries, bytes);
    const size_t count = got < 0 ? 0 : static_cast<size_t>(got) / sizeof *entries;
    std::fill(entries + count, entries + (to - from), 0); // where another window or family has left something
    if (_referenceMember) {
        keepRow(member);
    } else {
        _referenceMember = member;
        row.alike = ~uint64_t{0};
    }
    // One whose address space has gone has nothing left to tell, here or further on, and no holes to skip.
    if (count == 0)
        row.nothingUpTo = UINT64_MAX;
    else if (std::all_of(entries, entries + count, [](uint64_t entry) { return entry == 0; }))
        skipHole(member, end);
}

// Of the row just read, what is not the reference's.
void ColumnReader::keepRow(uint32_t member) {
    Row &row = _rows[member];
    const Row &reference = _rows[*_referenceMember];
    row.alike = 0;
    for (size_t piece = row.from / kPiecePages; piece * kPiecePages < row.to; piece++) {
        const size_t from = std::max(row.from, piece * kPiecePages);
        const size_t to = std::min(row.to, (piece + 1) * kPiecePages);
        if (from >= reference.from && to <= reference.to &&
            std::memcmp(_scratch + from, _reference + from, (to - from) * sizeof *_scratch) == 0)
            row.alike |= uint64_t{1} << piece;
        else
            std::copy(_scratch + from, _scratch + to, this->row(member) + from);
    }
}

// Asks where the next page is: mappings can be far larger than what is in them.
void ColumnReader::skipHole(uint32_t member, uint64_t from) {
    Row &row = _rows[member];
    const auto &all = ranges(member);
    const uint64_t end = std::min(all.back().end, _request.stretch.end);
    if (from >= end) return;
    HXPageRun run[1];
    const uint32_t shift = _request.pageShift;
    const auto walk =
        HXPageScan::find(_family.members[member].pagemap, false, from << shift, end << shift, run);
    if (walk) row.nothingUpTo = walk->count == 0 ? end : run[0].start >> shift;
}

// Counts [first, end), in which every member has one mapping or none.
void ColumnReader::countStrip(uint64_t first, uint64_t end) {
    _active.clear();
    std::fill(_allBits.begin(), _allBits.end(), 0);
    std::vector<uint32_t> layout(_memberCount, HXFamilyPages::kNoMapping);
    addPieces(first - _windowStart, end - _windowStart);
    bool baseIsFile = false;
    for (uint32_t member = 0; member < _memberCount; member++) {
        if (!_rows[member].isInWindow) continue;
        const auto &all = ranges(member);
        size_t i = _rows[member].range;
        while (i < all.size() && all[i].end <= first)
            i++;
        if (i == all.size() || all[i].first > first) continue;
        layout[member] = all[i].mapping;
        _active.push_back(member);
        _allBits[member / 64] |= uint64_t{1} << (member % 64);
        const bool isBase = _active.size() == 1;
        if (isBase) baseIsFile = all[i].isFile;
        const HXFamilyFigures figures =
            isBase ? takeBase(member, baseIsFile) : takeRow(member, all[i].isFile, baseIsFile);
        addFigures(member, all[i].mapping, figures);
    }
    if (_active.empty()) {
        _pieces.resize(_stripPiece);
        return;
    }
    if (layout != _layout || _layoutNumber == HXFamilyPages::kNoMapping) {
        endStrip();
        _layoutNumber = static_cast<uint32_t>(_pages->layouts.size() / _memberCount);
        _pages->layouts.insert(_pages->layouts.end(), layout.begin(), layout.end());
        _layout = std::move(layout);
    }
    for (size_t piece = _stripPiece; piece < _pieces.size(); piece++)
        countPiece(piece);
}

// Those of a strip, by its places in the window.
void ColumnReader::addPieces(size_t place, size_t end) {
    _stripPiece = _pieces.size();
    while (place < end) {
        const size_t next = std::min(end, (place / kPiecePages + 1) * kPiecePages);
        _pieces.push_back({place, next, {}});
        place = next;
    }
    _same.resize(_pieces.size() * _allBits.size());
    _own.resize(_same.size());
}

void ColumnReader::addFigures(uint32_t member, uint32_t mapping, const HXFamilyFigures &figures) {
    _windowFound += figures.resident + figures.swapped;
    auto &told = _pages->figures[member];
    if (told.empty() || told.back().first != mapping)
        told.emplace_back(mapping, figures);
    else
        told.back().second += figures;
}

// Turns entries into keys, and counts them.
HXFamilyFigures ColumnReader::takeEntries(std::span<uint64_t> entries, bool isFile) const {
    HXFamilyFigures figures;
    for (uint64_t &entry : entries) {
        if (entry == 0) continue;
        const HXPageEntries::Kind kind = _family.entries->read(entry, &entry);
        figures.resident += kind == HXPageEntries::anonymous || (kind == HXPageEntries::file && isFile);
        figures.anonymous += kind == HXPageEntries::anonymous;
        figures.swapped += kind == HXPageEntries::swapped;
    }
    return figures;
}

// The base's part of the strip.
HXFamilyFigures ColumnReader::takeBase(uint32_t member, bool isFile) {
    HXFamilyFigures figures;
    for (size_t piece = _stripPiece; piece < _pieces.size(); piece++) {
        auto &[place, end, ofBase] = _pieces[piece];
        std::copy_n(entriesAt(member, place), end - place, _keys + place);
        ofBase = takeEntries({_keys + place, end - place}, isFile);
        figures += ofBase;
        bits(_same, piece)[member / 64] |= uint64_t{1} << (member % 64);
        std::fill(_differs.begin() + static_cast<ptrdiff_t>(place),
                  _differs.begin() + static_cast<ptrdiff_t>(end), 0);
    }
    return figures;
}

// Another member's. Where its entries are the base's there is nothing left to do.
HXFamilyFigures ColumnReader::takeRow(uint32_t member, bool isFile, bool baseIsFile) {
    HXFamilyFigures figures;
    const uint32_t base = _active.front();
    for (size_t piece = _stripPiece; piece < _pieces.size(); piece++) {
        const auto &[place, end, ofBase] = _pieces[piece];
        const uint64_t *const entries = entriesAt(member, place), *const baseEntries = entriesAt(base, place);
        const bool isSame =
            isFile == baseIsFile && (entries == baseEntries ||
                                     std::memcmp(entries, baseEntries, (end - place) * sizeof *entries) == 0);
        bits(isSame ? _same : _own, piece)[member / 64] |= uint64_t{1} << (member % 64);
        if (isSame) {
            figures += ofBase;
            continue;
        }
        uint64_t *const own = row(member);
        if (entries != own + place) std::copy_n(entries, end - place, own + place);
        figures += takeEntries({own + place, end - place}, isFile);
        for (size_t i = place; i < end; i++)
            _differs[i] |= own[i] ^ _keys[i];
    }
    return figures;
}

// Whether all active members hold the base's keys.
bool ColumnReader::isUniform(size_t piece) {
    const uint64_t *const own = bits(_own, piece);
    return std::all_of(own, own + _allBits.size(), [](uint64_t word) { return word == 0; });
}

void ColumnReader::countPiece(size_t piece) {
    const auto &[place, end, ofBase] = _pieces[piece];
    if (!_repeated && isUniform(piece)) return countUniform({_keys + place, end - place});
    for (size_t i = place; i < end; i++)
        countColumn(piece, i);
}

void ColumnReader::countUniform(std::span<const HXPageKey> keys) {
    _seen.add(keys, &_pages->metAgain);
    HXPageCount pages;
    for (const HXPageKey key : keys) {
        if (key == 0) continue;
        pages.add(key);
        wantFlags(key);
    }
    if (pages.all() != 0 && _active.size() > 1) countSharers(pages, _allBits);
}

void ColumnReader::countColumn(size_t piece, size_t place) {
    const HXPageKey ofBase = _keys[place];
    if (_differs[place] == 0) {
        if (ofBase != 0) countGroup(ofBase, _allBits, static_cast<uint32_t>(_active.size()));
        return;
    }
    _groups.begin();
    const uint64_t *const own = bits(_own, piece);
    for (const uint32_t member : _active) {
        const bool hasOwn = (own[member / 64] >> member % 64 & 1) != 0;
        if (const HXPageKey key = hasOwn ? row(member)[place] : ofBase) _groups.add(member, key);
    }
    for (size_t group = 0; group < _groups.groups().size(); group++)
        countGroup(_groups.groups()[group].key, _groups.bits(group), _groups.groups()[group].count);
}

void ColumnReader::countGroup(HXPageKey key, HXSharerSets::Bits bits, uint32_t sharers) {
    wantFlags(key);
    if (!_repeated) {
        if (_seen.add(key)) _pages->metAgain.push_back(key);
    } else if (_repeated->contains(key)) {
        HXSharerSets::forEachMember(bits, [&](uint32_t member) {
            _pages->repeated.push_back({key, {member, _layout[member]}});
        });
        return;
    }
    if (sharers < 2) return;
    HXPageCount page;
    page.add(key);
    countSharers(page, bits);
}

void ColumnReader::countSharers(const HXPageCount &pages, HXSharerSets::Bits bits) {
    if (_lastCount == nullptr || !std::ranges::equal(_pages->sets.bits(_lastSet), bits)) {
        _lastSet = _pages->sets.number(bits);
        _lastCount = _lastSet == HXSharerSets::kNone ? nullptr : &_counts[_lastSet];
    }
    if (_lastCount != nullptr)
        *_lastCount += pages;
    else
        _pages->addRest(bits, _layout, pages);
}

// Of the window, whose pieces are keys by now.
void ColumnReader::findLazilyFreed() {
    _lazilyFreed.clear();
    _flags->findLazilyFreed(&_frames, &_lazilyFreed);
    _frames.clear();
    if (_lazilyFreed.empty()) return;
    std::sort(_lazilyFreed.begin(), _lazilyFreed.end());
    const auto areIn = [&](const uint64_t *keys, const Piece &piece) {
        return std::any_of(keys + piece.place, keys + piece.end, [this](uint64_t key) {
            return std::binary_search(_lazilyFreed.begin(), _lazilyFreed.end(), key);
        });
    };
    for (size_t i = 0; i < _pieces.size(); i++) {
        const HXSharerSets::Bits same(bits(_same, i), _allBits.size()), own(bits(_own, i), _allBits.size());
        if (areIn(_keys, _pieces[i]))
            HXSharerSets::forEachMember(same, [&](uint32_t m) { _pages->mayBeLazilyFreed[m] = true; });
        HXSharerSets::forEachMember(
            own, [&](uint32_t m) { _pages->mayBeLazilyFreed[m] |= areIn(row(m), _pieces[i]); });
    }
}

void ColumnReader::endStrip() {
    for (const auto &[set, pages] : _counts)
        _pages->counts.push_back({_layoutNumber, set, pages});
    _counts.clear();
    _lastCount = nullptr;
}

} // namespace

std::vector<HXPageStretch> HXStretchesOfFamily(const HXFamily &family) {
    constexpr uint64_t leastPages = kWindowPages, mostStretches = 4096;
    std::vector<HXPageStretch> all; // the ranges of all members, then joined
    for (const HXFamilyMember &member : family.members)
        for (const HXFamilyRange &range : member.ranges)
            all.push_back({range.first, range.end});
    std::sort(all.begin(), all.end(),
              [](const HXPageStretch &a, const HXPageStretch &b) { return a.first < b.first; });
    std::vector<HXPageStretch> joined;
    uint64_t pages = 0;
    for (const HXPageStretch &range : all) {
        const uint64_t seenTo = joined.empty() ? 0 : joined.back().end;
        if (range.end <= seenTo) continue;
        if (joined.empty() || range.first > seenTo)
            joined.push_back(range);
        else
            joined.back().end = range.end;
        pages += range.end - std::max(range.first, seenTo);
    }
    const uint64_t wanted = std::max(leastPages, pages / mostStretches);
    std::vector<HXPageStretch> stretches;
    uint64_t taken = wanted; // by the last stretch, which is full
    for (const HXPageStretch &range : joined) {
        for (uint64_t at = range.first; at < range.end;) {
            if (taken >= wanted) {
                stretches.push_back({at, at});
                taken = 0;
            }
            const uint64_t end = std::min(range.end, at + (wanted - taken));
            stretches.back().end = end;
            taken += end - at;
            at = end;
        }
    }
    return stretches;
}

// Longer ones are mostly what lies between mappings.
uint64_t HXCostOfStretch(const HXFamily &family, const HXPageStretch &stretch) {
    return std::min(stretch.end - stretch.first, kWindowPages) * family.members.size();
}

std::unique_ptr<HXFamilyPages> HXReadColumns(const HXColumnRequest &request, std::atomic<uint32_t> *reading) {
    return ColumnReader(request, reading).read();
}
