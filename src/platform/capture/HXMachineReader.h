// Builds a machine from the records of a machine file.
#pragma once

#include "platform/capture/HXCaptureReader.h"
#include "platform/capture/HXMachine.h"

// One load. Every record is checked against those before it as it comes; the first that breaks the form ends
// the load.
class HXMachineReader {
  public:
    HXMachineReader(HXCaptureReader &reader, HXMachine &machine) : _reader(reader), _machine(machine) {}

    // Reads all records; false when the reader has failed.
    bool read();

  private:
    using Handler = bool (HXMachineReader::*)();
    static const Handler handlers[];

    bool readRegion();
    bool readTop();
    bool readPages();
    bool readProcess();
    bool readImage();
    bool readSegment();
    bool readOwned();
    bool readShare();
    bool readHeld();
    bool readFault();
    bool readZone();
    bool readSite();
    bool readKext();
    bool readSymbol();
    bool readTag();
    bool readHost();

    bool findProcess();
    bool checkMapping(uint64_t address, uint64_t size, uint64_t previousEnd);
    void keepNumbers(HXMachineRegion &region);
    bool addPageRuns(HXMachineRegion &region, std::string_view text);

    uint32_t number32(size_t field) const { return static_cast<uint32_t>(_reader.number(field)); }
    int32_t signed32(size_t field) const { return static_cast<int32_t>(_reader.number(field)); }
    // A text made safe and cut to `bytes`; the second form for names of processes and of kernel records.
    std::string safeText(size_t field, size_t bytes = SIZE_MAX) const;
    std::string safeName(size_t field, size_t bytes = SIZE_MAX) const;
    // The string's number, kNoString without the field.
    uint32_t internText(size_t field, size_t bytes = SIZE_MAX);
    uint32_t internName(size_t field, size_t bytes = SIZE_MAX);

    HXCaptureReader &_reader;
    HXMachine &_machine;
    HXMachineProcess *_process = nullptr; // of the current record
    std::map<HXMachineRegionTraits, uint32_t> _traits;
    bool _hasHost = false;
    bool _hasRecords = false;
};
