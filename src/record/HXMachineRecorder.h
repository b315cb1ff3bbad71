// Writes a machine file from any host.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/capture/HXCaptureWriter.h"
#include "platform/capture/HXMachine.h"
#include "process/HXProcessSnapshot.h"
#include "record/HXAnonymizer.h"
#include "record/HXRegionHeftSetting.h"

#include <cstdio>
#include <optional>
#include <set>
#include <string>
#include <vector>

// Holds at most one process's records in memory. The setting "vm.self_region_heft" is changed meanwhile and
// then put back.
class HXMachineRecorder {
  public:
    // Writes to `out`, which stays the caller's.
    HXMachineRecorder(HXPlatform &host, std::FILE *out, bool anonymize);

    // Records the host and the processes of `pids`, or all but the recording one. Processes that cannot be
    // recorded (they vanished meanwhile, or do not answer) are left out and said so on standard error; the
    // kernel's own memory is recorded with pid 0. False with errno set when writing failed.
    bool record(const std::vector<int32_t> &pids);

    // Whether anything was recorded, were it without memory.
    bool hasRecords() const { return _hasRecords; }
    // The processes recorded with their memory, and those that could not be opened for it; none that has
    // ended.
    size_t readCount() const { return _readCount; }
    size_t unreadableCount() const { return _unreadableCount; }
    bool hasKernelMemory() const { return _hasKernel && _facts.memoryInfoError == KERN_SUCCESS; }

  private:
    void recordHost(const std::optional<int32_t> &selfRegionHeft);
    void recordKernel();
    void recordSymbols(const std::set<uint64_t> &addresses);
    void recordHeldByKernel(bool isWholeMachine);
    void recordTags(const std::set<uint32_t> &tags);
    std::optional<std::vector<int32_t>> listedPids();
    std::set<int32_t> examineTogether(std::vector<int32_t> pids, HXRegionHeftSetting &setting,
                                      HXProcessSnapshot &tasks);
    bool recordProcesses(const std::vector<int32_t> &chosen, HXRegionHeftSetting &setting);
    bool write(const std::string &text);

    HXPlatform &_host;
    std::FILE *const _out;
    HXAnonymizer _anonymizer;
    const bool _anonymize;
    HXCaptureWriter _writer;
    HXMachineHost _facts;
    std::optional<std::vector<int32_t>> _listed; // none when the host cannot list its processes
    std::vector<int32_t> _sorted;
    std::set<uint32_t> _tags; // of all that was recorded
    bool _hasKernel = false;
    bool _hasRecords = false;
    size_t _readCount = 0;
    size_t _unreadableCount = 0;
};
