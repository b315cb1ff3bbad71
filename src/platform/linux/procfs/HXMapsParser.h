// Parser of /proc/PID/maps and /proc/PID/smaps, given in pieces as they are read. It touches no system.
#pragma once

#include "platform/linux/procfs/HXMapping.h"

#include <cstdint>
#include <string_view>

// One parsed mapping; `path` is as the kernel wrote it and lives in the text.
struct HXMapsEntry {
    HXMapping mapping;
    std::string_view path;
};

class HXMapsParser {
  public:
    // `pageShift`: the page size's logarithm, at least 10.
    explicit HXMapsParser(uint32_t pageShift) : _kilobyteShift(pageShift - 10) {}

    // Takes the next mapping off the front of *text. False when the text does not hold the whole of it: the
    // rest then belongs before the next piece. `complete`: nothing follows the text. Lines that are no
    // mapping are passed over.
    bool next(std::string_view *text, bool complete, HXMapsEntry *entry);

  private:
    // Where smaps' fields lie behind the first line of a mapping: the same for all mappings of a kernel as
    // long as no number outgrows its column, which lets all other lines go unread.
    struct Column {
        uint16_t position;
        uint8_t field;
    };
    static constexpr size_t maximumColumns = 8; // as many as fields

    bool parseFields(std::string_view *text, bool complete, HXMapping *mapping);
    bool parseColumns(std::string_view *text, HXMapping *mapping) const;
    void learn(std::string_view fields, size_t flagsPosition);
    void setField(size_t field, uint64_t kilobytes, HXMapping *mapping) const;

    const uint32_t _kilobyteShift;
    Column _columns[maximumColumns];
    uint32_t _columnCount = 0;
    uint32_t _flagsPosition = 0; // 0: nothing learned
};

// smaps' VmFlags, blank-separated, as HXMappingFlag.
uint16_t HXParseMappingFlags(std::string_view text);
