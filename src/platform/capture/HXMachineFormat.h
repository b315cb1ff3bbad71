// The records of machine files. docs/formats.md says what each field means.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

namespace HXMachineFormat {

enum Record : size_t {
    regionRecord,
    topRecord,
    pagesRecord,
    processRecord,
    imageRecord,
    segmentRecord,
    ownedRecord,
    faultRecord,
    zoneRecord,
    siteRecord,
    kextRecord,
    symbolRecord,
    tagRecord,
    hostRecord,
};

// The fields of each record, in the order of its table in HXMachineFormat.cpp.
namespace Region {
enum Field : size_t {
    pid,
    address,
    size,
    prot,
    maxProt,
    inheritance,
    offset,
    tag,
    resident,
    sharedNowPrivate,
    swapped,
    dirtied,
    reusable,
    dirtiedObject,
    refs,
    shadowDepth,
    pager,
    shareMode,
    behavior,
    objectID,
    fullObjectID,
    shortRecord,
    wired,
    purge,
    path,
    heftOnly,
    pages,
};
}
namespace Top {
enum Field : size_t { pid, address, size, prot, maxProt, inheritance, offset, behavior, wired };
}
namespace Pages {
enum Field : size_t { pid, pages };
}
namespace Process {
enum Field : size_t {
    pid,
    ppid,
    flags,
    comm,
    name,
    status,
    listed,
    readable,
    argsPath,
    argc,
    taskError,
    dirtyFlags,
    heft,
    heftPeak,
    pageTable,
    ownedError,
    ownedNone,
};
}
namespace Image {
enum Field : size_t { pid, path, base };
}
namespace Segment {
enum Field : size_t { pid, name, start, size };
}
namespace Owned {
enum Field : size_t { pid, objectID, virtualSize, resident, wired, reusable, compressed, flags };
}
namespace Fault {
enum Field : size_t { pid, call, from, error, becomes };
}
namespace Zone {
enum Field : size_t { name, count, curSize, elemSize, collectable };
}
namespace Site {
enum Field : size_t { flags, site, size, mapped, tag, zone, name };
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
enum Field : size_t {
    pageSize,
    argMax,
    pid,
    euid,
    selfRegionHeft,
    sharedRegion,
    listPidsError,
    ledger,
    memoryInfoError,
};
}

// Region sizes above which a region can carry no page dispositions.
inline constexpr uint64_t kMaxPagesRegionSize = uint64_t{1} << 36;

extern const HXCaptureFormat format;

} // namespace HXMachineFormat
