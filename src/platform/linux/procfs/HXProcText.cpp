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
    cursor.skipBlanks();
    if (!cursor.number(&record.ppid)) return std::nullopt;
    // Fields are numbered as in proc(5); the fourth, ppid, has just been read.
    for (int field = 5; field <= 28; field++) {
        cursor.skipBlanks();
        bool found = true;
        switch (field) {
        case 5: {
            int32_t group = 0;
            found = cursor.number(&group);
            record.pgid = static_cast<uint32_t>(group);
            break;
        }
        case 9:
            found = cursor.number(&record.flags);
            break;
        case 20:
            found = cursor.number(&record.threadCount);
            break;
        case 22:
            found = cursor.number(&record.startTime);
            break;
        case 28:
            found = cursor.number(&record.startStack);
            break;
        default:
            cursor.word();
        }
        if (!found) return std::nullopt;
    }
    return record;
}

uint64_t HXStatusRecord::peakHeftSize() const {
    return std::max(heftSize(), peakResidentSize + pageTableSize + hugePageSize);
}

HXStatusRecord HXParseStatus(std::string_view text) {
    static constexpr struct {
        std::string_view label;
        uint64_t HXStatusRecord::*field;
        uint64_t unitSize;
    } fields[] = {
        {"RssAnon:", &HXStatusRecord::rssAnonSize, 1024},
        {"RssShmem:", &HXStatusRecord::rssShmemSize, 1024},
        {"VmSwap:", &HXStatusRecord::swapSize, 1024},
        {"VmPTE:", &HXStatusRecord::pageTableSize, 1024},
        {"VmHWM:", &HXStatusRecord::peakResidentSize, 1024},
        {"HugetlbPages:", &HXStatusRecord::hugePageSize, 1024},
        {"Threads:", &HXStatusRecord::threadCount, 1},
        {"VmRSS:", &HXStatusRecord::residentSize, 1024},
        {"VmLck:", &HXStatusRecord::lockedSize, 1024},
    };
    HXStatusRecord record;
    HXTextCursor cursor{text};
    while (!cursor.rest.empty()) {
        HXTextCursor line{cursor.line()};
        // The name of the process comes first, newlines escaped; no line of it can begin with a label.
        for (const auto &field : fields) {
            if (!line.rest.starts_with(field.label)) continue;
            line.rest.remove_prefix(field.label.size());
            line.skipBlanks();
            uint64_t value = 0;
            if (line.number(&value)) record.*field.field = value * field.unitSize;
            break;
        }
    }
    return record;
}

std::optional<uint64_t> HXParseLabelled(std::string_view text, std::string_view label) {
    HXTextCursor cursor{text};
    while (!cursor.rest.empty()) {
        HXTextCursor line{cursor.line()};
        if (!line.rest.starts_with(label)) continue;
        line.rest.remove_prefix(label.size());
        line.skipBlanks();
        uint64_t value = 0;
        if (line.number(&value)) return value;
    }
    return std::nullopt;
}

void HXParseMountInfo(std::string_view text,
                      const std::function<void(uint32_t device, std::string_view type)> &each) {
    HXTextCursor cursor{text};
    while (!cursor.rest.empty()) {
        // ID PARENT MAJOR:MINOR ROOT POINT OPTIONS [TAG…] - TYPE SOURCE OPTIONS; blanks in paths are escaped.
        HXTextCursor line{cursor.line()};
        line.word();
        line.word();
        line.skipBlanks();
        uint32_t major = 0;
        uint32_t minor = 0;
        if (!line.number(&major) || !line.skip(':') || !line.number(&minor)) continue;
        const size_t separator = line.rest.find(" - ");
        if (separator == std::string_view::npos) continue;
        line.rest.remove_prefix(separator + 3);
        each(HXDeviceNumber(major, minor), line.word());
    }
}

namespace {

template <typename Word>
std::optional<HXAuxiliaryVector> parseEntries(std::string_view bytes) {
    constexpr Word nullType = 0, execFileNameType = 31; // AT_NULL, AT_EXECFN
    HXAuxiliaryVector vector;
    vector.is64bit = sizeof(Word) == 8;
    Word entry[2];
    bool any = false;
    for (; bytes.size() >= sizeof entry; bytes.remove_prefix(sizeof entry)) {
        std::memcpy(entry, bytes.data(), sizeof entry);
        if (entry[0] == nullType) break;
        any = true;
        if (entry[0] == execFileNameType) vector.execFileName = entry[1];
    }
    if (!any) return std::nullopt;
    return vector;
}

} // namespace

std::optional<HXAuxiliaryVector> HXParseAuxiliaryVector(std::string_view bytes) {
    uint64_t first = 0;
    if (bytes.size() < sizeof first) return std::nullopt;
    std::memcpy(&first, bytes.data(), sizeof first);
    // A 32-bit process has a small type and its value in what reads as the first 64-bit word.
    if (first > UINT32_MAX) return parseEntries<uint32_t>(bytes);
    return parseEntries<uint64_t>(bytes);
}

std::vector<std::string_view> HXSplitArguments(std::string_view text) {
    std::vector<std::string_view> arguments;
    while (!text.empty()) {
        const size_t end = std::min(text.find('\0'), text.size());
        arguments.push_back(text.substr(0, end));
        text.remove_prefix(std::min(end + 1, text.size()));
    }
    return arguments;
}

std::optional<uint64_t> HXParseStackPointer(std::string_view text) {
    // "running", "-1 SP PC" or "NUMBER ARG1 … ARG6 SP PC", addresses with 0x.
    while (!text.empty() && (text.back() == '\n' || text.back() == ' '))
        text.remove_suffix(1);
    const size_t pc = text.rfind(' ');
    if (pc == std::string_view::npos) return std::nullopt;
    text = text.substr(0, pc);
    const size_t sp = text.rfind(' ');
    if (sp == std::string_view::npos || !text.substr(sp + 1).starts_with("0x")) return std::nullopt;
    HXTextCursor cursor{text.substr(sp + 3)};
    uint64_t address = 0;
    if (!cursor.number(&address, 16) || !cursor.rest.empty()) return std::nullopt;
    return address;
}

std::string_view HXBaseName(std::string_view path) {
    const size_t slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}
