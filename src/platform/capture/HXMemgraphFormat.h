// The records of memory-graph files. docs/formats.md says what each field means.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

namespace HXMemgraphFormat {

enum Record : size_t { regionRecord, processRecord };

// The fields of each record, in the order of its table in HXMemgraphFormat.cpp.
namespace Region {
enum Field : size_t {
    address,
    length,
    type,
    path,
    prot,
    maxProt,
    offset,
    userTag,
    resident,
    sharedNowPrivate,
    swapped,
    dirty,
    reusable,
    refCount,
    externalPager,
    shareMode,
    isSubmap,
    objectID,
    purgeable,
};
}
namespace Process {
enum Field : size_t {
    pid,
    name,
    description,
    is64bit,
    pageSize,
    physHeft,
    physHeftPeak,
    showsPhysHeft,
    sharedRegion,
};
}

extern const HXCaptureFormat format;

} // namespace HXMemgraphFormat
