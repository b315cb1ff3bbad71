#include "platform/linux/procfs/HXProcText.h"

#include "platform/linux/procfs/HXTextNumber.h"

#include <algorithm>
#include <cstring>

std::optional<HXStatRecord> HXParseStat(std::string_view text) {
    HXStatRecord record;
    HXTextCursor cursor{text};
    if (!cursor.number(&record.pid)) return std::nullopt;
    const size_t open = text.find('(');
    const size_t close = text.rfind(')');
    if (open == std::string_view::npos || close == std::string_view::npos || close < open)
        return std::nullopt;
    const std::string_view comm = text.substr(open + 1, close - open - 1).substr(0, sizeof record.commBytes);
    record.commLength = static_cast<uint8_t>(comm.size());
    std::memcpy(record.commBytes, comm.data(), comm.size());

    cursor.rest = text.substr(close + 1);
    const std::string_view state = cursor.word();
    if (state.size() != 1) return std::nullopt;
    record.state = state.front();
    // Fields are numbered as in proc(5); the third, state, has just been read.
    int next = 4;
    const auto take = [&](int field, auto *value) {
        for (; next < field; next++)
            cursor.word();
        next++;
        return cursor.field(value);
    };
    int32_t group = 0; // -1 while the process is being taken down
    if (!take(4, &record.ppid) || !take(5, &group) || !take(9, &record.flags) ||
        !take(20, &record.threadCount) || !take(22, &record.startTime) || !take(23, &record.virtualSize) ||
        !take(28, &record.startStack))
        return std::nullopt;
    record.pgid = static_cast<uint32_t>(group);
    return record;
}

bool HXStatusRecord::hasNoMemory() const {
    return !residentSize && !rssAnonSize && !rssShmemSize && !swapSize && !pageTableSize;
}

std::optional<uint64_t> HXStatusRecord::pageTablesHeld() const {
    return hasNoMemory() ? 0 : pageTableSize;
}

std::optional<uint64_t> HXStatusRecord::heftSize() const {
    if (hasNoMemory()) return 0;
    if (!rssAnonSize || !rssShmemSize || !swapSize || !pageTableSize) return std::nullopt;
    return *rssAnonSize + *rssShmemSize + *swapSize + *pageTableSize + hugePageSize.value_or(0);
}

std::optional<uint64_t> HXStatusRecord::peakHeftSize() const {
    const auto size = heftSize();
    if (!size || !peakResidentSize || !pageTableSize) return size;
    return std::max(*size, *peakResidentSize + *pageTableSize + hugePageSize.value_or(0));
}

HXStatusRecord HXParseStatus(std::string_view text) {
    // The name of the process comes first, newlines escaped; no line of it can begin with a label.
    static constexpr HXLabelledFigure<HXStatusRecord> figures[] = {
        {"RssAnon:", &HXStatusRecord::rssAnonSize},       {"RssShmem:", &HXStatusRecord::rssShmemSize},
        {"VmSwap:", &HXStatusRecord::swapSize},           {"VmPTE:", &HXStatusRecord::pageTableSize},
        {"VmHWM:", &HXStatusRecord::peakResidentSize},    {"VmRSS:", &HXStatusRecord::residentSize},
        {"HugetlbPages:", &HXStatusRecord::hugePageSize}, {"VmLck:", &HXStatusRecord::lockedSize},
        {"Threads:", &HXStatusRecord::threadCount, 1},
    };
    return HXParseLabelledFigures(text, figures);
}

std::optional<uint64_t> HXParseLabelled(std::string_view text, std::string_view label) {
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        HXTextCursor line{cursor.line()};
        uint64_t value = 0;
        if (line.skip(label) && line.field(&value)) return value;
    }
    return std::nullopt;
}

void HXParseMountInfo(std::string_view text, const std::function<void(const HXMount &mount)> &each) {
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        // ID PARENT MAJOR:MINOR ROOT POINT OPTIONS [TAG…] - TYPE SOURCE OPTIONS; blanks in paths are escaped.
        HXTextCursor line{cursor.line()};
        HXMount mount{};
        uint32_t major = 0, minor = 0;
        if (!line.number(&mount.identifier) || line.word().empty()) continue;
        if (!line.field(&major) || !line.skip(':') || !line.number(&minor)) continue;
        mount.device = HXDeviceNumber(major, minor);
        line.word();
        mount.point = line.word();
        const size_t separator = line.rest.find(" - ");
        if (separator == std::string_view::npos) continue;
        line.rest.remove_prefix(separator + 3);
        mount.type = line.word();
        line.word();
        mount.options = line.word();
        each(mount);
    }
}

std::optional<uint64_t> HXParseStackPointer(std::string_view text) {
    // "running", "-1 SP PC" or "NUMBER ARG1 … ARG6 SP PC", addresses with 0x.
    HXTextCursor line{text};
    line.lastWord();
    HXTextCursor pointer{line.lastWord()};
    uint64_t address = 0;
    if (!pointer.skip("0x") || !HXIsNumber(pointer.rest, &address, 16)) return std::nullopt;
    return address;
}
