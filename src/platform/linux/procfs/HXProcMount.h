// How /proc is mounted, which decides of whom it tells (proc(5)).
#pragma once

#include <optional>
#include <string>
#include <string_view>

// Whether a proc file system, or something like one, lies at `procPath`.
bool HXIsProcMounted(const std::string &procPath);

// Whether /proc, mounted at `procPath`, leaves out processes of others (`hidepid`), by the text of mountinfo
// and by the status of whoever asks.
bool HXHidesProcesses(std::string_view mountinfo, std::string_view status, std::string_view procPath);

// Why `procPath` does not tell of processes, for a message; none when it does. `ofAll`: also why not of all.
std::optional<std::string> HXProcessesNotTold(const std::string &procPath, bool ofAll);
