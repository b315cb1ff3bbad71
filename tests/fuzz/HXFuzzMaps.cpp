// Fuzz target: any bytes as a process's maps or smaps, whole and in pieces.
#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/procfs/HXMapsParser.h"

#include <cstdlib>
#include <memory>
#include <string>

namespace {

void require(bool holds) {
    if (!holds) std::abort();
}

// Reads the text in pieces of `piece` bytes, as from a file.
std::unique_ptr<HXAddressSpace> parse(std::string_view text, size_t piece, HXNamedTags &tags) {
    auto addressSpace = std::make_unique<HXAddressSpace>();
    HXMapsParser parser(12);
    std::string kept;
    for (size_t at = 0; at < text.size(); at += piece) {
        const bool complete = at + piece >= text.size();
        kept += text.substr(at, piece);
        std::string_view rest = kept;
        HXMapsEntry entry;
        while (parser.next(&rest, complete, &entry)) {
            require(entry.mapping.start < entry.mapping.end);
            entry.mapping.path = addressSpace->intern(entry.path, tags);
            addressSpace->append(entry.mapping);
        }
        require(!complete || rest.empty());
        kept = std::string(rest);
    }
    return addressSpace;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);
    HXNamedTags tags;
    const auto whole = parse(text, size + 1, tags), pieces = parse(text, 61, tags);
    require(whole->count() == pieces->count());
    double residentSize = 0, toldSize = 0;
    for (size_t i = 0; i < whole->count(); i++) {
        const HXMapping &mapping = (*whole)[i], &other = (*pieces)[i];
        require(mapping.start < mapping.end && (i == 0 || mapping.start >= (*whole)[i - 1].end));
        require(whole->find(mapping.start) == i && whole->find(mapping.end - 1) == i);
        require(mapping.start == other.start && mapping.end == other.end && mapping.inode == other.inode);
        residentSize += mapping.residentPages * 4.0;
    }
    for (size_t at = 0; (at = text.find("Rss:", at)) != std::string::npos; at++)
        toldSize += static_cast<double>(std::strtoull(text.c_str() + at + 4, nullptr, 10));
    require(residentSize <= toldSize);
    return 0;
}
