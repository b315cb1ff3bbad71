// Records one process of a host as records of a machine file.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/capture/HXCaptureWriter.h"
#include "record/HXAnonymizer.h"
#include "record/HXRegionHeftSetting.h"

#include <optional>
#include <set>
#include <string>
#include <vector>

class HXProcessRecorder {
  public:
    // `anonymizer` may be null: names are then kept. `pageTableIndex` is the place of "page_table" among
    // `ledgerCount` ledger entries, none when the host has no such entry.
    HXProcessRecorder(HXPlatform &host, HXRegionHeftSetting &setting, HXAnonymizer *anonymizer,
                      std::optional<size_t> pageTableIndex, size_t ledgerCount);

    // Asks for all that an analysis of the process would, in both analysis modes. Its records are then in
    // `head` (the process) and `body` (its memory), to be written in that order. False, with why in
    // `problem`, when the process vanished meanwhile or its memory could not be walked to the end.
    bool record(int32_t pid, bool listed);

    const std::string &head() const { return _head.written(); }
    const std::string &body() const { return _body.written(); }
    const std::string &problem() const { return _problem; }
    // The user tags of all regions recorded so far.
    const std::set<uint32_t> &tags() const { return _tags; }

  private:
    bool fail(const std::string &problem);
    bool recordProcess(int32_t pid, bool listed);
    void recordFigures(int32_t pid);
    void recordArguments(int32_t pid);
    void readAtOnce();
    bool recordMemory(int32_t pid);
    bool recordRegions(int32_t pid);
    void recordRegion(int32_t pid, uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                      uint32_t words);
    void recordRegionObject(uint64_t address, uint64_t size, const vm_region_submap_info_64 &info);
    void recordTops(int32_t pid);
    bool topsDiffer();
    void recordImages(int32_t pid);
    void recordOwned(int32_t pid);
    bool isPageQueried(uint64_t size, const vm_region_submap_info_64 &info) const;
    std::optional<std::vector<std::string>> pageRuns(uint64_t address, uint64_t size);
    std::string pathName(std::string_view path);
    std::string programName(std::string_view name);

    HXPlatform &_host;
    HXRegionHeftSetting &_setting;
    HXAnonymizer *const _anonymizer;
    const std::optional<size_t> _pageTableIndex;
    const size_t _ledgerCount;
    const uint32_t _pageSize;
    std::vector<char> _argumentArea;
    std::vector<int32_t> _dispositions;

    mach_port_t _task = 0;
    bool _ownedNone = false;
    int _ownedError = 0;
    HXCaptureWriter _head, _body;
    std::set<uint32_t> _tags;
    std::string _problem;
};
