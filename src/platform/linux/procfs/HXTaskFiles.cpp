#include "platform/linux/procfs/HXTaskFiles.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <cerrno>

namespace {

// The line behind all figures: a text that lacks it was cut.
bool isWholeStatus(std::string_view text) {
    const size_t last = text.find("\nThreads:");
    return last != std::string_view::npos && text.find('\n', last + 1) != std::string_view::npos;
}

} // namespace

std::optional<HXStatRecord> HXReadStat(const HXDescriptor &process) {
    char buffer[2048]; // some 50 numbers of at most 20 digits
    const auto text = HXReadOnce(process, "stat", buffer);
    return text ? HXParseStat(*text) : std::nullopt;
}

uint64_t HXReadNamespace(const HXDescriptor &process, const char *link) {
    char buffer[64];
    const auto text = HXReadLink(process, link, buffer);
    if (!text) return 0;
    HXTextCursor cursor{text->substr(std::min(text->find('[') + 1, text->size()))};
    uint64_t number = 0;
    cursor.number(&number);
    return number;
}

std::optional<HXStatusRecord> HXReadStatus(const HXDescriptor &process) {
    char buffer[8192]; // of a process in few groups
    const auto text = HXReadOnce(process, "status", buffer);
    if (!text) return std::nullopt;
    if (isWholeStatus(*text)) return HXParseStatus(*text);
    // A process may have 65536 groups (NGROUPS_MAX), whose numbers of up to ten digits come before the
    // figures.
    constexpr size_t limit = 1 << 20;
    const auto longText = HXReadText(process, "status", limit);
    if (!longText) return std::nullopt;
    if (isWholeStatus(*longText)) return HXParseStatus(*longText);
    errno = EIO;
    return std::nullopt;
}
