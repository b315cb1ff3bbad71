// The records of memory-graph files. docs/formats.md says what each field means.
#pragma once

#include "platform/capture/HXCaptureFormat.h"

namespace HXMemgraphFormat {

enum Record : size_t { regionRecord, processRecord };

// The fields that the program names, in the order of their tables in HXMemgraphFormat.cpp.
namespace Region {
enum Field : size_t { address, length, type, path };
}
namespace Process {
enum Field : size_t { pid, name, description };
}

extern const HXCaptureFormat format;

} // namespace HXMemgraphFormat
