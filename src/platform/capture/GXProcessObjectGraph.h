// A memory graph: one process's facts and regions, as a file written earlier holds them.
#pragma once

#include "platform/HXRegionTags.h"
#include "platform/capture/HXStringTable.h"

#include <cstdint>
#include <cstdio>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

class HXCaptureReader;

// One region. Sizes are in bytes; the texts live as long as the graph.
struct GXVMRegion {
    uint64_t address;
    uint64_t length;
    std::string_view type;
    std::optional<std::string_view> path;
    uint64_t offset;
    uint64_t resident_size;
    uint64_t shared_now_private_size;
    uint64_t swapped_out_size;
    uint64_t dirty_size;
    uint64_t reusable_size;
    int32_t prot;
    int32_t maxProt;
    uint32_t user_tag;
    uint32_t ref_count;
    uint32_t is_submap;
    uint32_t object_id;
    int32_t purgeable;
    uint8_t external_pager;
    uint8_t share_mode;
};

// The numbers of the process.
struct GXProcessFacts {
    int32_t pid = 0;
    uint32_t pageSize = 0;         // bytes
    uint64_t physicalHeft = 0;     // bytes
    uint64_t physicalHeftPeak = 0; // bytes
    bool is64bit = true;
    bool showsPhysHeft = true;   // gathered with the heft breakdown
    bool hasSharedRegion = true; // on a host that has a shared region at all
};

class GXProcessObjectGraph {
  public:
    // The graph that a memory-graph file describes; null with the reason when it breaks the form, is too long
    // for any graph or cannot be read. The stream is read on from where it is, in pieces, and stays open.
    // Tags that programs name become those that `tags` has for the names.
    static std::unique_ptr<GXProcessObjectGraph> directedGraphWithStream(std::FILE *stream, HXNamedTags &tags,
                                                                         std::string *reason);
    // The same from a file's content, which is not needed afterwards.
    static std::unique_ptr<GXProcessObjectGraph>
    directedGraphWithData(std::string_view data, HXNamedTags &tags, std::string *reason);

    int32_t pid() const { return _facts.pid; }
    const std::string &processName() const { return _processName; }
    // Names the machine architecture.
    const std::string &processDescriptionString() const { return _description; }
    bool is64bit() const { return _facts.is64bit; }
    uint32_t vmPageSize() const { return _facts.pageSize; } // bytes
    uint64_t physicalHeft() const { return _facts.physicalHeft; }
    uint64_t physicalHeftPeak() const { return _facts.physicalHeftPeak; }
    // Whether the graph was gathered with the heft breakdown.
    bool showsPhysHeft() const { return _facts.showsPhysHeft; }
    // Whether the host that it was written on has a shared region at all.
    bool hasSharedRegion() const { return _facts.hasSharedRegion; }

    // Calls `each` for the regions in the graph's order until it sets *stop.
    void enumerateRegionsWithBlock(const std::function<void(const GXVMRegion &, bool *stop)> &each) const;

  private:
    static std::unique_ptr<GXProcessObjectGraph> graphOf(HXCaptureReader &&reader, HXNamedTags &tags,
                                                         std::string *reason);
    bool read(HXCaptureReader &reader, HXNamedTags &tags);
    bool readProcess(HXCaptureReader &reader);
    bool readRegion(HXCaptureReader &reader, HXNamedTags &tags);
    std::string_view intern(std::string_view text);

    bool _hasProcess = false;
    GXProcessFacts _facts;
    std::string _processName;
    std::string _description;
    std::deque<GXVMRegion> _regions; // ascending, without overlap
    HXStringTable _strings;
};
