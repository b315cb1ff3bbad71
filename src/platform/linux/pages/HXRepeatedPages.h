// Pages that several mappings of one process show: an object that is mapped twice has its pages once.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/pages/HXPageReader.h"

#include <cstdint>

// Finds the pages of shared memory and of the huge-page pool that a mapping shows at the same offset of an
// object as one at a lower address, which alone is charged for them: tells them in `addressSpace` and counts
// them in its mappings. Only mappings that overlap have their pages read; those of a process that is gone
// stay as they are.
void HXFindRepeatedPages(uint32_t pageShift, HXPageReader *pages, HXAddressSpace *addressSpace);
