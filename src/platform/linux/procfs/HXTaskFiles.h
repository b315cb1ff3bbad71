// The short files of a process, read through its directory in /proc.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"

#include <optional>

// None when the process is gone, or its text is no stat line.
std::optional<HXStatRecord> HXReadStat(const HXDescriptor &process);

// The number in the link of a namespace, ns/NAME; 0 when it cannot be read.
uint64_t HXReadNamespace(const HXDescriptor &process, const char *link);

// None with errno set, as for a text that is cut (EIO).
std::optional<HXStatusRecord> HXReadStatus(const HXDescriptor &process);
