// The short files of a process, read through its directory in /proc.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/procfs/HXProcText.h"

#include <optional>

// None when the process is gone, or its text is no stat line.
std::optional<HXStatRecord> HXReadStat(const HXDescriptor &process);

// None with errno set, as for a text that is cut (EIO).
std::optional<HXStatusRecord> HXReadStatus(const HXDescriptor &process);
