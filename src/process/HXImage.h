// One segment of one loaded image.
#pragma once

#include "model/HXMemoryRegion.h"
#include "model/HXString.h"

#include <cstdint>

class HXImage {
  public:
    // The kind of segment, derived from the name; unset until a name tells.
    HXSegment segment() const { return _segment; }
    HXString name() const { return _name; }
    // Stores the name, and the segment code where the name tells one.
    void setName(HXString name);
    // Path of the image that holds the segment; may be none.
    HXString ownerPath() const { return _ownerPath; }
    void setOwnerPath(HXString path) { _ownerPath = path; }
    uint64_t start() const { return _start; }
    void setStart(uint64_t start) { _start = start; }
    // Bytes.
    uint64_t size() const { return _size; }
    void setSize(uint64_t size) { _size = size; }
    uint64_t end() const { return _start + _size; }

  private:
    HXSegment _segment = HXSegmentUnset;
    HXString _name;
    HXString _ownerPath;
    uint64_t _start = 0;
    uint64_t _size = 0;
};
