// Writes the memory graph of a live process.
#pragma once

#include "platform/HXHostGuards.h"
#include "platform/capture/GXProcessObjectGraph.h"
#include "platform/capture/HXCaptureWriter.h"

#include <cstdio>
#include <functional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

class HXMemgraphRecorder {
  public:
    // What the program calls memory of a user tag.
    using CategoryName = std::function<std::string(uint32_t tag)>;

    // What to record: the process `pid` under `name`, with the heft breakdown or else with what the memory
    // objects see.
    struct Subject {
        int32_t pid;
        std::string name;
        bool breakDownPhysHeft;
    };
    // Writes the graph to `out`, which stays the caller's, of a process of the current platform. The setting
    // "vm.self_region_heft" is changed meanwhile and then put back, unless the process does not answer. False
    // with the reason when the process cannot be examined, vanishes meanwhile or does not answer, or when
    // writing fails.
    static bool record(HXPlatform &host, std::FILE *out, CategoryName categoryName, const Subject &subject,
                       std::string *reason);

    // For `record`.
    HXMemgraphRecorder(HXPlatform &host, CategoryName categoryName);

  private:
    struct Segment {
        uint64_t start;
        uint64_t end;
        std::string name;
        std::string path;
    };

    void gather(const Subject &subject);
    void recordProcess(const Subject &subject, const proc_bsdinfo &info);
    void gatherImages();
    void recordRegions(int32_t pid, uint64_t pageTableBytes);
    void recordRegion(int32_t pid, uint64_t address, uint64_t size, const vm_region_submap_info_64 &info);
    void recordPageTable(uint64_t address, uint64_t size);
    void writeRegion(const GXVMRegion &region);
    const Segment *nextSegment(uint64_t start, uint64_t end);
    uint32_t graphObjectID(uint64_t fullID, uint32_t preferred);
    uint32_t freeObjectID(uint32_t preferred);

    HXPlatform &_host;
    HXTaskPort _task; // of the process being recorded
    const CategoryName _categoryName;
    const uint32_t _pageSize;
    std::vector<Segment> _segments; // by start
    size_t _segmentCursor = 0;
    std::unordered_map<uint64_t, uint32_t> _objectIDs; // of the graph, by full id
    std::unordered_set<uint32_t> _takenObjectIDs;
    HXCaptureWriter _writer;
    std::string _reason; // why there is no graph; empty when there is one
};
