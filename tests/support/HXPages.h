// Answers of page queries, page by page.
#pragma once

#include "platform/HXPlatform.h"

#include <cstdint>
#include <vector>

// The dispositions of the pages of [address, address + bytes), by as many queries as the host wants; of the
// pages before the first that cannot be told of, with its error.
kern_return_t HXPagesOf(HXPlatform &host, mach_port_t task, uint64_t address, uint64_t bytes,
                        std::vector<int32_t> *dispositions);
