// The command line's own files and the option scanner, as HXPlatform tells them.
#pragma once

#include "platform/HXPlatform.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

HXOptionScan HXScanOption(int argc, char *const argv[], const char *shortOptions,
                          const std::vector<HXLongOption> &options, bool restart);
std::optional<std::string> HXReadRegularFile(const std::string &path, uint64_t limit);
// The first `bytes` of one.
std::optional<std::string> HXReadRegularFileStart(const std::string &path, size_t bytes);
std::optional<HXPendingFile> HXBeginPendingFile(const std::string &path);
bool HXCommitPendingFile(HXPendingFile &file);
void HXDiscardPendingFile(HXPendingFile &file);
