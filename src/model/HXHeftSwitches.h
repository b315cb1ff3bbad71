// The switches that hold for the whole run.
#pragma once

// Set on the main thread before gathering starts; any thread may read them.
class HXHeftSwitches {
  public:
    // Whether the kernel reports each region's dirty size as its share of the process's heft. Asks the kernel
    // ("vm.self_region_heft") once after each change; a kernel without the setting reads as false.
    static bool breakDownPhysHeft();
    static void setBreakDownPhysHeft(bool breakDown);

    // Whether regions are merged without recording which process contributed them: no per-process views then.
    static bool isSharingAnalysisDisabled();
    static void setSharingAnalysisDisabled(bool disabled);

    // Whether all processes of the machine are examined, so that what none of them holds nobody does.
    static bool examinesWholeMachine();
    static void setExaminesWholeMachine(bool whole);
};
