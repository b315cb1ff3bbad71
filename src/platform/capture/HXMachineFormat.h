// The records of machine files. docs/formats.md says what each field means.
#pragma once

#include "platform/capture/HXCaptureFormat.h"
#include "platform/capture/HXRegionFields.h"

namespace HXMachineFormat {

// Those before `processRecord` are of a process that had its own before; their first field is its pid.
enum Record : size_t {
    regionRecord,
    topRecord,
    pagesRecord,
    shareRecord,
    imageRecord,
    segmentRecord,
    ownedRecord,
    heldRecord,
    faultRecord,
    processRecord,
    zoneRecord,
    siteRecord,
    kextRecord,
    symbolRecord,
    tagRecord,
    hostRecord,
};

// The fields of each record that have no place of their own in a record of the program, in the order of its
// table in HXMachineFormat.cpp. Those that do come after them.
namespace Region {
enum Field : size_t {
    pid,
    address,
    size,
    firstNumber,
    fullObjectID = firstNumber + HXRegionFieldCount<&HXRegionField::machine>(),
    dirtiedObject,
    purge,
    path,
    pages,
    shortRecord,
    heftOnly,
};
}
namespace Top {
enum Field : size_t { pid, address, size };
}
namespace Pages {
enum Field : size_t { pid, pages };
}
namespace Process {
enum Field : size_t { pid, comm, name, argsPath, dirtyFlags, heft, pageTable, pageTableObject };
}
namespace Image {
enum Field : size_t { pid, path, base };
}
namespace Segment {
enum Field : size_t { pid, name, start, size };
}
namespace Held {
enum Field : size_t { pid, name, detail };
}
namespace Fault {
enum Field : size_t { pid, call, from, error, becomes };
}
namespace ZoneOrSite {
enum Field : size_t { name };
}
namespace Kext {
enum Field : size_t { loadTag, bundleID };
}
namespace Symbol {
enum Field : size_t { address, size, name, path, line };
}
namespace Tag {
enum Field : size_t { tag, name };
}
namespace Host {
enum Field : size_t { selfRegionHeft, ledger };
}

// Region sizes above which a region can carry no page dispositions.
inline constexpr uint64_t kMaxPagesRegionSize = uint64_t{1} << 36;

extern const HXCaptureFormat format;

} // namespace HXMachineFormat
