#include "platform/linux/memory/HXAddressSpace.h"

#include "platform/HXRegionTags.h"
#include "platform/HXSafeText.h"

#include <algorithm>
#include <string>

HXAddressSpace::HXAddressSpace() {
    _paths.emplace_back();
}

size_t HXAddressSpace::find(uint64_t address, size_t hint) const {
    for (size_t index = hint; index < std::min(hint + 2, count()); index++)
        if ((*this)[index].end > address && (index == 0 || (*this)[index - 1].end <= address)) return index;
    size_t low = 0;
    size_t high = count();
    while (low < high) {
        const size_t middle = low + (high - low) / 2;
        if ((*this)[middle].end > address)
            high = middle;
        else
            low = middle + 1;
    }
    return low;
}

void HXAddressSpace::append(HXMapping mapping) {
    if (!_mappings.empty()) {
        const uint64_t previousEnd = _mappings.back().end;
        if (mapping.end <= previousEnd) return;
        if (mapping.start < previousEnd) {
            if (mapping.isFile()) mapping.offset += previousEnd - mapping.start;
            mapping.start = previousEnd;
        }
    }
    _mappings.push_back(mapping);
}

namespace {

// The kernel writes a newline in a path as \012.
std::string plainPath(std::string_view path) {
    std::string plain;
    for (size_t i = 0; i < path.size(); i++) {
        if (path.substr(i).starts_with("\\012")) {
            plain += '\n';
            i += 3;
        } else {
            plain += path[i];
        }
    }
    return plain;
}

} // namespace

// A copy in the memory of the address space.
std::string_view HXAddressSpace::kept(std::string_view text) {
    char *const bytes = static_cast<char *>(_memory.allocate(text.size(), 1));
    std::copy(text.begin(), text.end(), bytes);
    return {bytes, text.size()};
}

// `raw` is kept.
HXMappedPath HXAddressSpace::mappedPath(std::string_view raw, HXNamedTags &tags) {
    HXMappedPath path;
    path.text = raw;
    if (!HXIsPlainText(raw)) {
        const bool isEscaped = raw.find('\\') != std::string_view::npos;
        const std::string text = isEscaped ? HXSafeText(plainPath(raw)) : HXSafeText(raw);
        if (text != raw) path.text = kept(text);
    }
    path.kind = HXPathKindOf(raw);
    const std::string_view name = HXGivenName(path.text);
    if (!name.empty()) path.namedTag = static_cast<uint8_t>(tags.tagForName(name).value_or(0));
    return path;
}

uint32_t HXAddressSpace::intern(std::string_view path, HXNamedTags &tags) {
    if (path.empty()) return 0;
    if (path == _lastPath) return _lastPathIndex;
    auto found = _pathIndexes.find(path);
    if (found == _pathIndexes.end()) {
        found = _pathIndexes.emplace(kept(path), static_cast<uint32_t>(_paths.size())).first;
        _paths.push_back(mappedPath(found->first, tags));
    }
    _lastPath = found->first;
    _lastPathIndex = found->second;
    return _lastPathIndex;
}
