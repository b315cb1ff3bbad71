// Reads whole files of /proc and /sys, whose length is not known before they have been read.
#pragma once

#include <optional>
#include <string>

// The content of the file at `path`; none with the errno in *error when it can't be opened or read. Meant for
// the kernel's own files only: it would wait on a fifo.
std::optional<std::string> HXReadKernelFile(const std::string &path, int *error);
// The same, where it does not matter why a file is missing: then empty.
std::string HXReadKernelFile(const std::string &path);
