// The record of a process read from a memory-graph file, written earlier and perhaps on another machine. It
// goes through the pipeline of a live process; only the sources of the data differ.
#pragma once

#include "model/HXError.h"
#include "platform/capture/GXProcessObjectGraph.h"
#include "process/HXUserProcess.h"

#include <memory>
#include <string>

class HXMemgraphProcess : public HXUserProcess {
  public:
    // Reads the file at `path`; null with *error (may be null) set.
    static std::unique_ptr<HXMemgraphProcess> processWithMemgraph(const std::string &path, HXError *error);

    // Whether the graph was gathered with the heft breakdown, whatever the run's mode.
    bool breakDownPhysHeft() const override { return _graph->showsPhysHeft(); }
    void enumerateRegions(const HXRegionCallback &callback) override;

  protected:
    bool _populateTask(HXProcessSnapshot *) override { return true; }
    bool _isAlive() const override { return false; }
    uint32_t _gatherPageSize() override { return _graph->vmPageSize(); }
    bool _hostHasSharedRegion() const override { return _graph->hasSharedRegion(); }
    void _gatherPhysHeft() override;

  private:
    bool initWithMemgraph(const std::string &path, HXError *error);
    vm_region_submap_info_64 infoOfRegion(const GXVMRegion &region) const;
    void takeImage(const GXVMRegion &region, HXImage &pending);

    std::unique_ptr<GXProcessObjectGraph> _graph;
};

// The platform code that a graph's description names.
HXSharedRegionPlatform HXPlatformOfDescription(const std::string &description);
