// Records one process of a host as records of a machine file.
#pragma once

#include "platform/HXHostGuards.h"
#include "platform/capture/HXCaptureWriter.h"
#include "platform/capture/HXMachine.h"
#include "record/HXAnonymizer.h"
#include "record/HXRegionHeftSetting.h"

#include <atomic>
#include <optional>
#include <set>
#include <string>
#include <vector>

// A record of what the process of that pid, 0 for the kernel, holds.
void HXRecordHeld(const task_held_object &object, int32_t pid, HXCaptureWriter *writer);

class HXProcessRecorder {
  public:
    // `facts` are those of the host. `anonymizer` may be null: names are then kept. Neither it nor `setting`
    // is used after `abandon`.
    HXProcessRecorder(HXPlatform &host, const HXMachineHost &facts, HXRegionHeftSetting &setting,
                      HXAnonymizer *anonymizer);

    // Asks for all that an analysis of the process would, in both analysis modes. Its records are then in
    // `task`: the process's, or none with the error of opening it. Its records are then in
    // `head` (the process) and `body` (its memory), to be written in that order. False, with why in
    // `problem`, when the process vanished meanwhile or its memory could not be walked to the end.
    bool record(int32_t pid, bool listed, HXTaskPort task, kern_return_t taskError);

    // For a `record` that does not return: when it goes on after all, on its thread, it leaves alone what
    // others use. Its answers mean nothing then.
    void abandon() { _isAbandoned = true; }

    const std::string &head() const { return _head.written(); }
    const std::string &body() const { return _body.written(); }
    const std::string &problem() const { return _problem; }
    // The user tags of all regions recorded so far.
    const std::set<uint32_t> &tags() const { return _tags; }

  private:
    bool fail(const std::string &problem);
    bool recordProcess(int32_t pid, bool listed);
    bool exists(int32_t pid);
    void recordFigures(int32_t pid);
    void recordArguments(int32_t pid);
    void readAtOnce();
    bool recordMemory(int32_t pid);
    bool recordRegions(int32_t pid);
    void recordRegion(int32_t pid, uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                      uint32_t words);
    void recordPages(int32_t pid, uint64_t address, uint64_t size);
    void recordShares(int32_t pid, uint64_t address);
    std::optional<uint32_t> pagesDirtiedOfObject(uint64_t address, uint64_t size,
                                                 HXMachineRegionTraits *traits);
    bool nextTop(uint64_t *address, uint64_t *size, vm_region_basic_info_64 *top);
    void recordTops(int32_t pid);
    bool topsDiffer();
    void recordImages(int32_t pid);
    void recordOwned(int32_t pid);
    std::optional<std::vector<char>> ownedReply();
    bool isPageQueried(uint64_t size, const vm_region_submap_info_64 &info) const;
    std::optional<std::vector<std::string>> pageRuns(uint64_t address, uint64_t size);
    std::string pathName(std::string_view path);
    std::string programName(std::string_view name);
    void setSetting(int32_t value);

    HXPlatform &_host;
    const HXMachineHost _facts;
    HXTaskPort _task; // of the process being recorded
    kern_return_t _taskError = KERN_SUCCESS;
    HXRegionHeftSetting &_setting;
    const bool _hasSetting;
    HXAnonymizer *const _anonymizer;
    std::vector<char> _argumentArea;

    HXMachineProcess _process; // the numbers of the one being recorded
    HXCaptureWriter _head, _body;
    std::set<uint32_t> _tags;
    std::string _problem;
    std::atomic<bool> _isAbandoned = false;
};
