#include "platform/linux/images/HXImageLayout.h"

#include <algorithm>
#include <optional>
#include <string>

namespace {

constexpr const char *kText = "__TEXT";
constexpr const char *kSymbols = "__LINKEDIT";
constexpr const char *kConstants = "__CONST";
constexpr const char *kRelocated = "__DATA_CONST";
constexpr const char *kData = "__DATA";
constexpr const char *kZeroFilled = "__BSS";

struct Pages {
    uint64_t size;
    uint64_t down(uint64_t address) const { return address & ~(size - 1); }
    uint64_t up(uint64_t address) const { return (address + size - 1) & ~(size - 1); }
};

// An ELF file at a place.
struct Candidate {
    const HXElfHeaders *headers;
    uint64_t bias; // what is added to the headers' addresses, modulo 2^64
    uint32_t device;
    uint64_t inode;
    HXLoadedImage image;
    uint64_t end;
};

class Finder {
  public:
    Finder(const HXAddressSpace &addressSpace, uint64_t pageSize)
        : _addressSpace(addressSpace), _pages{pageSize} {}

    void findCandidates(const HXHeadersOfMapping &headersOf);
    void assignMappings();
    std::vector<HXLoadedImage> images();

  private:
    void addCandidate(const HXMapping &mapping, const HXElfHeaders &headers);
    void addVdso(const HXMapping &mapping);
    void assign(const HXMapping &mapping, Candidate *candidate) const;
    const char *nameInFile(const HXMapping &mapping, const Candidate &candidate) const;
    std::optional<RVRegion> zeroFilledPart(const HXMapping &mapping, const Candidate &candidate) const;

    const HXAddressSpace &_addressSpace;
    const Pages _pages;
    bool _readableIsExecutable = false; // as the stack tells
    std::vector<Candidate> _candidates;
};

bool mapsCode(const HXMapping &mapping) {
    return mapping.has(HXMappingExecutable) && !mapping.has(HXMappingShared) && mapping.isFile() &&
           (mapping.kind == HXPathKind::file || mapping.kind == HXPathKind::deletedFile ||
            mapping.kind == HXPathKind::memfd);
}

void Finder::findCandidates(const HXHeadersOfMapping &headersOf) {
    for (size_t i = 0; i < _addressSpace.count(); i++)
        if (_addressSpace[i].kind == HXPathKind::stack)
            _readableIsExecutable = _addressSpace[i].has(HXMappingExecutable);
    for (size_t i = 0; i < _addressSpace.count(); i++) {
        const HXMapping &mapping = _addressSpace[i];
        if (mapping.kind == HXPathKind::vdso) addVdso(mapping);
        if (!mapsCode(mapping)) continue;
        const HXElfHeaders *headers = headersOf(i);
        if (headers != nullptr) addCandidate(mapping, *headers);
    }
    std::stable_sort(_candidates.begin(), _candidates.end(), [](const Candidate &a, const Candidate &b) {
        return a.image.baseAddress < b.image.baseAddress;
    });
}

void Finder::addVdso(const HXMapping &mapping) {
    const RVRegion whole{kText, mapping.start, mapping.end - mapping.start};
    HXLoadedImage image{std::string(_addressSpace.path(mapping.path).text), mapping.start, {whole}};
    _candidates.push_back({nullptr, 0, 0, 0, std::move(image), mapping.end});
}

// A stretch of the file that one executable mapping may show: a load; with `isJoined` also those that follow
// it at the same distance from their addresses, which are one mapping in a process whose readable memory is
// all executable (READ_IMPLIES_EXEC, personality(2)). `isCode`: one of them is executable.
struct Stretch {
    uint64_t fileStart;
    uint64_t fileEnd;
    bool isCode;
};

Stretch stretchFrom(const std::vector<HXElfLoad> &loads, size_t first, const Pages &pages, bool isJoined) {
    const auto distance = [](const HXElfLoad &load) { return load.address - load.offset; };
    Stretch stretch{pages.down(loads[first].offset), 0, false};
    for (size_t i = first; i < loads.size(); i++) {
        const HXElfLoad &load = loads[i];
        const bool follows = i == first || (isJoined && distance(load) == distance(loads[first]) &&
                                            pages.down(load.offset) <= stretch.fileEnd);
        if (load.writable || !follows) break;
        stretch.fileEnd = std::max(stretch.fileEnd, pages.up(load.offset + load.fileSize));
        stretch.isCode = stretch.isCode || load.executable;
    }
    return stretch;
}

void Finder::addCandidate(const HXMapping &mapping, const HXElfHeaders &headers) {
    const uint64_t first = _pages.down(headers.loads.front().address);
    for (size_t i = 0; i < headers.loads.size(); i++) {
        const HXElfLoad &load = headers.loads[i];
        const auto [fileStart, fileEnd, isCode] =
            stretchFrom(headers.loads, i, _pages, _readableIsExecutable);
        const uint64_t mappedEnd = mapping.offset + (mapping.end - mapping.start);
        // A mapping that goes beyond the executable part is a mapping of the file as data.
        if (!isCode || mapping.offset < fileStart || mappedEnd > fileEnd) continue;
        const uint64_t loadStart = mapping.start - (mapping.offset - fileStart);
        const uint64_t distance = _pages.down(load.address) - first;
        if (loadStart > mapping.start || distance > loadStart) continue;
        const HXElfLoad &last = headers.loads.back();
        Candidate candidate{
            &headers, loadStart - _pages.down(load.address), mapping.device, mapping.inode, {}, 0};
        candidate.image = {std::string(_addressSpace.path(mapping.path).text), loadStart - distance, {}};
        candidate.end = candidate.bias + _pages.up(last.address + last.memorySize);
        if (candidate.end <= candidate.image.baseAddress) continue;
        const bool isKnown = std::any_of(_candidates.begin(), _candidates.end(), [&](const Candidate &other) {
            return other.headers == candidate.headers && other.bias == candidate.bias;
        });
        if (!isKnown) _candidates.push_back(std::move(candidate));
        return;
    }
}

void Finder::assignMappings() {
    size_t current = 0;
    for (size_t i = 0; i < _addressSpace.count() && current < _candidates.size(); i++) {
        const HXMapping &mapping = _addressSpace[i];
        while (current + 1 < _candidates.size() &&
               _candidates[current + 1].image.baseAddress <= mapping.start)
            current++;
        Candidate &candidate = _candidates[current];
        if (candidate.headers == nullptr || mapping.start < candidate.image.baseAddress ||
            mapping.start >= candidate.end)
            continue;
        assign(mapping, &candidate);
    }
}

void Finder::assign(const HXMapping &mapping, Candidate *candidate) const {
    RVRegion segment{nullptr, mapping.start, mapping.end - mapping.start};
    if (mapping.isFile()) {
        if (mapping.device == candidate->device && mapping.inode == candidate->inode)
            segment.name = nameInFile(mapping, *candidate);
    } else if (const auto part = zeroFilledPart(mapping, *candidate)) {
        segment = *part;
    }
    if (segment.name == nullptr) return;
    auto &segments = candidate->image.segments;
    if (segments.empty()) segments.reserve(candidate->headers->loads.size() + 2); // relocated, zero-filled
    if (!segments.empty() && segments.back().name == segment.name &&
        segments.back().start + segments.back().length == segment.start)
        segments.back().length += segment.length;
    else
        segments.push_back(segment);
}

// The name of a mapping of the image's file; null when it does not lie as the headers say.
const char *Finder::nameInFile(const HXMapping &mapping, const Candidate &candidate) const {
    const uint64_t start = mapping.start - candidate.bias;
    const uint64_t end = mapping.end - candidate.bias;
    const HXElfHeaders &headers = *candidate.headers;
    bool afterCode = false;
    for (const HXElfLoad &load : headers.loads) {
        const uint64_t loadStart = _pages.down(load.address);
        const uint64_t loadEnd = _pages.up(load.address + load.fileSize);
        const bool fits = start >= loadStart && end <= loadEnd &&
                          mapping.offset - _pages.down(load.offset) == start - loadStart;
        if (fits && load.executable) return kText;
        // What is relocated is protected in whole pages; a mapping that goes further is not protected yet.
        if (fits && load.writable)
            return start >= _pages.down(headers.relocatedStart) && end <= _pages.down(headers.relocatedEnd)
                       ? kRelocated
                       : kData;
        if (fits) return afterCode ? kConstants : kSymbols;
        afterCode = afterCode || load.executable;
    }
    // Code together with what is readable around it.
    for (size_t i = 0; i < headers.loads.size() && mapping.has(HXMappingExecutable); i++) {
        const Stretch stretch = stretchFrom(headers.loads, i, _pages, _readableIsExecutable);
        const uint64_t loadStart = _pages.down(headers.loads[i].address);
        if (stretch.isCode && start >= loadStart &&
            end <= loadStart + (stretch.fileEnd - stretch.fileStart) &&
            mapping.offset - stretch.fileStart == start - loadStart)
            return kText;
    }
    return nullptr;
}

std::optional<RVRegion> Finder::zeroFilledPart(const HXMapping &mapping, const Candidate &candidate) const {
    if (mapping.has(HXMappingShared) ||
        (mapping.kind != HXPathKind::none && mapping.kind != HXPathKind::namedAnonymous))
        return std::nullopt;
    for (const HXElfLoad &load : candidate.headers->loads) {
        const uint64_t start = candidate.bias + _pages.up(load.address + load.fileSize);
        const uint64_t end = candidate.bias + _pages.up(load.address + load.memorySize);
        if (mapping.start >= start && mapping.start < end)
            return RVRegion{kZeroFilled, mapping.start, std::min(mapping.end, end) - mapping.start};
    }
    return std::nullopt;
}

std::vector<HXLoadedImage> Finder::images() {
    std::vector<HXLoadedImage> images;
    for (Candidate &candidate : _candidates)
        if (!candidate.image.segments.empty()) images.push_back(std::move(candidate.image));
    return images;
}

} // namespace

std::vector<HXLoadedImage> HXFindImages(const HXAddressSpace &addressSpace, uint64_t pageSize,
                                        const HXHeadersOfMapping &headersOf) {
    Finder finder(addressSpace, pageSize);
    finder.findCandidates(headersOf);
    finder.assignMappings();
    return finder.images();
}
